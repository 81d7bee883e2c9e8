#include "server/LoopbackTransport.h"

#include <exception>
#include <stdexcept>

#include "platform/Assert.h"
#include "platform/Log.h"
#include "tessarine/Protocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

// The two directions draw from different streams of the one seed.
constexpr uint64_t kToClientSeedOffset = 0x9E3779B97F4A7C15ull;

}  // namespace

LoopbackTransport::LoopbackTransport(std::shared_ptr<SyncServer> theServer, uint64_t seed)
    : server(std::move(theServer)), toServerFaults(seed), toClientFaults(seed + kToClientSeedOffset) {
    if (!server) throw std::invalid_argument("LoopbackTransport needs a SyncServer");
    deliveryThread = std::thread([this] { run(); });
}

LoopbackTransport::~LoopbackTransport() {
    if (onDeliveryThread()) {
        LV_ASSERT_FAIL("LoopbackTransport", "LoopbackTransport destroyed on its own delivery thread");
    }
    disconnect();
    {
        std::lock_guard<std::mutex> lock(mutex);
        stopping = true;
    }
    changed.notify_all();
    deliveryThread.join();
}

void LoopbackTransport::start() { connect(); }

void LoopbackTransport::sendSubscriptionRequest(const SubscriptionRequest& request) {
    publish(protocol::TOPIC_SUBSCRIBE_COLLECTION, protocol::makePayloadForSubscription(request), nullptr);
}

int LoopbackTransport::sendDelta(const Delta& delta) {
    return publish(protocol::TOPIC_CHANGE_RECORD, protocol::makePayloadForSendDelta(delta), &delta) ? 1 : 0;
}

void LoopbackTransport::sendSnapshotRequest(const std::string& collectionName, const std::string& clientId) {
    publish(protocol::TOPIC_SNAPSHOT, protocol::makePayloadForSnapshotRequest(collectionName, clientId), nullptr);
}

void LoopbackTransport::connect() {
    uint64_t newConnection = 0;
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (stopping || state != LinkState::DOWN) return;
        state = LinkState::CONNECTING;
        newConnection = ++connection;
    }
    // The server is called without the lock: it calls deliverFromServer,
    // which takes it, with its own lock held.
    SyncServer::SessionId newSession = server->attach(
        [this, newConnection](std::vector<unsigned char> bytes) { deliverFromServer(newConnection, std::move(bytes)); });
    bool current = false;
    {
        std::lock_guard<std::mutex> lock(mutex);
        current = connection == newConnection && state == LinkState::CONNECTING;
        if (current) {
            session = newSession;
            Message connected;
            connected.kind = Message::Kind::CONNECTED;
            connected.connection = newConnection;
            connected.due = std::chrono::steady_clock::now();
            queue.push_back(std::move(connected));
        }
    }
    if (current) {
        changed.notify_all();
    } else {
        server->detach(newSession);  // disconnected while the session was being made
    }
}

void LoopbackTransport::disconnect() {
    SyncServer::SessionId oldSession = 0;
    {
        std::unique_lock<std::mutex> lock(mutex);
        oldSession = takeDown(connection);
        if (!onDeliveryThread()) changed.wait(lock, [this] { return !delivering; });
    }
    if (oldSession != 0) server->detach(oldSession);
}

bool LoopbackTransport::isConnected() const {
    std::lock_guard<std::mutex> lock(mutex);
    return state != LinkState::DOWN;
}

void LoopbackTransport::setFaults(Direction direction, const FaultRates& rates) {
    std::lock_guard<std::mutex> lock(mutex);
    (direction == Direction::TO_SERVER ? toServerFaults : toClientFaults).setRates(rates);
}

LoopbackTransport::FaultCounts LoopbackTransport::faultCounts() const {
    std::lock_guard<std::mutex> lock(mutex);
    return counts;
}

bool LoopbackTransport::publish(const std::string& topic, std::vector<unsigned char> bytes, const Delta* change) {
    Message message;
    message.kind = Message::Kind::TO_SERVER;
    message.topic = topic;
    message.bytes = std::move(bytes);
    if (change != nullptr) {
        message.isChange = true;
        message.change = *change;
    }
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (state == LinkState::DOWN) return false;
        message.connection = connection;
        // While a connection is reported, the store resubscribes and resends
        // its queue from the delivery thread; the application's new sends
        // go after that, or the server could see a newer change of a client
        // before an older one.
        bool hold = state == LinkState::CONNECTING && !onDeliveryThread();
        queueWithFaults(std::move(message), Direction::TO_SERVER, hold ? heldWhileConnecting : queue);
    }
    changed.notify_all();
    return true;
}

void LoopbackTransport::deliverFromServer(uint64_t fromConnection, std::vector<unsigned char> bytes) {
    Message message;
    message.kind = Message::Kind::TO_CLIENT;
    message.connection = fromConnection;
    message.bytes = std::move(bytes);
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (fromConnection != connection || state == LinkState::DOWN) return;
        queueWithFaults(std::move(message), Direction::TO_CLIENT, queue);
    }
    changed.notify_all();
}

void LoopbackTransport::queueWithFaults(Message message, Direction direction, std::deque<Message>& into) {
    FaultInjector& faults = direction == Direction::TO_SERVER ? toServerFaults : toClientFaults;
    FaultInjector::Decision decision = faults.decide();
    message.delay = decision.delay;
    message.due = std::chrono::steady_clock::now() + decision.delay;
    if (decision.drop) {
        ++counts.dropped;
        message.lost = true;
        into.push_back(std::move(message));
        return;
    }
    if (decision.delay.count() > 0) ++counts.delayed;
    if (decision.copies > 1) {
        ++counts.duplicated;
        into.push_back(message);
    }
    into.push_back(std::move(message));
}

void LoopbackTransport::run() {
    std::unique_lock<std::mutex> lock(mutex);
    while (!stopping) {
        if (queue.empty()) {
            changed.wait(lock);
            continue;
        }
        if (queue.front().due > std::chrono::steady_clock::now()) {
            changed.wait_until(lock, queue.front().due);
            continue;
        }
        Message message = std::move(queue.front());
        queue.pop_front();
        if (message.connection != connection) continue;
        SyncServer::SessionId currentSession = session;
        delivering = true;
        lock.unlock();
        handle(message, currentSession);
        lock.lock();
        delivering = false;
        changed.notify_all();
    }
}

void LoopbackTransport::handle(Message& message, SyncServer::SessionId currentSession) {
    if (message.lost) {
        lv_printLog(LogPriority::kDebug, kServerLogTag, "LoopbackTransport: a message was lost, the link goes down");
        breakLink(message.connection);
        return;
    }
    // The store's callbacks catch their own failures; whatever still comes
    // through must not end the delivery thread.
    try {
        switch (message.kind) {
            case Message::Kind::CONNECTED:
                reportConnection(message.connection);
                return;
            case Message::Kind::TO_SERVER:
                handleToServer(message, currentSession);
                return;
            case Message::Kind::TO_CLIENT:
                handleToClient(message);
                return;
        }
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kWarn, kServerLogTag, "LoopbackTransport: delivery failed: %s", e.what());
    }
}

void LoopbackTransport::handleToServer(const Message& message, SyncServer::SessionId currentSession) {
    SyncServer::Receipt receipt = server->receive(currentSession, message.topic, message.bytes);
    switch (receipt.outcome) {
        case SyncServer::Outcome::CHANGE_ACCEPTED:
        case SyncServer::Outcome::CHANGE_ECHOED:
            if (message.isChange) onDeltaStatusUpdated(DeltaStatusUpdate{message.change, DeltaStatus::SENT});
            return;
        case SyncServer::Outcome::SUBSCRIBED:
            onSubscriptionResponseReceived(SubscriptionResponse{receipt.collectionName, receipt.sequenceNumber});
            return;
        case SyncServer::Outcome::SNAPSHOT_SENT:
        case SyncServer::Outcome::DROPPED:
            return;
    }
}

void LoopbackTransport::handleToClient(const Message& message) {
    ServerPayload payload = protocol::deserializeServerPayload(message.bytes);
    if (payload.type == PayloadType::SNAPSHOT) {
        onSnapshotReceived(protocol::deserializeSnapshot(payload.data));
    } else {
        onDeltaReceived(protocol::deserializeDeltaList(payload.data));
    }
}

void LoopbackTransport::reportConnection(uint64_t reportedConnection) {
    try {
        onConnectionEstablished();
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kWarn, kServerLogTag, "LoopbackTransport: connection callback failed: %s", e.what());
    }
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (reportedConnection != connection || state != LinkState::CONNECTING) return;
        state = LinkState::UP;
        auto now = std::chrono::steady_clock::now();
        for (Message& held : heldWhileConnecting) {
            held.due = now + held.delay;
            queue.push_back(std::move(held));
        }
        heldWhileConnecting.clear();
    }
    changed.notify_all();
}

void LoopbackTransport::breakLink(uint64_t brokenConnection) {
    SyncServer::SessionId oldSession = 0;
    {
        std::lock_guard<std::mutex> lock(mutex);
        oldSession = takeDown(brokenConnection);
    }
    if (oldSession != 0) server->detach(oldSession);
}

SyncServer::SessionId LoopbackTransport::takeDown(uint64_t downConnection) {
    if (downConnection != connection || state == LinkState::DOWN) return 0;
    state = LinkState::DOWN;
    ++connection;
    queue.clear();
    heldWhileConnecting.clear();
    SyncServer::SessionId oldSession = session;
    session = 0;
    changed.notify_all();
    return oldSession;
}

bool LoopbackTransport::onDeliveryThread() const { return std::this_thread::get_id() == deliveryThread.get_id(); }

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
