package com.lumivale.tessarine;

import java.util.Arrays;
import java.util.List;
import java.util.Objects;

/**
 * The full content of one collection at one point: its objects, the server's
 * sequence number then, and the highest version id of this client's own
 * changes it contains (both unsigned, in a long's bits).
 */
public final class Snapshot {
    private final String collectionName;
    private final List<SnapshotObject> objects;
    private final long sequenceNumber;
    private final long versionId;

    public Snapshot(String collectionName, List<SnapshotObject> objects, long sequenceNumber, long versionId) {
        this.collectionName = Objects.requireNonNull(collectionName, "collectionName");
        this.objects = List.copyOf(objects);  // rejects null objects
        this.sequenceNumber = sequenceNumber;
        this.versionId = versionId;
    }

    // Called by the native library.
    Snapshot(String collectionName, SnapshotObject[] objects, long sequenceNumber, long versionId) {
        this(collectionName, Arrays.asList(objects), sequenceNumber, versionId);
    }

    public String getCollectionName() { return collectionName; }
    public List<SnapshotObject> getObjects() { return objects; }
    public long getSequenceNumber() { return sequenceNumber; }
    public long getVersionId() { return versionId; }

    // The native library reads the objects as an array.
    SnapshotObject[] objectArray() { return objects.toArray(new SnapshotObject[0]); }
}
