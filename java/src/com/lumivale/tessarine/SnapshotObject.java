package com.lumivale.tessarine;

import java.util.Objects;

/** One object inside a snapshot. */
public final class SnapshotObject {
    private final String primaryKey;
    private final String sortKey;
    private final byte[] blob;

    public SnapshotObject(String primaryKey, String sortKey, byte[] blob) {
        this.primaryKey = Objects.requireNonNull(primaryKey, "primaryKey");
        this.sortKey = Objects.requireNonNull(sortKey, "sortKey");
        this.blob = Objects.requireNonNull(blob, "blob");
    }

    public String getPrimaryKey() { return primaryKey; }
    public String getSortKey() { return sortKey; }
    public byte[] getBlob() { return blob; }
}
