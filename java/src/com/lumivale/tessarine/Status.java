package com.lumivale.tessarine;

/**
 * How far a local change has travelled, and so the status of a stored object:
 * PENDING (written here, not yet handed over), SENT (handed to the server),
 * PERSISTED (the server has it; nothing of the object is queued any more).
 * The numbers are the store's own and are stable.
 */
public enum Status {
    PENDING(1),
    SENT(2),
    PERSISTED(3);

    private final int value;

    Status(int value) {
        this.value = value;
    }

    /** The store's number for this status. */
    public int value() {
        return value;
    }

    /** The status with the store's number value; IllegalArgumentException for any other number. */
    public static Status fromValue(int value) {
        for (Status status : values()) {
            if (status.value == value) return status;
        }
        throw new IllegalArgumentException("unknown status: " + value);
    }
}
