#include "server/NetworkSyncServer.h"

#include <unistd.h>

#include <chrono>
#include <exception>

#include "platform/Log.h"
#include "server/ServerProtocol.h"
#include "server/SqliteLogStorage.h"
#include "tessarine/Collection.h"
#include "tessarine/Protocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

NetworkSyncServer::NetworkSyncServer(const Options& options)
    : server(std::make_unique<SqliteLogStorage>(options.dataPath)),
      discarding(server.attach([](std::vector<unsigned char>) {})),
      connection(options.broker, "tessarine-server",
                 mqtt::MqttConnection::Handlers{
                     [this] { handleConnected(); },
                     [this](const std::string& topic, std::vector<unsigned char> payload, bool) {
                         handleMessage(topic, payload);
                     },
                     nullptr, nullptr}) {
    for (const char* topic : {protocol::TOPIC_CHANGE_RECORD, protocol::TOPIC_SUBSCRIBE_COLLECTION,
                              protocol::TOPIC_SNAPSHOT}) {
        connection.subscribe(topic);
    }
}

NetworkSyncServer::~NetworkSyncServer() = default;

void NetworkSyncServer::start() { connection.start(); }

void NetworkSyncServer::handleConnected() {
    for (const auto& entry : sessions) server.detach(entry.second);
    sessions.clear();
    // Unique across restarts and reconnections: the process and the moment.
    auto now = std::chrono::system_clock::now().time_since_epoch();
    std::string token = std::to_string(::getpid()) + "-" +
                        std::to_string(std::chrono::duration_cast<std::chrono::microseconds>(now).count()) + "-" +
                        std::to_string(++connections);
    connection.publish(mqtt::TOPIC_SERVER_ONLINE, std::vector<unsigned char>(token.begin(), token.end()), true);
}

void NetworkSyncServer::handleMessage(const std::string& topic, const std::vector<unsigned char>& payload) {
    bool transient = false;
    SyncServer::SessionId session = sessionFor(topic, payload, transient);
    if (session == 0) {
        lv_printLog(LogPriority::kDebug, kServerLogTag,
                    "tessarine-server: dropped a change from a client without a session; it resends after subscribing");
        return;
    }
    server.receive(session, topic, payload);
    if (transient) server.detach(session);
}

SyncServer::SessionId NetworkSyncServer::sessionFor(const std::string& topic,
                                                    const std::vector<unsigned char>& payload, bool& transient) {
    std::string clientId;
    std::string collectionName;
    try {
        if (topic == protocol::TOPIC_CHANGE_RECORD) {
            SyncProtocol::Delta change = protocol::makeTessarineDelta(payload, 0);
            clientId = change.clientId;
            collectionName = change.collectionName;
        } else if (topic == protocol::TOPIC_SUBSCRIBE_COLLECTION) {
            SyncProtocol::SubscriptionRequest request = parseSubscriptionRequest(payload);
            clientId = request.clientId;
            collectionName = request.collectionName;
            // A new session: the old one's deliveries stop here, and the
            // subscription catches the client up from the number it holds.
            auto old = sessions.find({clientId, collectionName});
            if (old != sessions.end()) {
                server.detach(old->second);
                sessions.erase(old);
            }
        } else if (topic == protocol::TOPIC_SNAPSHOT) {
            SnapshotRequest request = parseSnapshotRequest(payload);
            clientId = request.clientId;
            collectionName = request.collectionName;
        }
    } catch (const std::exception&) {
        return discarding;  // the rules log why they drop it
    }
    if (clientId.empty() || !Collection::isValidCollectionName(collectionName)) return discarding;
    auto found = sessions.find({clientId, collectionName});
    if (found != sessions.end()) return found->second;
    if (topic == protocol::TOPIC_CHANGE_RECORD) return 0;
    SyncServer::SessionId session = attachFor(clientId);
    // A snapshot request subscribes to nothing, so it starts no session.
    transient = topic == protocol::TOPIC_SNAPSHOT;
    if (!transient) sessions.emplace(SessionKey{clientId, collectionName}, session);
    return session;
}

SyncServer::SessionId NetworkSyncServer::attachFor(const std::string& clientId) {
    std::string topic = mqtt::clientTopic(clientId);
    // Called under the rules' lock: publishing only queues the bytes.
    return server.attach([this, topic](std::vector<unsigned char> serverPayload) {
        connection.publish(topic, serverPayload);
    });
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
