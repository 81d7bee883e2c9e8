// The networked sync server: the SyncServer rules over a SqliteLogStorage,
// or a PostgresLogStorage that several instances share, served to stores
// through an MQTT broker (the program tessarine-server runs one; tests and
// applications can embed it).
//
// It subscribes to the three request topics of tessarine/Protocol.h, with
// one subscription so that each client's requests arrive in the order it
// sent them on any MQTT 3.1.1 broker (mosquitto, a NATS cluster's MQTT
// listeners), and answers each client on mqtt::clientTopic(client id), QoS
// 1. Every time it connects to the broker it publishes a new retained token on
// mqtt::TOPIC_SERVER_ONLINE, once the broker has granted its subscription,
// so that clients resend whatever it may have lost meanwhile (see
// MqttTransport).
//
// Sessions: a store's subscription to a collection starts a new session for
// that (client id, collection): the store subscribes again on every
// connection of its own and whenever the server comes back, and wants the
// changes after the sequence number it holds from then on. A change or a
// snapshot request goes to the session of its (client id, collection).
// Every connection to the broker ends all sessions, and a change without a
// session is dropped (logged at priority 3): changes may have been lost on
// the way meanwhile, and a change that overtook a lost one must not be
// applied before it. The client resends both, in order, after subscribing
// again, which it does on seeing the new token.
//
// Several instances (Options::postgres set): every instance subscribes to
// the request topics, so every one sees every request, and serves only the
// collections whose lease it holds (CollectionLeases); it ignores requests
// for the others and notices their names, so that it takes the lease of a
// collection nobody serves. Whenever it starts serving a collection it
// publishes a new token: clients subscribe again and resend what they have
// not seen accepted, whatever the previous holder had lost. A collection's
// sessions are dropped when it is served again after a gap (its lease epoch
// changed), since its changes went elsewhere meanwhile. After the database
// failed requests (they were dropped, nothing echoed), the next lease round
// that reaches it publishes a new token too, so that clients resend them.
// Everything durable is in the database; sessions are rebuilt from tokens.
//
// Durability: a change is echoed or forwarded only after the storage
// committed it, so a store is never told PERSISTED of a change the server
// could lose; a server killed at any point serves on from its file when
// started again.
//
// Bad input: payloads that do not parse, are of the wrong kind for their
// topic, name an invalid collection or are larger than
// Options::broker.maxPayloadBytes are logged and dropped (SyncServer's rules);
// the server goes on serving.
//
// Threads: every payload is handled on the broker connection's network
// thread; with several instances, the lease keeper's thread publishes
// tokens. The destructor stops the keeper (ending its leases), then
// disconnects and joins the network thread.
//
// Errors: the constructor throws when the data file cannot be opened
// (lumivale::sqlite::SQLiteException), or the broker options cannot be
// used, or name PostgreSQL in a build without it (std::runtime_error). A
// PostgreSQL database that cannot be reached is tried again (logged), at
// start as later.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <mutex>
#include <string>
#include <utility>

#include "server/CollectionLeases.h"
#include "server/CollectionOwnership.h"
#include "server/PostgresLogStorage.h"
#include "server/SyncServer.h"
#include "tessarine/mqtt/MqttConnection.h"

namespace lumivale {
namespace tessarine {
namespace server {

class NetworkSyncServer {
public:
    struct Options {
        mqtt::ConnectionOptions broker;
        std::string dataPath = "tessarine-server.db";
        // Not empty: a libpq connection string; the PostgreSQL database,
        // shared with other instances, instead of the file at dataPath.
        std::string postgres{};
        // Names this instance in the leases; empty: host name and process id.
        std::string instanceId{};
        CollectionLeases::Timings leaseTimings{};
    };

    explicit NetworkSyncServer(const Options& options);
    ~NetworkSyncServer();
    NetworkSyncServer(const NetworkSyncServer&) = delete;
    NetworkSyncServer& operator=(const NetworkSyncServer&) = delete;

    // Starts connecting to the broker.
    void start();

    // The rules and what they hold, for tests and for the program's summary.
    const SyncServer& rules() const { return server; }

private:
    using SessionKey = std::pair<std::string, std::string>;  // (client id, collection)

    std::unique_ptr<LogStorage> makeStorage(const Options& options);
    std::unique_ptr<CollectionOwnership> makeLeases(const Options& options);
    void handleConnected();
    void publishToken();
    void handleMessage(const std::string& topic, const std::vector<unsigned char>& payload);
    // The (client id, collection) a request names, or empty when it names
    // none (the rules then drop it).
    static std::optional<SessionKey> requestKey(const std::string& topic, const std::vector<unsigned char>& payload);
    // With leases: whether this instance serves the collection now (sessions
    // of an earlier epoch dropped); notices it when not.
    bool serves(const std::string& collectionName);
    // The session a request belongs to. 0 for a change of a client that has
    // not subscribed since this connection to the broker began; transient
    // for a snapshot request without a session, to be detached once answered.
    SyncServer::SessionId sessionFor(const std::string& topic, const SessionKey& key, bool& transient);
    SyncServer::SessionId attachFor(const std::string& clientId);
    // On the keeper's thread after each lease round.
    void afterLeaseRound(bool acquired);

    PostgresLogStorage* postgres = nullptr;  // the storage, when it is PostgreSQL (owned by server)
    SyncServer server;
    std::map<SessionKey, SyncServer::SessionId> sessions;  // only the network thread uses it
    std::map<std::string, uint64_t> sessionEpochs;  // the lease epoch the sessions belong to; network thread only
    SyncServer::SessionId discarding = 0;
    std::atomic<uint64_t> tokens{0};
    uint64_t failuresSeen = 0;  // the keeper thread's

    // Before the connection, whose thread asks it; stopped first by the destructor.
    std::unique_ptr<CollectionOwnership> leases;
    mqtt::MqttConnection connection;  // last: its thread calls into the members above
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
