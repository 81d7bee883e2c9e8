#include "tessarine/mqtt/MqttTransport.h"

#include <algorithm>
#include <exception>

#include "platform/Log.h"
#include "tessarine/Protocol.h"
#include "tessarine/StoreLog.h"

namespace lumivale {
namespace tessarine {
namespace mqtt {

namespace {
constexpr const char* kName = "MqttTransport";
// True on the network thread while the store resynchronises: its resends go
// straight out.
thread_local bool resynchronising = false;
}  // namespace

MqttTransport::MqttTransport(const Options& options)
    : resendUnansweredAfter(options.resendUnansweredAfter),
      unansweredAllowed(options.resendUnansweredAfter),
      connection(options, kName,
                 MqttConnection::Handlers{
                     [this] { handleConnected(); },
                     [this](const std::string& topic, std::vector<unsigned char> payload, bool retained) {
                         handleMessage(topic, payload, retained);
                     },
                     [this](int messageId) { handlePublished(messageId); },
                     [this] { handleDisconnected(); }}) {
    connection.subscribe(TOPIC_SERVER_ONLINE);
    watch = std::thread([this] { watchForUnanswered(); });
}

MqttTransport::~MqttTransport() {
    {
        std::lock_guard<std::mutex> lock(mutex);
        stopping = true;
    }
    stoppingWake.notify_all();
    watch.join();
}

void MqttTransport::watchForUnanswered() {
    // Often enough that a due resend is noticed within a quarter of the wait.
    const auto period = std::min<std::chrono::milliseconds>(resendUnansweredAfter / 4, std::chrono::seconds(1));
    std::unique_lock<std::mutex> lock(mutex);
    while (!stoppingWake.wait_for(lock, period, [this] { return stopping; })) {
        if (!resendDue(std::chrono::steady_clock::now())) continue;
        ready = false;
        lock.unlock();
        lv_printLog(LogPriority::kInfo, kStoreLogTag, "%s: changes unanswered by the server: subscribing and resending", kName);
        try {
            resynchronise();
        } catch (const std::exception& e) {
            lv_printLog(LogPriority::kError, kStoreLogTag, "%s: cannot resynchronise: %s", kName, e.what());
        }
        lock.lock();
    }
}

bool MqttTransport::resendDue(std::chrono::steady_clock::time_point now) {
    std::optional<std::chrono::steady_clock::time_point> oldest = unanswered.oldest();
    if (!ready || !oldest || now - *oldest < unansweredAllowed) return false;
    unansweredAllowed = std::min(unansweredAllowed * 2, kMaxResendUnansweredAfter);
    return true;
}

void MqttTransport::noteAnswers(const std::vector<Delta>& deltas) {
    for (const Delta& delta : deltas) {
        if (clientIds.count(delta.clientId) != 0) unanswered.answered(delta.collectionName, delta.versionId);
    }
    if (unanswered.empty()) unansweredAllowed = resendUnansweredAfter;
}

void MqttTransport::noteAnswers(const Snapshot& snapshot) {
    unanswered.answeredUpTo(snapshot.collectionName, snapshot.versionId);
    if (unanswered.empty()) unansweredAllowed = resendUnansweredAfter;
}

void MqttTransport::start() { connection.start(); }

void MqttTransport::disconnect() { connection.stop(); }

void MqttTransport::connect() { connection.start(); }

bool MqttTransport::isConnected() const { return connection.isConnected(); }

void MqttTransport::listenAs(const std::string& clientId) {
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (!clientIds.insert(clientId).second) return;
    }
    connection.subscribe(clientTopic(clientId));
}

void MqttTransport::sendSubscriptionRequest(const SubscriptionRequest& request) {
    try {
        listenAs(request.clientId);
        connection.publish(protocol::TOPIC_SUBSCRIBE_COLLECTION, protocol::makePayloadForSubscription(request));
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "%s: cannot send a subscription: %s", kName, e.what());
    }
}

int MqttTransport::sendDelta(const Delta& delta) {
    try {
        listenAs(delta.clientId);
        std::lock_guard<std::mutex> lock(mutex);
        if (!ready && !resynchronising) {
            if (!connection.isConnected()) return 0;
            held.push_back(delta);
            return 1;
        }
        return publishChange(delta) != 0 ? 1 : 0;
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "%s: cannot send a change: %s", kName, e.what());
        return 0;
    }
}

int MqttTransport::publishChange(const Delta& delta) {
    // Called with the lock held, so that the acknowledgement, which can come
    // back before publish returns, finds the change.
    // Each change names the one tried before it, sent or not (a change after
    // one that did not go out must not be taken before it); the first since
    // the resynchronisation names itself.
    auto last = lastPublished.try_emplace({delta.clientId, delta.collectionName}, delta.versionId).first;
    int messageId =
        connection.publish(protocol::TOPIC_CHANGE_RECORD, protocol::makePayloadForSendDelta(delta, last->second));
    last->second = delta.versionId;
    if (messageId == 0) return 0;
    unacknowledged[messageId] = delta;
    unanswered.published(delta.collectionName, delta.versionId, std::chrono::steady_clock::now());
    return messageId;
}

void MqttTransport::sendSnapshotRequest(const std::string& collectionName, const std::string& clientId) {
    try {
        listenAs(clientId);
        connection.publish(protocol::TOPIC_SNAPSHOT, protocol::makePayloadForSnapshotRequest(collectionName, clientId));
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "%s: cannot send a snapshot request: %s", kName, e.what());
    }
}

void MqttTransport::handleConnected() {
    {
        // What the last connection did not see acknowledged is resent by the
        // store now, under new message ids.
        std::lock_guard<std::mutex> lock(mutex);
        ready = false;
        unacknowledged.clear();
    }
    resynchronise();
}

void MqttTransport::handleDisconnected() {
    // Held changes stay queued in the store, which resends them on the next
    // connection; the wait for answers starts again there.
    std::lock_guard<std::mutex> lock(mutex);
    ready = false;
    held.clear();
    delivered.clear();
    unanswered.clear();
    unansweredAllowed = resendUnansweredAfter;
}

void MqttTransport::resynchronise() {
    std::lock_guard<std::mutex> resynchronisingLock(resynchronisingMutex);
    {
        // Everything unanswered goes again now, and is timed again; the
        // first change of each collection after the subscription names
        // itself.
        std::lock_guard<std::mutex> lock(mutex);
        unanswered.clear();
        lastPublished.clear();
    }
    resynchronising = true;
    try {
        onConnectionEstablished();
    } catch (...) {
        resynchronising = false;
        throw;
    }
    resynchronising = false;
    std::lock_guard<std::mutex> lock(mutex);
    for (const Delta& delta : held) publishChange(delta);
    held.clear();
    ready = connection.isConnected();
}

void MqttTransport::handleMessage(const std::string& topic, const std::vector<unsigned char>& payload,
                                  bool retained) {
    if (topic == TOPIC_SERVER_ONLINE) {
        handleServerOnline(payload, retained);
    } else {
        handleServerPayload(payload);
    }
}

void MqttTransport::handleServerOnline(const std::vector<unsigned char>& payload, bool retained) {
    std::string token(payload.begin(), payload.end());
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (token.empty() || token == serverToken) return;
        serverToken = token;
        // The server was up before this connection subscribed, so before
        // its resynchronisation.
        if (retained) return;
        ready = false;
    }
    lv_printLog(LogPriority::kInfo, kStoreLogTag, "%s: the server is online (%s): subscribing and resending", kName, token.c_str());
    resynchronise();
}

void MqttTransport::handleServerPayload(const std::vector<unsigned char>& payload) {
    ServerPayload serverPayload;
    std::vector<Delta> deltas;
    Snapshot snapshot;
    try {
        serverPayload = protocol::deserializeServerPayload(payload);
        if (serverPayload.type == PayloadType::DELTA_LIST) {
            deltas = protocol::deserializeDeltaList(serverPayload.data);
        } else {
            snapshot = protocol::deserializeSnapshot(serverPayload.data);
        }
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "%s: dropped a server payload of %zu bytes: %s", kName,
                    payload.size(), e.what());
        return;
    }
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (serverPayload.type == PayloadType::DELTA_LIST) {
            deltas.erase(std::remove_if(deltas.begin(), deltas.end(),
                                        [this](const Delta& delta) { return !delivered.firstTime(delta); }),
                         deltas.end());
            if (deltas.empty()) return;  // copies only
            noteAnswers(deltas);
        } else {
            noteAnswers(snapshot);
        }
    }
    if (serverPayload.type == PayloadType::DELTA_LIST) {
        onDeltaReceived(deltas);
    } else {
        onSnapshotReceived(snapshot);
    }
}

void MqttTransport::handlePublished(int messageId) {
    DeltaStatusUpdate update;
    {
        std::lock_guard<std::mutex> lock(mutex);
        auto found = unacknowledged.find(messageId);
        if (found == unacknowledged.end()) return;  // not a change, or of an earlier connection
        update.delta = std::move(found->second);
        unacknowledged.erase(found);
    }
    update.status = DeltaStatus::SENT;
    onDeltaStatusUpdated(update);
}

}  // namespace mqtt
}  // namespace tessarine
}  // namespace lumivale
