// The persistent outgoing queue: one row of the table "delta_queue" per
// locally written delta that the server has not yet persisted.
//
// A row is identified by (collection name, version id). Rows come back in
// insertion order; a delta read back has an empty clientId and sequence
// number 0, since neither is stored. No row ever holds PERSISTED: such deltas
// are removed instead.
//
// Threads: no lock of its own; every operation is one statement on the
// shared connection and opens no transaction (except table creation), so
// callers decide what runs together. Errors: SQLiteException passes through.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

namespace dbqueries {
struct CreateDeltaQueueTable {
    static std::vector<std::string> getIndexSqls(const std::string& tableName);
};
// Every queued delta in resend order, columns collection_name, version_id,
// type, primary_key, sort_key, blob, status.
struct SelectAllDeltas {
    static std::string getSql(const std::string& tableName);
};
// Columns status and the number of queued deltas with it.
struct CountDeltasByStatus {
    static std::string getSql(const std::string& tableName);
};
}  // namespace dbqueries

class DeltaQueueStorage {
public:
    static inline const std::string TABLE_NAME = "delta_queue";

    // A queued delta with its row id, which orders the queue: ids only grow
    // and are never reused, so a later insert always has a greater id.
    struct QueuedDelta {
        int64_t id = 0;
        SyncProtocol::Delta delta;
    };

    // Creates the table and its two indexes if they are missing.
    explicit DeltaQueueStorage(std::shared_ptr<lumivale::sqlite::Database> database);
    virtual ~DeltaQueueStorage();

    // Every queued delta with its status, oldest first.
    virtual std::vector<std::pair<SyncProtocol::Delta, SyncProtocol::DeltaStatus>> getAllDeltas();
    // Statuses of every queued delta of one object, in no particular order.
    virtual std::vector<SyncProtocol::DeltaStatus> getDeltaStatuses(const std::string& collectionName,
                                                                    const std::string& primaryKey);
    // Status of the delta's row (by collection name and version id), if any.
    virtual std::optional<SyncProtocol::DeltaStatus> getDeltaStatus(const SyncProtocol::Delta& delta);
    // Queued deltas of a collection with lowest <= versionId <= highest, oldest first.
    virtual std::vector<SyncProtocol::Delta> getDeltaRangeByVersionId(const std::string& collectionName,
                                                                      uint64_t lowestVersionId,
                                                                      uint64_t highestVersionId);
    // How many deltas are queued with each status; statuses without a row
    // are left out.
    virtual std::vector<std::pair<SyncProtocol::DeltaStatus, uint64_t>> countDeltasByStatus();

    // Up to limit queued deltas with afterId < id <= upToId, oldest first,
    // into rows (resized to their count). The rows' strings and blobs are
    // overwritten in place, so reading chunk after chunk into the same
    // vector allocates next to nothing.
    virtual void readDeltasInIdRange(int64_t afterId, int64_t upToId, int limit, std::vector<QueuedDelta>& rows);
    // The highest id the queue has ever given a row; 0 for a new queue.
    virtual int64_t getLastId();
    // Returns the new row's id.
    virtual int64_t insertDelta(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);
    // Asserts on PERSISTED: persisted deltas are removed, never stored.
    virtual void updateDeltaStatus(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);
    virtual void removeDelta(const SyncProtocol::Delta& delta);

    void createDbTableIfNecessary();
    std::string getTableName() const;

private:
    std::shared_ptr<lumivale::sqlite::Database> database;
};

}  // namespace tessarine
}  // namespace lumivale
