// The per-collection counter that numbers local changes, kept in the table
// "collection_version_ids" (collection_name, version_id).
//
// A collection's row starts at 0 when the collection is opened; its first
// local change gets 1, the next 2, and so on. The counter only grows and
// survives restarts. Collection names are compared byte for byte, so names
// that differ in case have separate counters.
//
// incrementAndGetVersionId increments and reads in one transaction: two
// writers never get the same id, and a failure between the two steps leaves
// the counter unchanged.
//
// Threads: no lock of its own; callable from any thread. Errors: nothing is
// caught; SQLite errors reach the caller (the constructor throws when the
// table cannot be created).
#pragma once

#include <cstdint>
#include <memory>
#include <string>

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class VersionIdGenerator {
public:
    static inline const std::string TABLE_NAME = "collection_version_ids";

    // Creates the table if it is missing.
    explicit VersionIdGenerator(std::shared_ptr<lumivale::sqlite::Database> database);
    virtual ~VersionIdGenerator();
    VersionIdGenerator(const VersionIdGenerator&) = delete;
    VersionIdGenerator& operator=(const VersionIdGenerator&) = delete;

    // Creates the collection's counter at 0; an existing counter is kept.
    virtual void initializeVersionId(const std::string& collectionName);
    // The collection's next version id, committed in a transaction of its
    // own. A collection without a counter row gets 0 (and still has no row).
    virtual uint64_t incrementAndGetVersionId(const std::string& collectionName);

    virtual void createVersionIdTable();
    // Adds 1 to the collection's counter; no row, no change.
    virtual void incrementVersionId(const std::string& collectionName);
    // The collection's counter; 0 when the collection has no row.
    virtual uint64_t queryVersionId(const std::string& collectionName);

private:
    std::shared_ptr<lumivale::sqlite::Database> database;
};

}  // namespace tessarine
}  // namespace lumivale
