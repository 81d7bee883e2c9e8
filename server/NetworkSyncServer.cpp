#include "server/NetworkSyncServer.h"

#include <unistd.h>

#include <chrono>
#include <exception>
#include <stdexcept>

#include "platform/Log.h"
#include "server/ServerProtocol.h"
#include "server/SqliteLogStorage.h"
#include "tessarine/Collection.h"
#include "tessarine/Protocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

// The three request topics (and the server's own token) are the levels
// under the root. One subscription takes them all, so that the broker hands
// them over in the order each client published them: a client's changes
// must come after its subscription, and a broker keeps order only within a
// subscription (NATS, for one, keeps each subscription's queue apart).
constexpr const char* kRequestTopics = "/+";
}  // namespace

NetworkSyncServer::NetworkSyncServer(const Options& options)
    : server(makeStorage(options)),
      discarding(server.attach([](std::vector<unsigned char>) {})),
      connection(options.broker, "tessarine-server",
                 mqtt::MqttConnection::Handlers{
                     [this] { handleConnected(); },
                     [this](const std::string& topic, std::vector<unsigned char> payload, bool) {
                         handleMessage(topic, payload);
                     },
                     nullptr, nullptr}) {
    if (postgres != nullptr) leases = makeLeases(options);
    connection.subscribe(kRequestTopics);
}

NetworkSyncServer::~NetworkSyncServer() {
    if (leases) leases->stop();
}

// PostgreSQL is built where libpq is (see server/CMakeLists.txt); the
// rest of this file reaches it only through these two.
#if TESSARINE_WITH_POSTGRES
namespace {

constexpr size_t kHostNameBytes = 256;

// The instance's name in the leases: as given, or the host and process.
std::string instanceIdOf(const NetworkSyncServer::Options& options) {
    if (!options.instanceId.empty()) return options.instanceId;
    char host[kHostNameBytes] = {};
    ::gethostname(host, sizeof host - 1);
    return std::string(host) + "-" + std::to_string(::getpid());
}

}  // namespace

std::unique_ptr<LogStorage> NetworkSyncServer::makeStorage(const Options& options) {
    if (options.postgres.empty()) return std::make_unique<SqliteLogStorage>(options.dataPath);
    auto storage = std::make_unique<PostgresLogStorage>(options.postgres, instanceIdOf(options));
    postgres = storage.get();
    return storage;
}

std::unique_ptr<CollectionOwnership> NetworkSyncServer::makeLeases(const Options& options) {
    return std::make_unique<CollectionLeases>(
        options.postgres, instanceIdOf(options), options.leaseTimings,
        CollectionLeases::Handlers{[this] { return connection.isListening(); },
                                   [this](bool acquired) { afterLeaseRound(acquired); }});
}
#else
std::unique_ptr<LogStorage> NetworkSyncServer::makeStorage(const Options& options) {
    if (!options.postgres.empty()) throw std::runtime_error("this build has no PostgreSQL support (libpq)");
    return std::make_unique<SqliteLogStorage>(options.dataPath);
}

std::unique_ptr<CollectionOwnership> NetworkSyncServer::makeLeases(const Options&) { return nullptr; }
#endif

void NetworkSyncServer::start() {
    connection.start();
    if (leases) leases->start();
}

void NetworkSyncServer::handleConnected() {
    for (const auto& entry : sessions) server.detach(entry.second);
    sessions.clear();
    publishToken();
}

void NetworkSyncServer::publishToken() {
    // Unique across restarts and reconnections: the process and the moment.
    auto now = std::chrono::system_clock::now().time_since_epoch();
    std::string token = std::to_string(::getpid()) + "-" +
                        std::to_string(std::chrono::duration_cast<std::chrono::microseconds>(now).count()) + "-" +
                        std::to_string(++tokens);
    connection.publish(mqtt::TOPIC_SERVER_ONLINE, std::vector<unsigned char>(token.begin(), token.end()), true);
}

void NetworkSyncServer::afterLeaseRound(bool acquired) {
    uint64_t failures = postgres->failures();
    if (!acquired && failures == failuresSeen) return;
    failuresSeen = failures;
    publishToken();
}

void NetworkSyncServer::handleMessage(const std::string& topic, const std::vector<unsigned char>& payload) {
    if (topic == mqtt::TOPIC_SERVER_ONLINE) return;  // tokens: its own, and other instances'
    std::optional<SessionKey> key = requestKey(topic, payload);
    if (key && leases && !serves(key->second)) return;
    bool transient = false;
    SyncServer::SessionId session = key ? sessionFor(topic, *key, transient) : discarding;
    if (session == 0) {
        lv_printLog(LogPriority::kDebug, kServerLogTag,
                    "tessarine-server: dropped a change from a client without a session; it resends after subscribing");
        return;
    }
    server.receive(session, topic, payload);
    if (transient) server.detach(session);
}

std::optional<NetworkSyncServer::SessionKey> NetworkSyncServer::requestKey(const std::string& topic,
                                                                          const std::vector<unsigned char>& payload) {
    SessionKey key;
    try {
        if (topic == protocol::TOPIC_CHANGE_RECORD) {
            SyncProtocol::Delta change = protocol::makeTessarineDelta(payload, 0);
            key = {change.clientId, change.collectionName};
        } else if (topic == protocol::TOPIC_SUBSCRIBE_COLLECTION) {
            SyncProtocol::SubscriptionRequest request = parseSubscriptionRequest(payload);
            key = {request.clientId, request.collectionName};
        } else if (topic == protocol::TOPIC_SNAPSHOT) {
            SnapshotRequest request = parseSnapshotRequest(payload);
            key = {request.clientId, request.collectionName};
        }
    } catch (const std::exception&) {
        return std::nullopt;  // the rules log why they drop it
    }
    if (key.first.empty() || !Collection::isValidCollectionName(key.second)) return std::nullopt;
    return key;
}

bool NetworkSyncServer::serves(const std::string& collectionName) {
    uint64_t epoch = leases->epoch(collectionName);
    if (epoch == 0) {
        leases->noticed(collectionName);
        return false;
    }
    uint64_t& sessionsEpoch = sessionEpochs[collectionName];
    if (sessionsEpoch != epoch) {
        for (auto entry = sessions.begin(); entry != sessions.end();) {
            if (entry->first.second != collectionName) {
                ++entry;
                continue;
            }
            server.detach(entry->second);
            entry = sessions.erase(entry);
        }
        sessionsEpoch = epoch;
    }
    return true;
}

SyncServer::SessionId NetworkSyncServer::sessionFor(const std::string& topic, const SessionKey& key,
                                                    bool& transient) {
    if (topic == protocol::TOPIC_SUBSCRIBE_COLLECTION) {
        // A new session: the old one's deliveries stop here, and the
        // subscription catches the client up from the number it holds.
        auto old = sessions.find(key);
        if (old != sessions.end()) {
            server.detach(old->second);
            sessions.erase(old);
        }
    }
    auto found = sessions.find(key);
    if (found != sessions.end()) return found->second;
    if (topic == protocol::TOPIC_CHANGE_RECORD) return 0;
    SyncServer::SessionId session = attachFor(key.first);
    // A snapshot request subscribes to nothing, so it starts no session.
    transient = topic == protocol::TOPIC_SNAPSHOT;
    if (!transient) sessions.emplace(key, session);
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
