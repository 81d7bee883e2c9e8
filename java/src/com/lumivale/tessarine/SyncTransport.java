package com.lumivale.tessarine;

/**
 * A transport written in Java: the store's link to its server over the
 * application's own networking. The store calls these four operations; the
 * transport reports what its connection delivers through the
 * {@link TransportEvents} it is given in start(). {@link Wire} turns the
 * records into the server's wire payloads and back.
 *
 * Threads: the operations are called on application threads that write and
 * on the thread that reports a connection (the store subscribes and resends
 * from inside connectionEstablished()); the store calls sendDelta on one
 * thread at a time, after the change has been stored, holding none of its
 * locks. It should hand the change to the connection and return. Report
 * events from the transport's own threads rather than from inside these
 * calls.
 *
 * Errors: an exception thrown by an operation is logged (tag "tessarine_jni")
 * and reaches the store as a throwing native transport's would: thrown by
 * sendDelta it means the change was not taken; the write still succeeds, the
 * change stays queued (PENDING), and nothing newer is sent until the next
 * connection resends the queue; thrown while the store subscribes on a new
 * connection it ends that round, which the next connection makes again. One
 * thrown by start() is logged and the store then waits for a connection that
 * never comes.
 */
public interface SyncTransport {
    /** Begins connecting; events reports each connection and everything received. */
    void start(TransportEvents events);

    /** Publishes a subscription (on Wire.TOPIC_SUBSCRIBE_COLLECTION). */
    void sendSubscriptionRequest(SubscriptionRequest request);

    /** Publishes one local change (on Wire.TOPIC_CHANGE_RECORD); the result is not read by the store. */
    int sendDelta(SyncDelta delta);

    /** Asks for a snapshot of a collection (on Wire.TOPIC_SNAPSHOT); the store itself never calls it. */
    void sendSnapshotRequest(String collectionName, String clientId);
}
