// A LogStorage in memory: what the reference server keeps, lost with the
// process. See LogStorage.h for what callers may rely on.
#pragma once

#include <map>
#include <string>
#include <utility>
#include <vector>

#include "server/LogStorage.h"

namespace lumivale {
namespace tessarine {
namespace server {

class MemoryLogStorage : public LogStorage {
public:
    std::optional<SyncProtocol::Delta> findAccepted(const SyncProtocol::Delta& change) override;
    std::optional<SyncProtocol::Delta> append(const SyncProtocol::Delta& change) override;
    std::vector<SyncProtocol::Delta> changesAfter(const std::string& collectionName, uint64_t sequenceNumber) override;
    uint64_t lastSequenceNumber(const std::string& collectionName) override;
    std::optional<uint64_t> highestVersionId(const std::string& collectionName, const std::string& clientId) override;
    std::vector<SyncProtocol::TessarineObject> objects(const std::string& collectionName) override;

private:
    struct Collection {
        std::vector<SyncProtocol::Delta> log;  // log[i] has sequence number i + 1
        std::map<std::string, SyncProtocol::TessarineObject> objects;        // by primary key
        std::map<std::string, uint64_t> highestVersionIds;                   // by client id
        std::map<std::pair<std::string, uint64_t>, uint64_t> acceptedAt;     // (client, version) -> sequence
    };

    const Collection* find(const std::string& collectionName) const;

    std::map<std::string, Collection> collections;
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
