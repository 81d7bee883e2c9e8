package com.lumivale.tessarine;

/**
 * A store operation failed: the store could not be opened, a collection could
 * not be subscribed, a query failed, or bytes were not a valid wire payload.
 * The store's log (tag "tessarine") has the details. Nothing already stored is
 * lost by the failure.
 */
public class TessarineException extends RuntimeException {
    private static final long serialVersionUID = 1L;

    public TessarineException(String message) {
        super(message);
    }
}
