package com.lumivale.tessarine;

import com.lumivale.tessarine.server.ReferenceServer;
import java.util.concurrent.LinkedBlockingQueue;

/**
 * A SyncTransport written in Java, as an app writes one over its own
 * networking: it publishes the store's records as wire payloads to a session
 * of the reference server and reports, from its own thread and in order,
 * the connection, what the server sends and SENT for each change it handed
 * over (before the server's echo of that change can arrive).
 */
final class ServerLink implements SyncTransport, AutoCloseable {
    private static final Runnable STOP = () -> {};

    private final ReferenceServer server;
    private final LinkedBlockingQueue<Runnable> inbox = new LinkedBlockingQueue<>();
    private final Thread thread = new Thread(this::run, "server-link");
    private volatile TransportEvents events;
    private volatile long session;

    ServerLink(ReferenceServer server) {
        this.server = server;
    }

    @Override
    public void start(TransportEvents events) {
        this.events = events;
        session = server.attach(payload -> inbox.add(() -> deliver(payload)));
        inbox.add(events::connectionEstablished);
        thread.start();
    }

    @Override
    public void sendSubscriptionRequest(SubscriptionRequest request) {
        server.receive(session, Wire.TOPIC_SUBSCRIBE_COLLECTION, Wire.subscription(request));
    }

    @Override
    public int sendDelta(SyncDelta delta) {
        inbox.add(() -> events.deltaStatusUpdated(delta, Status.SENT));
        server.receive(session, Wire.TOPIC_CHANGE_RECORD, Wire.changeRecord(delta));
        return 1;
    }

    @Override
    public void sendSnapshotRequest(String collectionName, String clientId) {
        server.receive(session, Wire.TOPIC_SNAPSHOT, Wire.snapshotRequest(collectionName, clientId));
    }

    private void deliver(byte[] payload) {
        Wire.ServerMessage message = Wire.readServerPayload(payload);
        if (message.isSnapshot()) {
            events.snapshotReceived(message.getSnapshot());
        } else {
            events.deltasReceived(message.getDeltas());
        }
    }

    private void run() {
        try {
            for (Runnable event = inbox.take(); event != STOP; event = inbox.take()) event.run();
        } catch (InterruptedException e) {
            Thread.currentThread().interrupt();
        }
    }

    /** Stops reporting and leaves the server. */
    @Override
    public void close() {
        if (!thread.isAlive()) return;
        inbox.add(STOP);
        boolean interrupted = false;
        while (thread.isAlive()) {
            try {
                thread.join();
            } catch (InterruptedException e) {
                interrupted = true;
            }
        }
        server.detach(session);
        if (interrupted) Thread.currentThread().interrupt();
    }
}
