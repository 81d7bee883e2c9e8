// The sync server's rules: speaks exactly the wire payloads of a store's
// transport, over a LogStorage that keeps what it accepted. With the default
// MemoryLogStorage it is the reference server, for demos and application
// tests; the networked server (NetworkSyncServer) runs the same rules over a
// SqliteLogStorage. It owns no socket; a transport (LoopbackTransport, or an
// application's own) attaches a session for each connection and hands it the
// bytes that its store publishes, topic by topic.
//
// Rules:
//   - Per collection the storage keeps a log of accepted changes numbered
//     1, 2, 3, ..., the current objects, and per client the highest version
//     id accepted.
//   - A change record (TOPIC_CHANGE_RECORD) is accepted once per (client id,
//     collection, version id). Every accepted change goes, as a delta list
//     with its sequence number, to every session subscribed to the
//     collection, the writer's included, in sequence order. A change that
//     was accepted before is not applied again: the server echoes it again,
//     as first logged, to the sending session (when that session is
//     subscribed to the collection), so that the writer retires it. The
//     echo's list carries the collection's last sequence number, which the
//     session has been sent everything up to, so that it never moves the
//     client's sequence number back.
//   - A subscription (TOPIC_SUBSCRIBE_COLLECTION) with sequence number n gets
//     the changes after n, one delta list per change, in order, leaving out
//     other clients' changes that a later change of the same object
//     supersedes (catchUpAfter in SyncServer.cpp says why). A snapshot instead
//     when n = 0 and the server has accepted no change of that client in the
//     collection (a client that had changes accepted catches up from 0: a
//     snapshot never deletes, and objects it holds may have been deleted
//     since), or when n is a number the server never reached (it has lost
//     its memory since). From then on the session gets every new change of
//     the collection. A session never gets a change twice: subscribing again
//     to a collection it follows sends nothing, since whatever the client
//     lacks is already on its way. (A store does not restore an object from
//     the echo of its own change once that change is retired, so a change
//     sent again after a newer one would leave the older one in place.)
//   - A snapshot request (TOPIC_SNAPSHOT) gets a snapshot and subscribes to
//     nothing. A snapshot lists the objects in ascending sort-key order with
//     the current sequence number and the requesting client's highest
//     accepted version id.
//   - A payload that does not parse, names an invalid collection or an empty
//     client id, or arrives on an unknown topic is dropped and logged at
//     priority 5 under the tag "tessarine_server"; it changes nothing and
//     reaches no one. So is a change the storage fails to record: nothing is
//     echoed, and the session's later changes to that collection are
//     dropped too until its client subscribes to it again, so that none is
//     logged ahead of the lost one; the client sends them all again, in
//     order, after its next subscription. The same holds for a change
//     that names a previous one (the client's previousVersionId, which the
//     MQTT transport sends) that is neither the last this session accepted
//     or echoed since the subscription nor logged: the broker lost that one;
//     or that names itself, the first since the client subscribed, when
//     the session took changes already: the broker lost that subscription.
//   - A change is sent to anyone only once the storage has recorded it.
//
// Threads: every operation may be called from any thread; one mutex guards
// the whole server. A session's delivery function is called with that mutex
// held, on the thread that called receive: it must only take the bytes
// (queue them) and return, never call back into the server or wait for
// anything that might.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include <memory>

#include "server/LogStorage.h"
#include "server/ServerLog.h"
#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

class SyncServer {
public:
    // Takes one ServerPayload buffer for the session's client.
    using Delivery = std::function<void(std::vector<unsigned char> serverPayload)>;
    using SessionId = uint64_t;

    enum class Outcome {
        CHANGE_ACCEPTED,  // a new change, logged and sent to the subscribers
        CHANGE_ECHOED,    // a change accepted before, echoed to the sender only
        SUBSCRIBED,       // the session now follows the collection
        SNAPSHOT_SENT,    // a snapshot went to the session
        DROPPED,          // the payload was not understood (logged)
    };

    struct Receipt {
        Outcome outcome = Outcome::DROPPED;
        // For every outcome but DROPPED: the collection concerned and its
        // last sequence number after the payload was handled.
        std::string collectionName;
        uint64_t sequenceNumber = 0;
    };

    // The reference server, in memory.
    SyncServer();
    // A server over the given storage, which it owns.
    explicit SyncServer(std::unique_ptr<LogStorage> storage);
    SyncServer(const SyncServer&) = delete;
    SyncServer& operator=(const SyncServer&) = delete;

    // A new session, subscribed to nothing; ids count from 1.
    SessionId attach(Delivery delivery);
    // Forgets the session and its subscriptions. Once this returns its
    // delivery function is never called again. Unknown ids are ignored.
    void detach(SessionId session);

    // Handles one payload that the session's client published on topic.
    // Never throws for bad input: the outcome is then DROPPED.
    Receipt receive(SessionId session, const std::string& topic, const std::vector<unsigned char>& payload);

    // What the server holds, for tests and demos. A collection the server
    // never heard of is empty, with sequence number 0.
    uint64_t sequenceNumber(const std::string& collectionName) const;
    std::vector<SyncProtocol::TessarineObject> objects(const std::string& collectionName) const;
    uint64_t highestVersionId(const std::string& collectionName, const std::string& clientId) const;

private:
    struct Session {
        Delivery delivery;
        std::set<std::string> subscriptions;
        // Collections of which a change was lost (the storage failed, or
        // the broker), until the next subscription to them.
        std::set<std::string> lostChanges;
        // Per collection, the highest version id of the session's client
        // accepted or echoed on this session since its subscription.
        std::map<std::string, uint64_t> lastTaken;
    };

    Receipt receiveChange(SessionId sessionId, Session& session, const std::vector<unsigned char>& payload);
    void requireFollowsLastTaken(const SyncProtocol::Delta& change, uint64_t previousVersionId,
                                 uint64_t lastTaken) const;
    Receipt receiveSubscription(Session& session, const std::vector<unsigned char>& payload);
    Receipt receiveSnapshotRequest(Session& session, const std::vector<unsigned char>& payload);
    std::vector<SyncProtocol::Delta> catchUpAfter(const std::string& collectionName, uint64_t sequenceNumber,
                                                  const std::string& clientId) const;
    SyncProtocol::Snapshot snapshotFor(const std::string& collectionName, const std::string& clientId) const;
    static void sendChanges(const Session& session, const std::vector<SyncProtocol::Delta>& changes,
                            uint64_t sequenceNumber);
    Receipt receipt(Outcome outcome, const std::string& collectionName) const;

    mutable std::mutex mutex;
    std::map<SessionId, Session> sessions;
    SessionId lastSessionId = 0;
    const std::unique_ptr<LogStorage> storage;
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
