package com.lumivale.tessarine;

import java.util.Objects;

/**
 * One change to one object as it crosses the transport. (collectionName,
 * versionId) identifies a local change; clientId is the writing store's;
 * sequenceNumber is the server's number for it (0 on the way out). The two
 * 64-bit numbers are unsigned on the wire and carried in a long's bits.
 */
public final class SyncDelta {
    private final String clientId;
    private final String collectionName;
    private final long versionId;
    private final String primaryKey;
    private final String sortKey;
    private final ChangeType type;
    private final byte[] blob;
    private final long sequenceNumber;

    public SyncDelta(String clientId, String collectionName, long versionId, String primaryKey, String sortKey,
                     ChangeType type, byte[] blob, long sequenceNumber) {
        this.clientId = Objects.requireNonNull(clientId, "clientId");
        this.collectionName = Objects.requireNonNull(collectionName, "collectionName");
        this.versionId = versionId;
        this.primaryKey = Objects.requireNonNull(primaryKey, "primaryKey");
        this.sortKey = Objects.requireNonNull(sortKey, "sortKey");
        this.type = Objects.requireNonNull(type, "type");
        this.blob = Objects.requireNonNull(blob, "blob");
        this.sequenceNumber = sequenceNumber;
    }

    // Called by the native library, which passes the store's number for the type.
    SyncDelta(String clientId, String collectionName, long versionId, String primaryKey, String sortKey, int type,
              byte[] blob, long sequenceNumber) {
        this(clientId, collectionName, versionId, primaryKey, sortKey, ChangeType.fromValue(type), blob,
             sequenceNumber);
    }

    public String getClientId() { return clientId; }
    public String getCollectionName() { return collectionName; }
    public long getVersionId() { return versionId; }
    public String getPrimaryKey() { return primaryKey; }
    public String getSortKey() { return sortKey; }
    public ChangeType getType() { return type; }
    public byte[] getBlob() { return blob; }
    public long getSequenceNumber() { return sequenceNumber; }

    // The native library reads the type as the store's number.
    int typeValue() { return type.value(); }

    @Override
    public String toString() {
        return type + " " + collectionName + "/" + primaryKey + " v" + Long.toUnsignedString(versionId);
    }
}
