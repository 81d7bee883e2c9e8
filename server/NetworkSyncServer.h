// The networked sync server: the SyncServer rules over a SqliteLogStorage,
// served to stores through an MQTT broker (the program tessarine-server runs
// one; tests and applications can embed it).
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
// thread. The destructor disconnects and joins it.
//
// Errors: the constructor throws when the data file cannot be opened
// (lumivale::sqlite::SQLiteException) or the broker options cannot be used
// (std::runtime_error).
#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <utility>

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

    void handleConnected();
    void handleMessage(const std::string& topic, const std::vector<unsigned char>& payload);
    // The session a payload belongs to, or the discarding one when the
    // payload names no client and collection (the rules then drop it).
    // 0 for a change of a client that has not subscribed since this
    // connection to the broker began; transient for a snapshot request
    // without a session, to be detached once answered.
    SyncServer::SessionId sessionFor(const std::string& topic, const std::vector<unsigned char>& payload,
                                     bool& transient);
    SyncServer::SessionId attachFor(const std::string& clientId);

    SyncServer server;
    std::map<SessionKey, SyncServer::SessionId> sessions;  // only the network thread uses it
    SyncServer::SessionId discarding = 0;
    uint64_t connections = 0;

    mqtt::MqttConnection connection;  // last: its thread calls into the members above
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
