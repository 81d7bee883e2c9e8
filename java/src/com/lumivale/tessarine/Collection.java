package com.lumivale.tessarine;

import java.lang.ref.Reference;
import java.util.List;
import java.util.Objects;

/**
 * The application's handle on one collection of a store.
 *
 * Writes become local changes: stored with status PENDING, queued for the
 * server and reported to the change listeners before the call returns; they
 * return false when the change was not accepted (the reason is logged).
 * Queries return a {@link Cursor} the caller closes; a query that fails (for
 * instance index SQL that is not valid) throws TessarineException.
 *
 * The handle keeps the store's native components alive until it is closed
 * (or garbage collected), even after the store itself is closed. Any thread
 * may use it; close() must not race with other calls on the same handle.
 */
public final class Collection implements AutoCloseable {
    static {
        NativeLibrary.load();
    }

    private final NativeHandle handle;
    private final String name;

    Collection(long pointer, String name) {
        this.handle = new NativeHandle(this, pointer, Collection::nativeRelease, "collection " + name);
        this.name = name;
    }

    public String getName() {
        return name;
    }

    /** Creates or replaces the object. */
    public boolean save(String primaryKey, String sortKey, byte[] blob) {
        Objects.requireNonNull(primaryKey, "primaryKey");
        Objects.requireNonNull(sortKey, "sortKey");
        Objects.requireNonNull(blob, "blob");
        try {
            return nativeSave(handle.get(), primaryKey, sortKey, blob);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    public boolean delete(String primaryKey) {
        Objects.requireNonNull(primaryKey, "primaryKey");
        try {
            return nativeDelete(handle.get(), primaryKey);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** A cursor over the object, or over nothing when there is none. */
    public Cursor get(String primaryKey) {
        Objects.requireNonNull(primaryKey, "primaryKey");
        try {
            return new Cursor(nativeGet(handle.get(), primaryKey));
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /**
     * Objects from sortKey upward (ASCENDING) or downward, inclusive, in sort-key
     * order; at most limit of them, a negative limit meaning all.
     */
    public Cursor query(String sortKey, int limit, SortDirection direction) {
        Objects.requireNonNull(sortKey, "sortKey");
        Objects.requireNonNull(direction, "direction");
        try {
            return new Cursor(nativeQuery(handle.get(), sortKey, limit, direction.value()));
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /**
     * Objects whose primary key indexQuery selects: SQL over the collection's
     * index table, written {0}, with the columns primary_key, field_name and
     * field_value; args are bound as text to its ? marks in order. At most
     * limit objects (negative: all).
     */
    public Cursor queryWithIndex(String indexQuery, List<String> args, int limit) {
        Objects.requireNonNull(indexQuery, "indexQuery");
        try {
            return new Cursor(nativeQueryWithIndex(handle.get(), indexQuery, toArray(args), null, 0, limit));
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /**
     * As {@link #queryWithIndex}, ordered by the text value of the index field
     * sortFieldName; objects without that field come first ascending.
     */
    public Cursor queryWithIndex(String indexQuery, List<String> args, String sortFieldName, SortDirection direction,
                                 int limit) {
        Objects.requireNonNull(indexQuery, "indexQuery");
        Objects.requireNonNull(sortFieldName, "sortFieldName");
        Objects.requireNonNull(direction, "direction");
        try {
            return new Cursor(nativeQueryWithIndex(handle.get(), indexQuery, toArray(args), sortFieldName,
                                                   direction.value(), limit));
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** Releases the native handle; the subscription and the stored objects stay. */
    @Override
    public void close() {
        handle.close();
    }

    private static String[] toArray(List<String> args) {
        Objects.requireNonNull(args, "args");
        String[] array = args.toArray(new String[0]);
        for (String arg : array) Objects.requireNonNull(arg, "an index query argument");
        return array;
    }

    private static native boolean nativeSave(long pointer, String primaryKey, String sortKey, byte[] blob);
    private static native boolean nativeDelete(long pointer, String primaryKey);
    // Each returns a cursor pointer, or throws TessarineException.
    private static native long nativeGet(long pointer, String primaryKey);
    private static native long nativeQuery(long pointer, String sortKey, int limit, int direction);
    private static native long nativeQueryWithIndex(long pointer, String indexQuery, String[] args,
                                                    String sortFieldName, int direction, int limit);
    private static native void nativeRelease(long pointer);
}
