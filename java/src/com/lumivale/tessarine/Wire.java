package com.lumivale.tessarine;

import java.util.Arrays;
import java.util.Collections;
import java.util.List;
import java.util.Objects;

/**
 * The server's wire payloads, for a {@link SyncTransport}: build the bytes to
 * publish on each topic, and read the server payloads the connection
 * receives. A payload that is not valid gives TessarineException (its reason
 * is logged); any bytes at all may be passed.
 */
public final class Wire {
    static {
        NativeLibrary.load();
    }

    public static final String TOPIC_CHANGE_RECORD = nativeTopic(0);
    public static final String TOPIC_SUBSCRIBE_COLLECTION = nativeTopic(1);
    public static final String TOPIC_SNAPSHOT = nativeTopic(2);

    /** One server payload: a delta list or a snapshot. */
    public static final class ServerMessage {
        private final List<SyncDelta> deltas;
        private final Snapshot snapshot;

        // Called by the native library with one of the two.
        ServerMessage(SyncDelta[] deltas, Snapshot snapshot) {
            this.deltas = deltas == null ? Collections.emptyList() : Collections.unmodifiableList(Arrays.asList(deltas));
            this.snapshot = snapshot;
        }

        public boolean isSnapshot() { return snapshot != null; }
        /** The deltas of a delta list; empty for a snapshot. */
        public List<SyncDelta> getDeltas() { return deltas; }
        /** The snapshot, or null for a delta list. */
        public Snapshot getSnapshot() { return snapshot; }
    }

    private Wire() {}

    /** The payload that publishes a local change (on TOPIC_CHANGE_RECORD). */
    public static byte[] changeRecord(SyncDelta delta) {
        return nativeChangeRecord(Objects.requireNonNull(delta, "delta"));
    }

    /** The payload of a subscription (on TOPIC_SUBSCRIBE_COLLECTION). */
    public static byte[] subscription(SubscriptionRequest request) {
        return nativeSubscription(Objects.requireNonNull(request, "request"));
    }

    /** The payload of a snapshot request (on TOPIC_SNAPSHOT). */
    public static byte[] snapshotRequest(String collectionName, String clientId) {
        return nativeSnapshotRequest(Objects.requireNonNull(collectionName, "collectionName"),
                                     Objects.requireNonNull(clientId, "clientId"));
    }

    /** Reads one payload the server sent. */
    public static ServerMessage readServerPayload(byte[] payload) {
        return nativeReadServerPayload(Objects.requireNonNull(payload, "payload"));
    }

    private static native String nativeTopic(int which);
    private static native byte[] nativeChangeRecord(SyncDelta delta);
    private static native byte[] nativeSubscription(SubscriptionRequest request);
    private static native byte[] nativeSnapshotRequest(String collectionName, String clientId);
    private static native ServerMessage nativeReadServerPayload(byte[] payload);
}
