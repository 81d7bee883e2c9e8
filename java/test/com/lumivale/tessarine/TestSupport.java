package com.lumivale.tessarine;

import static org.junit.Assert.fail;

import java.io.IOException;
import java.nio.charset.StandardCharsets;
import java.nio.file.Files;
import java.nio.file.Path;
import java.util.ArrayList;
import java.util.Comparator;
import java.util.List;
import java.util.function.BooleanSupplier;
import java.util.stream.Stream;

/** What the Java tests share: waiting, temporary folders, reading cursors, an offline transport. */
final class TestSupport {
    private static final long DEADLINE_MILLIS = 60_000;

    private TestSupport() {}

    /** Waits until condition holds; fails the test past a generous deadline. */
    static void waitUntil(String what, BooleanSupplier condition) throws InterruptedException {
        long deadline = System.currentTimeMillis() + DEADLINE_MILLIS;
        while (!condition.getAsBoolean()) {
            if (System.currentTimeMillis() > deadline) fail("gave up waiting until " + what);
            Thread.sleep(5);
        }
    }

    static Path newFolder() throws IOException {
        return Files.createTempDirectory("tessarine-java-");
    }

    static void removeFolder(Path folder) throws IOException {
        try (Stream<Path> paths = Files.walk(folder)) {
            for (Path path : (Iterable<Path>) paths.sorted(Comparator.reverseOrder())::iterator) {
                Files.deleteIfExists(path);
            }
        }
    }

    static byte[] bytes(String text) {
        return text.getBytes(StandardCharsets.UTF_8);
    }

    static String text(byte[] blob) {
        return new String(blob, StandardCharsets.UTF_8);
    }

    /** "key=content/STATUS" for every object of the cursor, which it closes. */
    static List<String> rows(Cursor cursor) {
        List<String> rows = new ArrayList<>();
        try (cursor) {
            while (cursor.next()) {
                rows.add(cursor.getPrimaryKey() + "=" + text(cursor.getBlob()) + "/" + cursor.getStatus());
            }
        }
        return rows;
    }

    /** A transport whose connection never comes up: the store works offline. */
    static class OfflineTransport implements SyncTransport {
        @Override public void start(TransportEvents events) {}
        @Override public void sendSubscriptionRequest(SubscriptionRequest request) {}
        @Override public int sendDelta(SyncDelta delta) { return 0; }
        @Override public void sendSnapshotRequest(String collectionName, String clientId) {}
    }
}
