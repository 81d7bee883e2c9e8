package com.lumivale.tessarine;

import java.lang.ref.Cleaner;
import java.util.concurrent.atomic.AtomicLong;

/**
 * Owns one native object on behalf of a Java object. The native object is
 * released exactly once: by close(), or by the cleaner once the owner has
 * become unreachable without being closed. close() may be called any number
 * of times; get() after close() throws IllegalStateException.
 *
 * The owner must keep itself reachable while a native call uses the pointer
 * (Reference.reachabilityFence), or the cleaner could release the object in
 * the middle of the call. close() must not race with calls that use the
 * pointer: the owner's documentation says so to the application.
 */
public final class NativeHandle implements AutoCloseable {
    /** Releases a native object; must not refer to the owner. */
    public interface Releaser {
        void release(long pointer);
    }

    private static final Cleaner CLEANER = Cleaner.create();

    private static final class State implements Runnable {
        private final AtomicLong pointer;
        private final Releaser releaser;

        State(long pointer, Releaser releaser) {
            this.pointer = new AtomicLong(pointer);
            this.releaser = releaser;
        }

        @Override
        public void run() {
            long released = pointer.getAndSet(0);
            if (released != 0) releaser.release(released);
        }
    }

    private final State state;
    private final Cleaner.Cleanable cleanable;
    private final String what;

    /** Takes ownership of pointer (not 0) for owner; what names the object in errors. */
    public NativeHandle(Object owner, long pointer, Releaser releaser, String what) {
        if (pointer == 0) throw new IllegalArgumentException("no native " + what);
        this.state = new State(pointer, releaser);
        this.cleanable = CLEANER.register(owner, state);
        this.what = what;
    }

    /** The native pointer; IllegalStateException once closed. */
    public long get() {
        long pointer = state.pointer.get();
        if (pointer == 0) throw new IllegalStateException("the " + what + " is closed");
        return pointer;
    }

    public boolean isClosed() {
        return state.pointer.get() == 0;
    }

    @Override
    public void close() {
        cleanable.clean();
    }
}
