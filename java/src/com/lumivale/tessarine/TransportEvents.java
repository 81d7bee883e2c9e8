package com.lumivale.tessarine;

import java.lang.ref.Reference;
import java.util.List;
import java.util.Objects;

/**
 * Where a {@link SyncTransport} reports what its connection delivers. Each
 * call hands the event to the store at once, on the calling thread (the store
 * does its work on its own worker thread). Events of one kind are delivered
 * one at a time; report them in the order the connection delivered them.
 * Events reported after the store and all its collections are closed are
 * ignored. Any thread may call these.
 */
public final class TransportEvents {
    static {
        NativeLibrary.load();
    }

    private final NativeHandle handle;

    // Made by the native library when the store starts its transport.
    TransportEvents(long pointer) {
        handle = new NativeHandle(this, pointer, TransportEvents::nativeRelease, "transport events");
    }

    /** A connection is up: the store subscribes and sends its queued changes. */
    public void connectionEstablished() {
        try {
            nativeConnectionEstablished(handle.get());
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** The server answered a subscription. */
    public void subscriptionResponseReceived(String collectionName, long sequenceNumber) {
        Objects.requireNonNull(collectionName, "collectionName");
        try {
            nativeSubscriptionResponseReceived(handle.get(), collectionName, sequenceNumber);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** One delta list from the server (Wire.readServerPayload). */
    public void deltasReceived(List<SyncDelta> deltas) {
        SyncDelta[] array = deltas.toArray(new SyncDelta[0]);
        for (SyncDelta delta : array) Objects.requireNonNull(delta, "a delta");
        try {
            nativeDeltasReceived(handle.get(), array);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** A local change, identified by collection name and version id, got further (SENT, PERSISTED). */
    public void deltaStatusUpdated(SyncDelta delta, Status status) {
        Objects.requireNonNull(delta, "delta");
        Objects.requireNonNull(status, "status");
        try {
            nativeDeltaStatusUpdated(handle.get(), delta, status.value());
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** A snapshot from the server. */
    public void snapshotReceived(Snapshot snapshot) {
        Objects.requireNonNull(snapshot, "snapshot");
        try {
            nativeSnapshotReceived(handle.get(), snapshot);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    private static native void nativeConnectionEstablished(long pointer);
    private static native void nativeSubscriptionResponseReceived(long pointer, String collectionName,
                                                                  long sequenceNumber);
    private static native void nativeDeltasReceived(long pointer, SyncDelta[] deltas);
    private static native void nativeDeltaStatusUpdated(long pointer, SyncDelta delta, int status);
    private static native void nativeSnapshotReceived(long pointer, Snapshot snapshot);
    private static native void nativeRelease(long pointer);
}
