package com.lumivale.tessarine.server;

import com.lumivale.tessarine.NativeHandle;
import com.lumivale.tessarine.NativeLibrary;
import com.lumivale.tessarine.Snapshot;
import java.lang.ref.Reference;
import java.util.Objects;
import java.util.function.Consumer;

/**
 * The in-process reference sync server, for tests of applications and demos:
 * it speaks the store's wire payloads and keeps everything in memory. A store
 * reaches it through a {@link LoopbackTransport}, or through a Java transport
 * that attaches a session and hands it the payloads its store publishes.
 * Not part of what an application ships (library tessarine_server_jni).
 *
 * Threads: any thread. A session's delivery is called on the thread that
 * made the server send (a receive() caller, a loopback transport's thread)
 * while the server holds its lock: it must only queue the bytes and return.
 */
public final class ReferenceServer implements AutoCloseable {
    static {
        NativeLibrary.load();
        String file = System.getProperty("tessarine.server.jni.library");
        if (file != null && !file.isEmpty()) {
            System.load(file);
        } else {
            System.loadLibrary("tessarine_server_jni");
        }
    }

    /** What the server did with a payload. */
    public enum Outcome { CHANGE_ACCEPTED, CHANGE_ECHOED, SUBSCRIBED, SNAPSHOT_SENT, DROPPED }

    private final NativeHandle handle;

    public ReferenceServer() {
        handle = new NativeHandle(this, nativeCreate(), ReferenceServer::nativeRelease, "reference server");
    }

    /** A new session subscribed to nothing; delivery receives each server payload for it. */
    public long attach(Consumer<byte[]> delivery) {
        Objects.requireNonNull(delivery, "delivery");
        try {
            return nativeAttach(handle.get(), delivery);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** Forgets the session; its delivery is never called again once this returns. */
    public void detach(long session) {
        try {
            nativeDetach(handle.get(), session);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** Handles one payload the session's client published on topic. */
    public Outcome receive(long session, String topic, byte[] payload) {
        Objects.requireNonNull(topic, "topic");
        Objects.requireNonNull(payload, "payload");
        try {
            return Outcome.values()[nativeReceive(handle.get(), session, topic, payload)];
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** What the server holds of a collection: its objects in sort-key order and its last sequence number. */
    public Snapshot snapshot(String collectionName) {
        Objects.requireNonNull(collectionName, "collectionName");
        try {
            return nativeSnapshot(handle.get(), collectionName);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** A loopback transport to this server for one store; seed drives its injected faults (none by default). */
    public LoopbackTransport newLoopbackTransport(long seed) {
        try {
            return new LoopbackTransport(nativeNewLoopbackTransport(handle.get(), seed));
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** Releases this reference; transports made from it keep the server alive. */
    @Override
    public void close() {
        handle.close();
    }

    private static native long nativeCreate();
    private static native long nativeAttach(long pointer, Consumer<byte[]> delivery);
    private static native void nativeDetach(long pointer, long session);
    private static native int nativeReceive(long pointer, long session, String topic, byte[] payload);
    private static native Snapshot nativeSnapshot(long pointer, String collectionName);
    private static native long nativeNewLoopbackTransport(long pointer, long seed);
    private static native void nativeRelease(long pointer);
}
