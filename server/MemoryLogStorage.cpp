#include "server/MemoryLogStorage.h"

#include <algorithm>
#include <tuple>

namespace lumivale {
namespace tessarine {
namespace server {

const MemoryLogStorage::Collection* MemoryLogStorage::find(const std::string& collectionName) const {
    auto found = collections.find(collectionName);
    return found == collections.end() ? nullptr : &found->second;
}

std::optional<SyncProtocol::Delta> MemoryLogStorage::findAccepted(const SyncProtocol::Delta& change) {
    const Collection* collection = find(change.collectionName);
    if (collection == nullptr) return std::nullopt;
    auto earlier = collection->acceptedAt.find({change.clientId, change.versionId});
    if (earlier == collection->acceptedAt.end()) return std::nullopt;
    return collection->log[earlier->second - 1];
}

std::optional<SyncProtocol::Delta> MemoryLogStorage::append(const SyncProtocol::Delta& change) {
    Collection& collection = collections[change.collectionName];
    SyncProtocol::Delta logged = change;
    logged.sequenceNumber = collection.log.size() + 1;
    collection.log.push_back(logged);
    collection.acceptedAt.emplace(std::make_pair(change.clientId, change.versionId), logged.sequenceNumber);
    uint64_t& highest = collection.highestVersionIds[change.clientId];
    highest = std::max(highest, change.versionId);
    if (change.type == SyncProtocol::DeltaType::DELETE) {
        collection.objects.erase(change.primaryKey);
    } else {
        collection.objects[change.primaryKey] =
            SyncProtocol::TessarineObject{change.primaryKey, change.sortKey, change.blob};
    }
    return logged;
}

std::vector<SyncProtocol::Delta> MemoryLogStorage::changesAfter(const std::string& collectionName,
                                                                uint64_t sequenceNumber) {
    const Collection* collection = find(collectionName);
    if (collection == nullptr || sequenceNumber >= collection->log.size()) return {};
    return std::vector<SyncProtocol::Delta>(collection->log.begin() + sequenceNumber, collection->log.end());
}

uint64_t MemoryLogStorage::lastSequenceNumber(const std::string& collectionName) {
    const Collection* collection = find(collectionName);
    return collection == nullptr ? 0 : collection->log.size();
}

std::optional<uint64_t> MemoryLogStorage::highestVersionId(const std::string& collectionName,
                                                           const std::string& clientId) {
    const Collection* collection = find(collectionName);
    if (collection == nullptr) return std::nullopt;
    auto found = collection->highestVersionIds.find(clientId);
    if (found == collection->highestVersionIds.end()) return std::nullopt;
    return found->second;
}

std::vector<SyncProtocol::TessarineObject> MemoryLogStorage::objects(const std::string& collectionName) {
    std::vector<SyncProtocol::TessarineObject> result;
    const Collection* collection = find(collectionName);
    if (collection == nullptr) return result;
    result.reserve(collection->objects.size());
    for (const auto& entry : collection->objects) result.push_back(entry.second);
    std::sort(result.begin(), result.end(), [](const auto& a, const auto& b) {
        return std::tie(a.sortKey, a.primaryKey) < std::tie(b.sortKey, b.primaryKey);
    });
    return result;
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
