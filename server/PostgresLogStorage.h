// A LogStorage in a PostgreSQL database, which several server instances may
// share (see NetworkSyncServer and CollectionLeases for how they split the
// collections). See LogStorage.h for what callers may rely on, and
// PostgresSchema.h for the tables.
//
// append is one transaction: the collection's counter row in
// "tessarine_sequences" is incremented (which locks it until the commit, so
// a collection's writers queue there and numbers have no gaps even with
// several writers), the change is logged, the object replaced or deleted.
// A change that the unique key on (client_id, collection, version_id) finds
// logged already makes the transaction roll back and append return empty.
// With a lease holder given, append also requires that holder's unexpired
// lease on the collection and keeps it locked until the commit (FOR SHARE):
// an instance whose lease lapsed, or was taken over, cannot log anything,
// and a takeover waits for a commit in progress.
//
// Objects are ordered by the bytes of their sort keys (COLLATE "C"), as
// every other storage orders them, whatever the database's locale.
//
// Errors: PgError from any operation that the database fails (the
// connection then reconnects on a later call, see PgConnection; the tables
// are created by the first operation that reaches the database, so a
// storage may be made while the database is away); LeaseLost from append. A
// failed append leaves the database as it was.
//
// Threads: one thread at a time (its owner's lock), except failures(),
// which any thread may read.
#pragma once

#include <atomic>
#include <cstdint>
#include <stdexcept>
#include <string>

#include "server/LogStorage.h"
#include "server/PgConnection.h"

namespace lumivale {
namespace tessarine {
namespace server {

class PostgresLogStorage : public LogStorage {
public:
    class LeaseLost : public std::runtime_error {
    public:
        using std::runtime_error::runtime_error;
    };

    // Connects with the libpq connection string and creates the tables that
    // are missing (or leaves both to the first operation, see Errors).
    // leaseHolder: see above; empty for a storage of its own.
    explicit PostgresLogStorage(const std::string& conninfo, std::string leaseHolder = "");

    std::optional<SyncProtocol::Delta> findAccepted(const SyncProtocol::Delta& change) override;
    std::optional<SyncProtocol::Delta> append(const SyncProtocol::Delta& change) override;
    std::vector<SyncProtocol::Delta> changesAfter(const std::string& collectionName, uint64_t sequenceNumber) override;
    uint64_t lastSequenceNumber(const std::string& collectionName) override;
    std::optional<uint64_t> highestVersionId(const std::string& collectionName, const std::string& clientId) override;
    std::vector<SyncProtocol::TessarineObject> objects(const std::string& collectionName) override;
    SyncProtocol::Snapshot snapshot(const std::string& collectionName, const std::string& clientId) override;

    // How many operations the database failed so far: an owner that sees it
    // grow knows that requests were dropped and asks clients to resend.
    uint64_t failures() const { return failureCount.load(); }

private:
    void ensureSchema();
    // Runs body (after creating the tables if need be), counting a PgError.
    template <typename Body>
    auto counted(Body body) -> decltype(body());
    void appendInTransaction(const SyncProtocol::Delta& change, SyncProtocol::Delta& logged);

    PgConnection connection;
    const std::string leaseHolder;
    bool schemaCreated = false;
    std::atomic<uint64_t> failureCount{0};
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
