package com.lumivale.tessarine;

/**
 * A transport implemented in native code, handed to
 * {@link Tessarine#open(String, NativeTransport)}. A subclass comes with a JNI
 * library of its own that makes the native transport and passes its
 * constructor a pointer to a heap-allocated
 * std::shared_ptr&lt;lumivale::tessarine::SyncProtocol&gt;, which this object then
 * owns (the reference server's loopback transport is one; a network
 * transport plugs in the same way). Closing it releases this reference only:
 * a store opened on it keeps the transport alive until the store is closed.
 */
public abstract class NativeTransport implements AutoCloseable {
    static {
        NativeLibrary.load();
    }

    private final NativeHandle handle;

    protected NativeTransport(long sharedProtocolPointer) {
        handle = new NativeHandle(this, sharedProtocolPointer, NativeTransport::nativeRelease, "transport");
    }

    /** The pointer to the std::shared_ptr; IllegalStateException once closed. */
    protected final long pointer() {
        return handle.get();
    }

    @Override
    public void close() {
        handle.close();
    }

    private static native void nativeRelease(long sharedProtocolPointer);
}
