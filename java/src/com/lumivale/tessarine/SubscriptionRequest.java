package com.lumivale.tessarine;

import java.util.Objects;

/**
 * What a store asks of the server when it subscribes to a collection: the
 * changes after sequenceNumber. version is the store's one-byte data version.
 */
public final class SubscriptionRequest {
    private final byte[] version;
    private final String collectionName;
    private final String clientId;
    private final long sequenceNumber;

    public SubscriptionRequest(byte[] version, String collectionName, String clientId, long sequenceNumber) {
        this.version = Objects.requireNonNull(version, "version");
        this.collectionName = Objects.requireNonNull(collectionName, "collectionName");
        this.clientId = Objects.requireNonNull(clientId, "clientId");
        this.sequenceNumber = sequenceNumber;
    }

    public byte[] getVersion() { return version; }
    public String getCollectionName() { return collectionName; }
    public String getClientId() { return clientId; }
    public long getSequenceNumber() { return sequenceNumber; }
}
