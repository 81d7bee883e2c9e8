package com.lumivale.tessarine;

import static com.lumivale.tessarine.TestSupport.bytes;
import static com.lumivale.tessarine.TestSupport.newFolder;
import static com.lumivale.tessarine.TestSupport.removeFolder;
import static com.lumivale.tessarine.TestSupport.rows;
import static com.lumivale.tessarine.TestSupport.waitUntil;
import static org.junit.Assert.assertEquals;
import static org.junit.Assert.assertTrue;

import com.lumivale.tessarine.server.LoopbackTransport;
import com.lumivale.tessarine.server.ReferenceServer;
import java.nio.file.Path;
import java.util.ArrayList;
import java.util.Collections;
import java.util.List;
import java.util.stream.Collectors;
import org.junit.Test;

/**
 * Two stores sync through the reference server end to end: one over a
 * transport written in Java (ServerLink), one over the native loopback
 * transport.
 */
public class SyncTest {
    private static final String NOTES = "app:Notes";
    private static final String WORKER = "tessarine-native";

    /** "key STATUS on thread" for every change a store's listener hears. */
    private static List<String> listen(Tessarine store) {
        List<String> heard = Collections.synchronizedList(new ArrayList<>());
        store.addChangeListener(changes -> {
            for (Change change : changes) {
                heard.add(change.getPrimaryKey() + " " + change.getStatus() + " on " + Thread.currentThread().getName());
            }
        });
        return heard;
    }

    // What was heard of key, sorted and without repeats: the store reports
    // SENT and PERSISTED from separate jobs, so when the server's echo follows
    // its acceptance closely PERSISTED may be heard first; and a change sent
    // twice (written while the connection was being reported, then resent)
    // is echoed, and so heard as PERSISTED, twice.
    private static List<String> about(List<String> heard, String key) {
        synchronized (heard) {
            return heard.stream().filter(line -> line.startsWith(key + " ")).sorted().distinct()
                .collect(Collectors.toList());
        }
    }

    private static boolean nativeThreadsAttached() {
        return Thread.getAllStackTraces().keySet().stream().anyMatch(thread -> thread.getName().equals(WORKER));
    }

    @Test
    public void storesOnJavaAndNativeTransportsConvergeAndListenersHearEveryStatusFromTheWorker() throws Exception {
        Path folder = newFolder();
        List<String> phoneHeard;
        List<String> tabletHeard;
        try (ReferenceServer server = new ReferenceServer();
             ServerLink link = new ServerLink(server);
             LoopbackTransport loopback = server.newLoopbackTransport(7);
             Tessarine phone = Tessarine.open(folder.resolve("phone.db").toString(), link);
             Tessarine tablet = Tessarine.open(folder.resolve("tablet.db").toString(), loopback)) {
            phoneHeard = listen(phone);
            tabletHeard = listen(tablet);
            phone.start();
            tablet.start();
            try (Collection phoneNotes = phone.subscribeCollection(NOTES);
                 Collection tabletNotes = tablet.subscribeCollection(NOTES)) {
                assertTrue(phoneNotes.save("n1", "1", bytes("Buy milk")));
                assertTrue(tabletNotes.save("n2", "2", bytes("Call Ana")));
                List<String> both = List.of("n1=Buy milk/PERSISTED", "n2=Call Ana/PERSISTED");
                waitUntil("both stores hold both notes, PERSISTED",
                          () -> rows(phoneNotes.query("", -1, SortDirection.ASCENDING)).equals(both)
                                && rows(tabletNotes.query("", -1, SortDirection.ASCENDING)).equals(both));

                // The tablet goes offline, writes, and sends the change once back.
                loopback.disconnect();
                assertTrue(tabletNotes.save("n3", "3", bytes("Water plants")));
                assertEquals(List.of("n3=Water plants/PENDING"), rows(tabletNotes.get("n3")));
                loopback.connect();
                waitUntil("the phone holds the tablet's offline note",
                          () -> rows(phoneNotes.get("n3")).equals(List.of("n3=Water plants/PERSISTED")));
                assertEquals(3, server.snapshot(NOTES).getObjects().size());
            }
        } finally {
            removeFolder(folder);
        }

        // A local write is heard on the writing thread, what the transports
        // report later on the store's worker (attached to the JVM for it).
        String writer = Thread.currentThread().getName();
        assertEquals(List.of("n1 PENDING on " + writer, "n1 PERSISTED on " + WORKER, "n1 SENT on " + WORKER),
                     about(phoneHeard, "n1"));
        assertEquals(List.of("n2 PENDING on " + writer, "n2 PERSISTED on " + WORKER, "n2 SENT on " + WORKER),
                     about(tabletHeard, "n2"));
        assertEquals(List.of("n1 PERSISTED on " + WORKER), about(tabletHeard, "n1"));
        assertEquals(List.of("n3 PERSISTED on " + WORKER), about(phoneHeard, "n3"));
        // Every native thread that called into Java (the workers, the
        // loopback transport's delivery thread) detached when it ended.
        waitUntil("no native thread is attached any more", () -> !nativeThreadsAttached());
    }
}
