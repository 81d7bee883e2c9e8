#include "server/SyncServer.h"

#include <algorithm>
#include <exception>
#include <set>
#include <stdexcept>

#include "platform/Log.h"
#include "server/MemoryLogStorage.h"
#include "server/ServerProtocol.h"
#include "tessarine/Collection.h"
#include "tessarine/Protocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

// Collection names become part of table names in every store, so a name the
// store would refuse is refused here before it reaches anyone.
void requireValidCollectionName(const std::string& collectionName) {
    if (!Collection::isValidCollectionName(collectionName)) {
        throw std::runtime_error("invalid collection name \"" + collectionName + "\"");
    }
}

}  // namespace

SyncServer::SyncServer() : SyncServer(std::make_unique<MemoryLogStorage>()) {}

SyncServer::SyncServer(std::unique_ptr<LogStorage> theStorage) : storage(std::move(theStorage)) {
    if (!storage) throw std::invalid_argument("SyncServer needs a storage");
}

SyncServer::SessionId SyncServer::attach(Delivery delivery) {
    std::lock_guard<std::mutex> lock(mutex);
    SessionId id = ++lastSessionId;
    sessions.emplace(id, Session{std::move(delivery), {}, {}, {}});
    return id;
}

void SyncServer::detach(SessionId session) {
    // The delivery function is destroyed outside the lock: it may own
    // whatever its transport gave it.
    Delivery released;
    {
        std::lock_guard<std::mutex> lock(mutex);
        auto found = sessions.find(session);
        if (found == sessions.end()) return;
        released = std::move(found->second.delivery);
        sessions.erase(found);
    }
}

SyncServer::Receipt SyncServer::receive(SessionId sessionId, const std::string& topic,
                                        const std::vector<unsigned char>& payload) {
    std::lock_guard<std::mutex> lock(mutex);
    try {
        auto found = sessions.find(sessionId);
        if (found == sessions.end()) throw std::runtime_error("no such session");
        if (topic == protocol::TOPIC_CHANGE_RECORD) return receiveChange(sessionId, found->second, payload);
        if (topic == protocol::TOPIC_SUBSCRIBE_COLLECTION) return receiveSubscription(found->second, payload);
        if (topic == protocol::TOPIC_SNAPSHOT) return receiveSnapshotRequest(found->second, payload);
        throw std::runtime_error("unknown topic");
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kWarn, kServerLogTag, "SyncServer: dropped a payload of %zu bytes on \"%s\" from session %llu: %s",
                    payload.size(), topic.c_str(), static_cast<unsigned long long>(sessionId), e.what());
        return Receipt{};
    }
}

SyncServer::Receipt SyncServer::receiveChange(SessionId sessionId, Session& session,
                                              const std::vector<unsigned char>& payload) {
    SyncProtocol::Delta change = protocol::makeTessarineDelta(payload, 0);
    requireValidCollectionName(change.collectionName);
    if (change.clientId.empty()) throw std::runtime_error("change without a client id");
    if (session.lostChanges.count(change.collectionName) != 0) {
        throw std::runtime_error("an earlier change of this session was not recorded; waiting for a subscription");
    }
    std::optional<SyncProtocol::Delta> earlier;
    std::optional<SyncProtocol::Delta> appended;
    uint64_t& lastTaken = session.lastTaken[change.collectionName];
    try {
        requireFollowsLastTaken(change, protocol::previousVersionIdOf(payload), lastTaken);
        earlier = storage->findAccepted(change);
        if (!earlier) appended = storage->append(change);
        if (!appended && !earlier) earlier = storage->findAccepted(change);
        if (!appended && !earlier) {
            throw std::runtime_error("the storage refused the change as logged but does not hold it");
        }
    } catch (...) {
        session.lostChanges.insert(change.collectionName);
        throw;
    }
    lastTaken = std::max(lastTaken, change.versionId);
    if (!appended) {
        // A session that follows the collection has been sent every change
        // up to the last one, so the echo carries that number: a client
        // moves its sequence number forward only, and never asks for (and
        // re-applies) changes it already holds.
        if (session.subscriptions.count(change.collectionName) != 0) {
            sendChanges(session, {*earlier}, storage->lastSequenceNumber(change.collectionName));
        }
        return receipt(Outcome::CHANGE_ECHOED, change.collectionName);
    }
    const SyncProtocol::Delta& logged = *appended;
    for (const auto& entry : sessions) {
        if (entry.second.subscriptions.count(change.collectionName) != 0) {
            sendChanges(entry.second, {logged}, logged.sequenceNumber);
        }
    }
    lv_printLog(LogPriority::kDebug, kServerLogTag, "SyncServer: session %llu: %s/%s version %llu accepted as %llu",
                static_cast<unsigned long long>(sessionId), change.collectionName.c_str(), change.primaryKey.c_str(),
                static_cast<unsigned long long>(change.versionId),
                static_cast<unsigned long long>(logged.sequenceNumber));
    return receipt(Outcome::CHANGE_ACCEPTED, change.collectionName);
}

// A change that names the one its client sent before it (in this
// collection, since subscribing) comes only after that one is logged: when
// the broker lost the other, taking this one would log them out of order.
// One that names itself is the first since the client subscribed, so it
// comes only first on its session: a session that took changes already
// missed that subscription (the broker lost it), and with it perhaps what
// was sent to the client meanwhile; echoes included, as an echo tells the
// client it holds the session's changes up to the last one. Either way the
// client sends them again after its next subscription.
void SyncServer::requireFollowsLastTaken(const SyncProtocol::Delta& change, uint64_t previousVersionId,
                                         uint64_t lastTaken) const {
    if (previousVersionId == 0) return;
    if (previousVersionId == change.versionId) {
        if (lastTaken == 0) return;
        throw std::runtime_error("the client subscribed again but the subscription never arrived; waiting for it");
    }
    if (previousVersionId == lastTaken) return;
    SyncProtocol::Delta previous = change;
    previous.versionId = previousVersionId;
    if (storage->findAccepted(previous)) return;  // taken on an earlier session
    throw std::runtime_error("the change sent before it (version " + std::to_string(previousVersionId) +
                             ") never arrived; waiting for a subscription");
}

SyncServer::Receipt SyncServer::receiveSubscription(Session& session, const std::vector<unsigned char>& payload) {
    SyncProtocol::SubscriptionRequest request = parseSubscriptionRequest(payload);
    requireValidCollectionName(request.collectionName);
    const std::string& name = request.collectionName;
    // The client sends everything it has not seen persisted again after
    // this, oldest first, naming none taken before.
    session.lostChanges.erase(name);
    session.lastTaken.erase(name);
    // A session that already follows the collection has been sent every
    // change: what the client does not hold yet is on its way. Sending it
    // again would make the client apply older changes over newer ones.
    if (!session.subscriptions.insert(name).second) return receipt(Outcome::SUBSCRIBED, name);
    // A snapshot never deletes, so it suits only a client that holds nothing
    // of the collection yet besides changes the server never accepted; one
    // whose changes were accepted may hold objects deleted since, and
    // catches up from the start instead.
    bool holdsNothing = request.sequenceNumber == 0 && !storage->highestVersionId(name, request.clientId);
    bool numberUnknown = request.sequenceNumber > storage->lastSequenceNumber(name);
    if (holdsNothing || numberUnknown) {
        session.delivery(makeSnapshotPayload(snapshotFor(name, request.clientId)));
    } else {
        for (const SyncProtocol::Delta& change : catchUpAfter(name, request.sequenceNumber, request.clientId)) {
            sendChanges(session, {change}, change.sequenceNumber);
        }
    }
    return receipt(Outcome::SUBSCRIBED, name);
}

SyncServer::Receipt SyncServer::receiveSnapshotRequest(Session& session, const std::vector<unsigned char>& payload) {
    SnapshotRequest request = parseSnapshotRequest(payload);
    requireValidCollectionName(request.collectionName);
    session.delivery(makeSnapshotPayload(snapshotFor(request.collectionName, request.clientId)));
    return receipt(Outcome::SNAPSHOT_SENT, request.collectionName);
}

// The changes after sequenceNumber that a client needs to catch up, in
// order: the last change of each object, and every change of clientId
// itself. Other clients' changes that a later change of the same object
// supersedes are left out.
//
// Why: a store may ask from a number older than what it has applied (its
// deliveries were still being applied when it reconnected). It would then
// apply an older change of another client over its own newer one, which the
// echo of its own change, already retired, does not restore. Its own changes
// stay in: until a store sees the echo of a change, it keeps its local
// version over the changes of others.
std::vector<SyncProtocol::Delta> SyncServer::catchUpAfter(const std::string& collectionName, uint64_t sequenceNumber,
                                                          const std::string& clientId) const {
    std::vector<SyncProtocol::Delta> logged = storage->changesAfter(collectionName, sequenceNumber);
    std::vector<SyncProtocol::Delta> changes;
    std::set<std::string> objectsSeen;
    // Backwards, so that the first change met of an object is its last.
    for (auto change = logged.rbegin(); change != logged.rend(); ++change) {
        bool isLastOfObject = objectsSeen.insert(change->primaryKey).second;
        if (isLastOfObject || change->clientId == clientId) changes.push_back(std::move(*change));
    }
    std::reverse(changes.begin(), changes.end());
    return changes;
}

// The current objects with the last sequence number and the client's
// highest accepted version id.
SyncProtocol::Snapshot SyncServer::snapshotFor(const std::string& collectionName, const std::string& clientId) const {
    return storage->snapshot(collectionName, clientId);
}

void SyncServer::sendChanges(const Session& session, const std::vector<SyncProtocol::Delta>& changes,
                             uint64_t sequenceNumber) {
    session.delivery(makeDeltaListPayload(changes, sequenceNumber));
}

SyncServer::Receipt SyncServer::receipt(Outcome outcome, const std::string& collectionName) const {
    return Receipt{outcome, collectionName, storage->lastSequenceNumber(collectionName)};
}

uint64_t SyncServer::sequenceNumber(const std::string& collectionName) const {
    std::lock_guard<std::mutex> lock(mutex);
    return storage->lastSequenceNumber(collectionName);
}

std::vector<SyncProtocol::TessarineObject> SyncServer::objects(const std::string& collectionName) const {
    std::lock_guard<std::mutex> lock(mutex);
    return storage->objects(collectionName);
}

uint64_t SyncServer::highestVersionId(const std::string& collectionName, const std::string& clientId) const {
    std::lock_guard<std::mutex> lock(mutex);
    return storage->highestVersionId(collectionName, clientId).value_or(0);
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
