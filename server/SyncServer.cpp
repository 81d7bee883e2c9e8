#include "server/SyncServer.h"

#include <exception>
#include <stdexcept>

#include "platform/Log.h"
#include "server/ServerProtocol.h"
#include "tessarine/Collection.h"
#include "tessarine/Protocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

constexpr const char* kTag = "tessarine_server";
constexpr int kWarningPriority = 5;

// Collection names become part of table names in every store, so a name the
// store would refuse is refused here before it reaches anyone.
void requireValidCollectionName(const std::string& collectionName) {
    if (!Collection::isValidCollectionName(collectionName)) {
        throw std::runtime_error("invalid collection name \"" + collectionName + "\"");
    }
}

}  // namespace

SyncServer::SessionId SyncServer::attach(Delivery delivery) {
    std::lock_guard<std::mutex> lock(mutex);
    SessionId id = ++lastSessionId;
    sessions.emplace(id, Session{std::move(delivery), {}});
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
        lv_printLog(kWarningPriority, kTag, "SyncServer: dropped a payload of %zu bytes on \"%s\" from session %llu: %s",
                    payload.size(), topic.c_str(), static_cast<unsigned long long>(sessionId), e.what());
        return Receipt{};
    }
}

SyncServer::Receipt SyncServer::receiveChange(SessionId sessionId, Session& session,
                                              const std::vector<unsigned char>& payload) {
    SyncProtocol::Delta change = protocol::makeTessarineDelta(payload, 0);
    requireValidCollectionName(change.collectionName);
    if (change.clientId.empty()) throw std::runtime_error("change without a client id");
    CollectionLog& log = collection(change.collectionName);
    CollectionLog::Acceptance acceptance = log.accept(change);
    if (!acceptance.isNew) {
        // A session that follows the collection has been sent every change
        // up to the last one, so the echo carries that number: a client
        // moves its sequence number forward only, and never asks for (and
        // re-applies) changes it already holds.
        if (session.subscriptions.count(change.collectionName) != 0) {
            sendChanges(session, {acceptance.change}, log.lastSequenceNumber());
        }
        return receipt(Outcome::CHANGE_ECHOED, change.collectionName, log);
    }
    for (const auto& entry : sessions) {
        if (entry.second.subscriptions.count(change.collectionName) != 0) {
            sendChanges(entry.second, {acceptance.change}, acceptance.change.sequenceNumber);
        }
    }
    lv_printLog(3, kTag, "SyncServer: session %llu: %s/%s version %llu accepted as %llu",
                static_cast<unsigned long long>(sessionId), change.collectionName.c_str(), change.primaryKey.c_str(),
                static_cast<unsigned long long>(change.versionId),
                static_cast<unsigned long long>(acceptance.change.sequenceNumber));
    return receipt(Outcome::CHANGE_ACCEPTED, change.collectionName, log);
}

SyncServer::Receipt SyncServer::receiveSubscription(Session& session, const std::vector<unsigned char>& payload) {
    SyncProtocol::SubscriptionRequest request = parseSubscriptionRequest(payload);
    requireValidCollectionName(request.collectionName);
    CollectionLog& log = collection(request.collectionName);
    // A session that already follows the collection has been sent every
    // change: what the client does not hold yet is on its way. Sending it
    // again would make the client apply older changes over newer ones.
    if (!session.subscriptions.insert(request.collectionName).second) {
        return receipt(Outcome::SUBSCRIBED, request.collectionName, log);
    }
    // A snapshot never deletes, so it suits only a client that holds nothing
    // of the collection yet besides changes the server never accepted; one
    // whose changes were accepted may hold objects deleted since, and
    // catches up from the start instead.
    bool holdsNothing = request.sequenceNumber == 0 && !log.hasChangesFrom(request.clientId);
    bool numberUnknown = request.sequenceNumber > log.lastSequenceNumber();
    if (holdsNothing || numberUnknown) {
        session.delivery(makeSnapshotPayload(log.snapshotFor(request.clientId)));
    } else {
        for (const SyncProtocol::Delta& change : log.catchUpAfter(request.sequenceNumber, request.clientId)) {
            sendChanges(session, {change}, change.sequenceNumber);
        }
    }
    return receipt(Outcome::SUBSCRIBED, request.collectionName, log);
}

SyncServer::Receipt SyncServer::receiveSnapshotRequest(Session& session, const std::vector<unsigned char>& payload) {
    SnapshotRequest request = parseSnapshotRequest(payload);
    requireValidCollectionName(request.collectionName);
    CollectionLog& log = collection(request.collectionName);
    session.delivery(makeSnapshotPayload(log.snapshotFor(request.clientId)));
    return receipt(Outcome::SNAPSHOT_SENT, request.collectionName, log);
}

CollectionLog& SyncServer::collection(const std::string& collectionName) {
    return collections.try_emplace(collectionName, collectionName).first->second;
}

const CollectionLog* SyncServer::findCollection(const std::string& collectionName) const {
    auto found = collections.find(collectionName);
    return found == collections.end() ? nullptr : &found->second;
}

void SyncServer::sendChanges(const Session& session, const std::vector<SyncProtocol::Delta>& changes,
                             uint64_t sequenceNumber) {
    session.delivery(makeDeltaListPayload(changes, sequenceNumber));
}

SyncServer::Receipt SyncServer::receipt(Outcome outcome, const std::string& collectionName, const CollectionLog& log) {
    return Receipt{outcome, collectionName, log.lastSequenceNumber()};
}

uint64_t SyncServer::sequenceNumber(const std::string& collectionName) const {
    std::lock_guard<std::mutex> lock(mutex);
    const CollectionLog* log = findCollection(collectionName);
    return log == nullptr ? 0 : log->lastSequenceNumber();
}

std::vector<SyncProtocol::TessarineObject> SyncServer::objects(const std::string& collectionName) const {
    std::lock_guard<std::mutex> lock(mutex);
    const CollectionLog* log = findCollection(collectionName);
    return log == nullptr ? std::vector<SyncProtocol::TessarineObject>() : log->objects();
}

uint64_t SyncServer::highestVersionId(const std::string& collectionName, const std::string& clientId) const {
    std::lock_guard<std::mutex> lock(mutex);
    const CollectionLog* log = findCollection(collectionName);
    return log == nullptr ? 0 : log->highestVersionId(clientId);
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
