package com.lumivale.tessarine;

import java.lang.ref.Reference;

/**
 * A forward-only reader over the objects a query selected. Call next() until
 * it returns false and read the current object after each true result; close
 * it when done (try-with-resources, Kotlin's use {}), which releases its
 * statement at once. A cursor that is garbage collected unclosed is released
 * then.
 *
 * Reading without a current object (before the first next(), after a false
 * one) throws IllegalStateException, as does any call but close() after
 * close(). A database error while stepping is logged and ends the rows
 * (next() returns false). One thread at a time.
 */
public final class Cursor implements AutoCloseable {
    static {
        NativeLibrary.load();
    }

    private final NativeHandle handle;
    private boolean hasCurrent;

    Cursor(long pointer) {
        handle = new NativeHandle(this, pointer, Cursor::nativeRelease, "cursor");
    }

    /** Moves to the next object; false at the end (and from then on). */
    public boolean next() {
        try {
            hasCurrent = nativeNext(handle.get());
            return hasCurrent;
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    public String getPrimaryKey() {
        try {
            return nativeString(current(), FIELD_PRIMARY_KEY);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    public String getSortKey() {
        try {
            return nativeString(current(), FIELD_SORT_KEY);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** A copy of the object's content; empty for an empty or missing blob. */
    public byte[] getBlob() {
        try {
            return nativeBlob(current());
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    public Status getStatus() {
        try {
            return Status.fromValue(nativeStatus(current()));
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    @Override
    public void close() {
        hasCurrent = false;
        handle.close();
    }

    private long current() {
        long pointer = handle.get();
        if (!hasCurrent) throw new IllegalStateException("the cursor has no current object: call next() first");
        return pointer;
    }

    private static final int FIELD_PRIMARY_KEY = 0;
    private static final int FIELD_SORT_KEY = 1;

    private static native boolean nativeNext(long pointer);
    private static native String nativeString(long pointer, int field);
    private static native byte[] nativeBlob(long pointer);
    private static native int nativeStatus(long pointer);
    private static native void nativeRelease(long pointer);
}
