package com.lumivale.tessarine;

/** What a change does to one object; the numbers are the store's own. */
public enum ChangeType {
    SAVE(1),
    DELETE(2);

    private final int value;

    ChangeType(int value) {
        this.value = value;
    }

    public int value() {
        return value;
    }

    /** The type with the store's number value; IllegalArgumentException for any other number. */
    public static ChangeType fromValue(int value) {
        for (ChangeType type : values()) {
            if (type.value == value) return type;
        }
        throw new IllegalArgumentException("unknown change type: " + value);
    }
}
