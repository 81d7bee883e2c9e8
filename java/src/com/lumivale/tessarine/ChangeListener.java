package com.lumivale.tessarine;

import java.util.List;

/**
 * Hears of every change the store applies, in batches. Called on the thread
 * that wrote (for a local write, before the write returns) and on the store's
 * worker thread for everything that arrives through the transport, never on
 * two threads at once for one store. It must not close the store. An
 * exception it throws is logged and the store carries on: the other
 * listeners still hear of the batch and the change stays applied.
 */
@FunctionalInterface
public interface ChangeListener {
    void onChanges(List<Change> changes);
}
