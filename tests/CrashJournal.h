// What the crash writer (crash_writer.cpp) and the durability test agree on.
// The writer's writes follow from its seed alone (WritePlan), so its journal
// only says "ready" once the store is open and then, one line each, the
// version id of every write the store acknowledged, flushed to disk before
// the next write starts. Remote batches save r0..r7 with remoteBlob(sequence).
#pragma once

#include <random>
#include <string>
#include <unordered_map>
#include <vector>

#include "tessarine/SyncProtocol.h"

namespace testsupport {

inline const char* const kJournalCollections[] = {"crash:notes", "crash:tasks"};
constexpr size_t kRemoteObjects = 8;

inline std::vector<unsigned char> remoteBlob(uint64_t sequenceNumber) {
    std::vector<unsigned char> blob(508, static_cast<unsigned char>(sequenceNumber));  // some work to apply
    for (int i = 0; i < 8; ++i) blob[i] = static_cast<unsigned char>(sequenceNumber >> (8 * i));
    return blob;
}

// Indexes every object by its blob size, so that every write writes index rows.
inline std::unordered_multimap<std::string, std::string> journalIndexer(const std::string&, const std::string&,
                                                                        const std::string&,
                                                                        const std::vector<unsigned char>& blob) {
    return {{"len", std::to_string(blob.size())}};
}

// The writer's writes in order, as the store queues them (no client id, no
// version id): mostly saves of small, some of large blobs, one in five a delete.
class WritePlan {
public:
    explicit WritePlan(unsigned seed) : random(seed) {}
    lumivale::tessarine::SyncProtocol::Delta next() {
        using Type = lumivale::tessarine::SyncProtocol::DeltaType;
        lumivale::tessarine::SyncProtocol::Delta write;
        write.collectionName = kJournalCollections[random() % 2];
        write.primaryKey = "k" + std::to_string(random() % 12);
        write.type = random() % 5 != 0 ? Type::SAVE : Type::DELETE;
        if (write.type == Type::DELETE) return write;
        write.sortKey = "s" + std::to_string(random() % 1000);
        unsigned sizeClass = random() % 20;
        write.blob.resize(sizeClass == 0 ? 100000 + random() % 300000 : sizeClass < 6 ? random() % 20000 : random() % 300);
        for (unsigned char& byte : write.blob) byte = static_cast<unsigned char>(random());
        return write;
    }

private:
    std::mt19937 random;
};

}  // namespace testsupport
