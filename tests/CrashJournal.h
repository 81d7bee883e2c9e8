// What the crash writer (crash_writer.cpp) and the durability test agree on:
// the collections and keys it writes, how blobs are made from their seeds,
// the indexer both install, and the journal of writes with its parser.
#pragma once

#include <cstdint>
#include <fstream>
#include <optional>
#include <random>
#include <sstream>
#include <string>
#include <unordered_map>
#include <vector>

namespace testsupport {

inline const char* const kJournalCollections[] = {"crash:notes", "crash:tasks"};
constexpr unsigned kKeysPerCollection = 12;
constexpr int kRemoteObjects = 8;

// The bytes of a saved blob, all of them determined by seed and size.
inline std::vector<unsigned char> journalBlob(uint32_t seed, uint32_t size) {
    std::mt19937 random(seed);
    std::vector<unsigned char> blob(size);
    for (unsigned char& byte : blob) byte = static_cast<unsigned char>(random());
    return blob;
}

// The blob of every object of a remote batch: its sequence number in eight
// bytes, then 500 bytes of filler, so that a batch takes some work to apply.
inline std::vector<unsigned char> remoteBlob(uint64_t sequenceNumber) {
    std::vector<unsigned char> blob(508, static_cast<unsigned char>(sequenceNumber));
    for (int i = 0; i < 8; ++i) blob[i] = static_cast<unsigned char>(sequenceNumber >> (8 * i));
    return blob;
}

// Indexes every object under "len" by its blob size, so that every write
// also writes index rows.
inline std::unordered_multimap<std::string, std::string> journalIndexer(const std::string&, const std::string&,
                                                                        const std::string&,
                                                                        const std::vector<unsigned char>& blob) {
    return {{"len", std::to_string(blob.size())}};
}

// One write the crash writer attempted.
struct JournalWrite {
    std::string collection;
    std::string primaryKey;
    bool isSave = true;
    std::string sortKey;  // saves only
    uint32_t blobSeed = 0;
    uint32_t blobSize = 0;
    // Set when the store acknowledged the write (returned true).
    std::optional<uint64_t> acknowledgedVersionId;
    bool failed = false;  // the store returned false
};

inline std::string formatWrite(const JournalWrite& write) {
    std::ostringstream line;
    line << "W " << write.collection << " " << write.primaryKey << " " << (write.isSave ? "S" : "D") << " "
         << (write.isSave ? write.sortKey : "-") << " " << write.blobSeed << " " << write.blobSize;
    return line.str();
}

struct Journal {
    bool ready = false;
    std::vector<JournalWrite> writes;  // in the order they were attempted
};

// Reads a journal; a last line cut off by the kill is ignored.
inline Journal readJournal(const std::string& path) {
    Journal journal;
    std::ifstream in(path);
    std::string content((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    std::istringstream lines(content.substr(0, content.rfind('\n') + 1));
    std::string line;
    while (std::getline(lines, line)) {
        std::istringstream fields(line);
        std::string kind;
        fields >> kind;
        if (kind == "ready") {
            journal.ready = true;
        } else if (kind == "W") {
            JournalWrite write;
            std::string type;
            fields >> write.collection >> write.primaryKey >> type >> write.sortKey >> write.blobSeed >>
                write.blobSize;
            write.isSave = type == "S";
            if (!write.isSave) write.sortKey.clear();
            journal.writes.push_back(write);
        } else if (kind == "A" && !journal.writes.empty()) {
            uint64_t versionId = 0;
            fields >> versionId;
            journal.writes.back().acknowledgedVersionId = versionId;
        } else if (kind == "F" && !journal.writes.empty()) {
            journal.writes.back().failed = true;
        }
    }
    return journal;
}

}  // namespace testsupport
