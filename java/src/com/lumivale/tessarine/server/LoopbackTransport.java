package com.lumivale.tessarine.server;

import com.lumivale.tessarine.NativeTransport;
import java.lang.ref.Reference;

/**
 * The native loopback transport between one store and a
 * {@link ReferenceServer}, handed to Tessarine.open. It runs its own
 * delivery thread, from which the store hears of everything. Use it for one
 * store only. disconnect() and connect() take the link down and up again, as
 * a device going offline and back does.
 */
public final class LoopbackTransport extends NativeTransport {
    LoopbackTransport(long sharedProtocolPointer) {
        super(sharedProtocolPointer);
    }

    public void connect() {
        try {
            nativeConnect(pointer(), true);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    public void disconnect() {
        try {
            nativeConnect(pointer(), false);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    private static native void nativeConnect(long sharedProtocolPointer, boolean up);
}
