#include "server/CollectionLog.h"

#include <algorithm>
#include <set>
#include <tuple>

namespace lumivale {
namespace tessarine {
namespace server {

CollectionLog::CollectionLog(std::string collectionName) : collectionName(std::move(collectionName)) {}

CollectionLog::Acceptance CollectionLog::accept(const SyncProtocol::Delta& change) {
    auto key = std::make_pair(change.clientId, change.versionId);
    auto earlier = acceptedAt.find(key);
    if (earlier != acceptedAt.end()) return Acceptance{false, log[earlier->second - 1]};

    SyncProtocol::Delta logged = change;
    logged.collectionName = collectionName;
    logged.sequenceNumber = log.size() + 1;
    log.push_back(logged);
    acceptedAt.emplace(std::move(key), logged.sequenceNumber);
    uint64_t& highest = highestVersionIds[change.clientId];
    highest = std::max(highest, change.versionId);
    apply(logged);
    return Acceptance{true, logged};
}

void CollectionLog::apply(const SyncProtocol::Delta& change) {
    if (change.type == SyncProtocol::DeltaType::DELETE) {
        currentObjects.erase(change.primaryKey);
        return;
    }
    currentObjects[change.primaryKey] = SyncProtocol::TessarineObject{change.primaryKey, change.sortKey, change.blob};
}

std::vector<SyncProtocol::Delta> CollectionLog::catchUpAfter(uint64_t sequenceNumber,
                                                             const std::string& clientId) const {
    std::vector<SyncProtocol::Delta> changes;
    std::set<std::string> objectsSeen;
    // Backwards, so that the first change met of an object is its last.
    for (uint64_t sequence = log.size(); sequence > sequenceNumber; --sequence) {
        const SyncProtocol::Delta& change = log[sequence - 1];
        bool isLastOfObject = objectsSeen.insert(change.primaryKey).second;
        if (isLastOfObject || change.clientId == clientId) changes.push_back(change);
    }
    std::reverse(changes.begin(), changes.end());
    return changes;
}

SyncProtocol::Snapshot CollectionLog::snapshotFor(const std::string& clientId) const {
    SyncProtocol::Snapshot snapshot;
    snapshot.collectionName = collectionName;
    snapshot.objects = objects();
    snapshot.sequenceNumber = lastSequenceNumber();
    snapshot.versionId = highestVersionId(clientId);
    return snapshot;
}

uint64_t CollectionLog::lastSequenceNumber() const { return log.size(); }

uint64_t CollectionLog::highestVersionId(const std::string& clientId) const {
    auto found = highestVersionIds.find(clientId);
    return found == highestVersionIds.end() ? 0 : found->second;
}

bool CollectionLog::hasChangesFrom(const std::string& clientId) const {
    return highestVersionIds.count(clientId) != 0;
}

std::vector<SyncProtocol::TessarineObject> CollectionLog::objects() const {
    std::vector<SyncProtocol::TessarineObject> result;
    result.reserve(currentObjects.size());
    for (const auto& entry : currentObjects) result.push_back(entry.second);
    std::sort(result.begin(), result.end(), [](const auto& a, const auto& b) {
        return std::tie(a.sortKey, a.primaryKey) < std::tie(b.sortKey, b.primaryKey);
    });
    return result;
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
