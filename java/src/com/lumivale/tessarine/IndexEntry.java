package com.lumivale.tessarine;

import java.util.Objects;

/** One index row of an object: a field name and its text value. */
public final class IndexEntry {
    private final String field;
    private final String value;

    public IndexEntry(String field, String value) {
        this.field = Objects.requireNonNull(field, "field");
        this.value = Objects.requireNonNull(value, "value");
    }

    public String getField() { return field; }
    public String getValue() { return value; }
}
