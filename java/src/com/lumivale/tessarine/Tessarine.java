package com.lumivale.tessarine;

import java.lang.ref.Reference;
import java.util.Objects;

/**
 * A store: one database file, kept in sync with a server through a transport.
 *
 * <pre>
 * try (Tessarine store = Tessarine.open(path, transport)) {
 *     store.addChangeListener(changes -&gt; ...);   // before start()
 *     store.setIndexer(...);                     // before start()
 *     store.start();                             // the transport starts connecting
 *     try (Collection items = store.subscribeCollection("app:Items")) {
 *         items.save("id-1", "sort-1", bytes);
 *     }
 * }
 * </pre>
 *
 * Threads: call it from application threads, never from a listener, an
 * indexer or a transport call (closing joins the store's worker thread,
 * which runs those). close() must not race with other calls; closing twice
 * is harmless, any other call after close() throws IllegalStateException. A
 * store garbage collected unclosed is closed then, on the cleaner's thread.
 */
public final class Tessarine implements AutoCloseable {
    static {
        NativeLibrary.load();
    }

    private final NativeHandle handle;

    private Tessarine(long pointer) {
        handle = new NativeHandle(this, pointer, Tessarine::nativeRelease, "store");
    }

    /**
     * Opens (or creates) the store at path with a transport written in Java.
     * TessarineException when it cannot be opened (the log says why).
     */
    public static Tessarine open(String path, SyncTransport transport) {
        Objects.requireNonNull(path, "path");
        Objects.requireNonNull(transport, "transport");
        return new Tessarine(nativeOpenWithJavaTransport(path, transport));
    }

    /** Opens the store with a native transport, which may be shared by no other store. */
    public static Tessarine open(String path, NativeTransport transport) {
        Objects.requireNonNull(path, "path");
        Objects.requireNonNull(transport, "transport");
        try {
            return new Tessarine(nativeOpenWithNativeTransport(path, transport.pointer()));
        } finally {
            Reference.reachabilityFence(transport);
        }
    }

    /** Adds a listener for every applied change; listeners cannot be removed. */
    public void addChangeListener(ChangeListener listener) {
        Objects.requireNonNull(listener, "listener");
        try {
            nativeAddChangeListener(handle.get(), listener);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** Replaces the indexer; null switches indexing off. Existing index rows stay as they are. */
    public void setIndexer(Indexer indexer) {
        try {
            nativeSetIndexer(handle.get(), indexer);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** Starts the transport; from then on its events reach the store. */
    public void start() {
        try {
            nativeStart(handle.get());
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /**
     * A new handle on the collection, subscribing to it if needed. The name is
     * two non-empty parts of ASCII letters, digits and underscores joined by
     * one colon, such as "app_1:Items"; TessarineException for another name or
     * when the subscription fails.
     */
    public Collection subscribeCollection(String collectionName) {
        Objects.requireNonNull(collectionName, "collectionName");
        try {
            return new Collection(nativeSubscribeCollection(handle.get(), collectionName), collectionName);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /**
     * Stops the store and deletes its database files; false when a file could
     * not be deleted. Meant as the last call before close().
     */
    public boolean remove() {
        try {
            return nativeRemove(handle.get());
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /**
     * Closes the store: its worker stops once no collection handle keeps it
     * alive. Queued changes stay in the database for the next open.
     */
    @Override
    public void close() {
        handle.close();
    }

    private static native long nativeOpenWithJavaTransport(String path, SyncTransport transport);
    private static native long nativeOpenWithNativeTransport(String path, long transportPointer);
    private static native void nativeAddChangeListener(long pointer, ChangeListener listener);
    private static native void nativeSetIndexer(long pointer, Indexer indexer);
    private static native void nativeStart(long pointer);
    private static native long nativeSubscribeCollection(long pointer, String collectionName);
    private static native boolean nativeRemove(long pointer);
    private static native void nativeRelease(long pointer);
}
