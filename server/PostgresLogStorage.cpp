#include "server/PostgresLogStorage.h"

#include "platform/Log.h"
#include "server/ServerLog.h"
#include "server/PostgresSchema.h"

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

constexpr const char* kSelectChanges =
    "SELECT client_id, collection, version_id, primary_key, sort_key, type, blob, sequence FROM tessarine_changes ";
constexpr const char* kSelectObjects =
    "SELECT primary_key, sort_key, blob FROM tessarine_objects WHERE collection = $1"
    " ORDER BY sort_key COLLATE \"C\", primary_key COLLATE \"C\"";
constexpr const char* kSelectLast = "SELECT last FROM tessarine_sequences WHERE collection = $1";
constexpr const char* kSelectHighest =
    "SELECT MAX(version_id) FROM tessarine_changes WHERE collection = $1 AND client_id = $2";

SyncProtocol::Delta readChange(const PgResult& result, int row) {
    SyncProtocol::Delta change;
    change.clientId = result.text(row, 0);
    change.collectionName = result.text(row, 1);
    change.versionId = static_cast<uint64_t>(result.integer(row, 2));
    change.primaryKey = result.text(row, 3);
    change.sortKey = result.text(row, 4);
    change.type = static_cast<SyncProtocol::DeltaType>(result.integer(row, 5));
    change.blob = result.bytes(row, 6);
    change.sequenceNumber = static_cast<uint64_t>(result.integer(row, 7));
    return change;
}

int64_t signedId(uint64_t id) { return static_cast<int64_t>(id); }

std::vector<SyncProtocol::TessarineObject> readObjects(const PgResult& result) {
    std::vector<SyncProtocol::TessarineObject> objects;
    for (int row = 0; row < result.rows(); ++row) {
        objects.push_back({result.text(row, 0), result.text(row, 1), result.bytes(row, 2)});
    }
    return objects;
}

// MAX over no rows is NULL.
std::optional<uint64_t> readHighest(const PgResult& result) {
    if (result.isNull(0, 0)) return std::nullopt;
    return static_cast<uint64_t>(result.integer(0, 0));
}

uint64_t readLast(const PgResult& result) {
    return result.rows() == 0 ? 0 : static_cast<uint64_t>(result.integer(0, 0));
}

}  // namespace

PostgresLogStorage::PostgresLogStorage(const std::string& conninfo, std::string holder)
    : connection(conninfo), leaseHolder(std::move(holder)) {
    try {
        ensureSchema();
    } catch (const PgError& e) {
        lv_printLog(LogPriority::kWarn, kServerLogTag,
                    "PostgresLogStorage: cannot create the tables yet (%s); retrying", e.what());
    }
}

void PostgresLogStorage::ensureSchema() {
    if (schemaCreated) return;
    createPostgresSchema(connection);
    schemaCreated = true;
}

template <typename Body>
auto PostgresLogStorage::counted(Body body) -> decltype(body()) {
    try {
        ensureSchema();
        return body();
    } catch (const PgError&) {
        ++failureCount;
        throw;
    }
}

std::optional<SyncProtocol::Delta> PostgresLogStorage::findAccepted(const SyncProtocol::Delta& change) {
    return counted([&]() -> std::optional<SyncProtocol::Delta> {
        PgResult result = connection.exec(
            std::string(kSelectChanges) + "WHERE client_id = $1 AND collection = $2 AND version_id = $3",
            {change.clientId, change.collectionName, signedId(change.versionId)});
        if (result.rows() == 0) return std::nullopt;
        return readChange(result, 0);
    });
}

std::optional<SyncProtocol::Delta> PostgresLogStorage::append(const SyncProtocol::Delta& change) {
    return counted([&]() -> std::optional<SyncProtocol::Delta> {
        SyncProtocol::Delta logged = change;
        try {
            appendInTransaction(change, logged);
        } catch (const PgError& e) {
            if (e.sqlState() == kUniqueViolation) return std::nullopt;
            throw;
        }
        return logged;
    });
}

void PostgresLogStorage::appendInTransaction(const SyncProtocol::Delta& change, SyncProtocol::Delta& logged) {
    const std::string& name = change.collectionName;
    PgTransaction transaction(connection);
    if (!leaseHolder.empty()) {
        PgResult lease = connection.exec(
            "SELECT 1 FROM tessarine_leases WHERE collection = $1 AND holder = $2 AND expires_at > now() FOR SHARE",
            {name, leaseHolder});
        if (lease.rows() == 0) throw LeaseLost("this instance no longer holds the lease of \"" + name + "\"");
    }
    PgResult sequence = connection.exec(
        "INSERT INTO tessarine_sequences (collection, last) VALUES ($1, 1)"
        " ON CONFLICT (collection) DO UPDATE SET last = tessarine_sequences.last + 1 RETURNING last",
        {name});
    logged.sequenceNumber = static_cast<uint64_t>(sequence.integer(0, 0));
    connection.exec(
        "INSERT INTO tessarine_changes"
        " (client_id, collection, version_id, primary_key, sort_key, type, blob, sequence)"
        " VALUES ($1, $2, $3, $4, $5, $6, $7, $8)",
        {change.clientId, name, signedId(change.versionId), change.primaryKey, change.sortKey,
         static_cast<int64_t>(change.type), PgConnection::Param::bytes(change.blob),
         signedId(logged.sequenceNumber)});
    if (change.type == SyncProtocol::DeltaType::DELETE) {
        connection.exec("DELETE FROM tessarine_objects WHERE collection = $1 AND primary_key = $2",
                        {name, change.primaryKey});
    } else {
        connection.exec(
            "INSERT INTO tessarine_objects (collection, primary_key, sort_key, blob) VALUES ($1, $2, $3, $4)"
            " ON CONFLICT (collection, primary_key) DO UPDATE SET sort_key = EXCLUDED.sort_key, blob = EXCLUDED.blob",
            {name, change.primaryKey, change.sortKey, PgConnection::Param::bytes(change.blob)});
    }
    transaction.commit();
}

std::vector<SyncProtocol::Delta> PostgresLogStorage::changesAfter(const std::string& collectionName,
                                                                  uint64_t sequenceNumber) {
    return counted([&] {
        PgResult result = connection.exec(
            std::string(kSelectChanges) + "WHERE collection = $1 AND sequence > $2 ORDER BY sequence",
            {collectionName, signedId(sequenceNumber)});
        std::vector<SyncProtocol::Delta> changes;
        for (int row = 0; row < result.rows(); ++row) changes.push_back(readChange(result, row));
        return changes;
    });
}

uint64_t PostgresLogStorage::lastSequenceNumber(const std::string& collectionName) {
    return counted([&] { return readLast(connection.exec(kSelectLast, {collectionName})); });
}

std::optional<uint64_t> PostgresLogStorage::highestVersionId(const std::string& collectionName,
                                                             const std::string& clientId) {
    return counted([&] { return readHighest(connection.exec(kSelectHighest, {collectionName, clientId})); });
}

std::vector<SyncProtocol::TessarineObject> PostgresLogStorage::objects(const std::string& collectionName) {
    return counted([&] { return readObjects(connection.exec(kSelectObjects, {collectionName})); });
}

SyncProtocol::Snapshot PostgresLogStorage::snapshot(const std::string& collectionName, const std::string& clientId) {
    return counted([&] {
        PgTransaction transaction(connection, "REPEATABLE READ");
        SyncProtocol::Snapshot result;
        result.collectionName = collectionName;
        result.objects = readObjects(connection.exec(kSelectObjects, {collectionName}));
        result.sequenceNumber = readLast(connection.exec(kSelectLast, {collectionName}));
        result.versionId = readHighest(connection.exec(kSelectHighest, {collectionName, clientId})).value_or(0);
        transaction.commit();
        return result;
    });
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
