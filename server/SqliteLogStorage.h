// A LogStorage in a SQLite file: what the networked server keeps, so that it
// serves on from where it was after a restart or a crash. See LogStorage.h
// for what callers may rely on.
//
// The file holds two tables: "changes" (the log; (collection, client_id,
// version_id) is unique there, so the file itself refuses a change twice)
// and "objects" (the current objects). append is one immediate transaction,
// committed with synchronous=FULL in WAL mode before it returns: a change it
// returned survives the process being killed and the machine losing power.
//
// Errors: lumivale::sqlite::SQLiteException, from the constructor when the
// file cannot be opened or is not a server file, from any operation when
// SQLite fails; a failed append leaves the file as it was.
//
// Threads: one thread at a time (its owner's lock); the connection is its own.
#pragma once

#include <memory>
#include <string>

#include "server/LogStorage.h"
#include "sqlite/Database.h"
#include "sqlite/Statement.h"

namespace lumivale {
namespace tessarine {
namespace server {

class SqliteLogStorage : public LogStorage {
public:
    // Opens or creates the file at path.
    explicit SqliteLogStorage(const std::string& path);

    std::optional<SyncProtocol::Delta> findAccepted(const SyncProtocol::Delta& change) override;
    std::optional<SyncProtocol::Delta> append(const SyncProtocol::Delta& change) override;
    std::vector<SyncProtocol::Delta> changesAfter(const std::string& collectionName, uint64_t sequenceNumber) override;
    uint64_t lastSequenceNumber(const std::string& collectionName) override;
    std::optional<uint64_t> highestVersionId(const std::string& collectionName, const std::string& clientId) override;
    std::vector<SyncProtocol::TessarineObject> objects(const std::string& collectionName) override;

private:
    static SyncProtocol::Delta readChange(sqlite::Statement& statement);

    std::unique_ptr<sqlite::Database> database;
    sqlite::Statement selectAccepted;
    sqlite::Statement insertChange;
    sqlite::Statement saveObject;
    sqlite::Statement deleteObject;
    sqlite::Statement selectChangesAfter;
    sqlite::Statement selectLastSequence;
    sqlite::Statement selectHighestVersion;
    sqlite::Statement selectObjects;
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
