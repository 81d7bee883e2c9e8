package com.lumivale.tessarine;

/** Order of a query; the numbers are the store's own. */
public enum SortDirection {
    ASCENDING(1),
    DESCENDING(2);

    private final int value;

    SortDirection(int value) {
        this.value = value;
    }

    public int value() {
        return value;
    }
}
