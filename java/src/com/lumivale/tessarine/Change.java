package com.lumivale.tessarine;

/**
 * One applied change, local or remote, as a {@link ChangeListener} hears of
 * it: which object of which collection, what happened to it, its content
 * (empty for a delete) and how far the change has travelled.
 */
public final class Change {
    private final String collectionName;
    private final ChangeType type;
    private final String primaryKey;
    private final String sortKey;
    private final byte[] blob;
    private final Status status;

    public Change(String collectionName, ChangeType type, String primaryKey, String sortKey, byte[] blob,
                  Status status) {
        this.collectionName = collectionName;
        this.type = type;
        this.primaryKey = primaryKey;
        this.sortKey = sortKey;
        this.blob = blob;
        this.status = status;
    }

    // Called by the native library, which passes the store's numbers.
    Change(String collectionName, int type, String primaryKey, String sortKey, byte[] blob, int status) {
        this(collectionName, ChangeType.fromValue(type), primaryKey, sortKey, blob, Status.fromValue(status));
    }

    public String getCollectionName() { return collectionName; }
    public ChangeType getType() { return type; }
    public String getPrimaryKey() { return primaryKey; }
    public String getSortKey() { return sortKey; }
    /** The object's content; the array belongs to this change, copy it before modifying. */
    public byte[] getBlob() { return blob; }
    public Status getStatus() { return status; }

    @Override
    public String toString() {
        return type + " " + collectionName + "/" + primaryKey + " " + status;
    }
}
