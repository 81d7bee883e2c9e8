// Reads what a store file holds, for tessarine-inspect, without ever writing
// to it.
//
// The file is opened with SQLite's read-only flag, so nothing is written to
// the database or its write-ahead log, and it is safe while the application
// has the store open: in WAL mode a reader never blocks the writer, and each
// read (summary, objects, queue) runs in one read transaction, so its counts
// agree with each other even while the application writes. SQLite still
// uses the "-shm" index that the application's connection shares, as every
// reader of a WAL database does. A file that another connection holds
// exclusively is waited for up to kBusyTimeout, then reported as locked.
//
// Table names and statements come from the library's storage classes, so
// the inspector reads the file as the store itself does.
//
// Errors: every failure throws InspectError with a message meant for a
// person ("no such file", "not a Tessarine store", "the store is locked by
// another process", ...). One thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {
namespace inspect {

class InspectError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

struct CollectionSummary {
    std::string name;
    uint64_t pending = 0, sent = 0, persisted = 0;  // objects by status
    uint64_t versionIdCounter = 0;                   // the last version id handed out
    std::optional<uint64_t> sequenceNumber;          // empty when not subscribed
};

struct QueueSummary {
    uint64_t length = 0;
    uint64_t pending = 0, sent = 0;
    // The oldest (lowest) queued version id of each collection with queued
    // changes, by collection name: the file keeps no times.
    std::vector<std::pair<std::string, uint64_t>> oldestVersionIds;
};

struct StoreSummary {
    std::string clientId;
    uint64_t dataVersion = 0;
    std::vector<CollectionSummary> collections;  // by name
    QueueSummary queue;
    std::vector<std::string> integrity;  // the rows of PRAGMA integrity_check; {"ok"} when sound

    bool integrityOk() const { return integrity.size() == 1 && integrity[0] == "ok"; }
};

struct StoredObject {
    std::string primaryKey, sortKey;
    int status = 0;  // 1 PENDING, 2 SENT, 3 PERSISTED
    std::vector<unsigned char> blob;
};

struct QueuedDelta {
    std::string collectionName;
    uint64_t versionId = 0;
    int type = 0;    // 1 SAVE, 2 DELETE
    int status = 0;  // 1 PENDING, 2 SENT
    std::string primaryKey, sortKey;
    std::vector<unsigned char> blob;
};

class StoreInspector {
public:
    static constexpr std::chrono::milliseconds kBusyTimeout{2000};

    // Opens the store at path for reading and checks that it is one.
    explicit StoreInspector(const std::string& path);
    ~StoreInspector();
    StoreInspector(const StoreInspector&) = delete;
    StoreInspector& operator=(const StoreInspector&) = delete;

    StoreSummary summary();
    // The collection's objects in sort-key order; throws InspectError for a
    // collection the store does not have.
    std::vector<StoredObject> objects(const std::string& collectionName);
    // The outgoing queue in the order in which it is resent.
    std::vector<QueuedDelta> queue();

private:
    std::vector<std::string> collectionNames();
    CollectionSummary collectionSummary(const std::string& name);
    QueueSummary queueSummary();
    std::vector<std::string> integrityCheck();
    // Runs read in one read transaction, turning SQLite's errors into
    // InspectError.
    template <typename Read>
    auto reading(Read read) -> decltype(read());

    std::string path;
    std::shared_ptr<lumivale::sqlite::Database> database;
};

}  // namespace inspect
}  // namespace tessarine
}  // namespace lumivale
