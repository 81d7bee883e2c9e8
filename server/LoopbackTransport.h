// A SyncProtocol that connects one store to a SyncServer in the same
// process, for demos and for tests of applications and of the store.
//
// Outgoing, each operation serialises its record with the store's protocol
// functions and publishes the bytes on the matching topic; incoming, the
// server's ServerPayload buffers are read with protocol::deserializeServerPayload
// and handed to onDeltaReceived or onSnapshotReceived. A change the server
// accepted (or had accepted before) is reported through onDeltaStatusUpdated
// as SENT, before the server's echo of it is delivered; a subscription the
// server took is reported through onSubscriptionResponseReceived.
//
// Connection: start() connects; disconnect() and connect() take the link down
// and up again. Each connection is a new server session and is reported by
// onConnectionEstablished. A session is sent each change once, so what is
// delivered while no store listens is lost to that connection: a store that
// takes over the transport from another one disconnects it and starts it
// again. While the link is down, sends are dropped (the
// store keeps its changes queued and resends them on the next connection) and
// nothing is delivered. Sends made while a new connection is being reported
// wait until the store has resubscribed and resent its queue, so the server
// always sees one client's changes in the order they were written.
//
// The link is ordered, like the connections real transports run on: messages
// in both directions pass one queue in order. Faults can be injected per
// direction (setFaults), from a seeded FaultInjector:
//   - duplicate: the message travels twice in a row;
//   - delay: the message, and so everything behind it, waits a little;
//   - drop: the message is lost and, as on a real connection that loses a
//     message, the link goes down with it: nothing queued behind it arrives
//     and the transport stays down until connect() is called. (A message lost
//     silently from the middle of a live connection would be a gap that no
//     client of an ordered connection is built to notice.)
//
// Threads: one delivery thread per transport, started by the constructor and
// joined by the destructor, makes every call into the server and every on...
// call, so the store hears of everything on that thread and never on the
// application's. The operations may be called from any thread; the transport
// holds its own lock only to queue and dequeue, never while it calls the
// server or the store. disconnect() waits until a delivery under way has
// finished, unless it is called on the delivery thread. The transport must
// not be destroyed on its delivery thread (that is, from inside a store
// callback that runs there); the server must outlive it.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "server/FaultInjector.h"
#include "server/SyncServer.h"
#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

class LoopbackTransport : public SyncProtocol {
public:
    enum class Direction { TO_SERVER, TO_CLIENT };

    // How many messages the injected faults touched so far.
    struct FaultCounts {
        uint64_t dropped = 0;
        uint64_t duplicated = 0;
        uint64_t delayed = 0;
    };

    // seed drives the fault decisions of both directions.
    explicit LoopbackTransport(std::shared_ptr<SyncServer> server, uint64_t seed = 1);
    ~LoopbackTransport() override;

    // Connects (see connect()).
    void start() override;
    void sendSubscriptionRequest(const SubscriptionRequest& request) override;
    // 1 when the change was handed to the link, 0 when the link was down.
    int sendDelta(const Delta& delta) override;
    void sendSnapshotRequest(const std::string& collectionName, const std::string& clientId) override;

    // Opens a new server session and reports it on the delivery thread
    // through onConnectionEstablished. Nothing happens when already connected.
    void connect();
    // Closes the session; whatever is still queued is lost. Nothing happens
    // when already down.
    void disconnect();
    // True from connect() until disconnect() or a dropped message.
    bool isConnected() const;

    // Replaces the fault rates of one direction; applies to messages queued
    // from now on.
    void setFaults(Direction direction, const FaultRates& rates);
    FaultCounts faultCounts() const;

private:
    enum class LinkState { DOWN, CONNECTING, UP };

    struct Message {
        enum class Kind { CONNECTED, TO_SERVER, TO_CLIENT };
        Kind kind = Kind::CONNECTED;
        uint64_t connection = 0;
        bool lost = false;  // the link breaks when this message is reached
        std::chrono::milliseconds delay{0};
        std::chrono::steady_clock::time_point due;
        std::string topic;                  // TO_SERVER
        std::vector<unsigned char> bytes;   // TO_SERVER, TO_CLIENT
        bool isChange = false;              // TO_SERVER: a change record, reported SENT once accepted
        Delta change;
    };

    // False when the link is down and the bytes were dropped.
    bool publish(const std::string& topic, std::vector<unsigned char> bytes, const Delta* change);
    void deliverFromServer(uint64_t connection, std::vector<unsigned char> bytes);
    // Applies the direction's faults and queues the copies; the lock is held.
    void queueWithFaults(Message message, Direction direction, std::deque<Message>& into);
    void run();
    void handle(Message& message, SyncServer::SessionId session);
    void handleToServer(const Message& message, SyncServer::SessionId session);
    void handleToClient(const Message& message);
    void reportConnection(uint64_t connection);
    void breakLink(uint64_t connection);
    // Takes the link down if it still is on connection; returns the session
    // to detach (0 when there is none). The lock is held.
    SyncServer::SessionId takeDown(uint64_t connection);
    bool onDeliveryThread() const;

    const std::shared_ptr<SyncServer> server;

    mutable std::mutex mutex;
    std::condition_variable changed;
    LinkState state = LinkState::DOWN;
    uint64_t connection = 0;  // counts connections; messages of older ones are discarded
    SyncServer::SessionId session = 0;
    std::deque<Message> queue;
    std::deque<Message> heldWhileConnecting;
    bool delivering = false;
    bool stopping = false;
    FaultInjector toServerFaults;
    FaultInjector toClientFaults;
    FaultCounts counts;

    std::thread deliveryThread;  // last: started once everything above exists
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
