#include "tessarine/DeltaQueueStorage.h"

#include "platform/Assert.h"
#include "sqlite/Database.h"
#include "tessarine/StringUtils.h"

namespace lumivale {
namespace tessarine {

namespace {

// The delta's columns (read by readDeltaInto as 0 to 5), then one more.
const char* const kSelectDelta = "SELECT  collection_name,  version_id,  type,  primary_key,  sort_key,  blob,  ";
const std::string kSelectColumns = std::string(kSelectDelta) + "status FROM ";
const char* const kWhereDelta = " WHERE  collection_name = ? AND   version_id = ?";

// Reads the delta of the statement's current row (columns 0 to 5) into
// delta, reusing the storage of its strings and blob.
void readDeltaInto(lumivale::sqlite::Statement& statement, SyncProtocol::Delta& delta) {
    statement(0).copyTextTo(delta.collectionName);
    delta.versionId = statement(1).getUint64();
    delta.type = static_cast<SyncProtocol::DeltaType>(statement(2).getInt());
    statement(3).copyTextTo(delta.primaryKey);
    statement(4).copyTextTo(delta.sortKey);
    auto blob = statement(5).getBlobDirectBuffer();
    delta.blob.assign(blob.first, blob.first + blob.second);
}

SyncProtocol::Delta readDelta(lumivale::sqlite::Statement& statement) {
    SyncProtocol::Delta delta;
    readDeltaInto(statement, delta);
    return delta;
}

void bindDeltaKey(lumivale::sqlite::Statement& statement, const SyncProtocol::Delta& delta, int firstIndex) {
    statement.bind(firstIndex, delta.collectionName);
    statement.bind(firstIndex + 1, delta.versionId);
}

}  // namespace

std::vector<std::string> dbqueries::CreateDeltaQueueTable::getIndexSqls(const std::string& tableName) {
    return {
        "CREATE INDEX IF NOT EXISTS " + quoted(tableName + "_coll_id_pk_idx") + " ON " + quoted(tableName) +
            " (collection_name, primary_key)",
        "CREATE INDEX IF NOT EXISTS " + quoted(tableName + "_coll_id_ver_id_idx") + " ON " + quoted(tableName) +
            " (collection_name, version_id)",
        // Lets the sync metrics count the queue by status from the index
        // alone, without reading the rows and their blobs.
        "CREATE INDEX IF NOT EXISTS " + quoted(tableName + "_status_idx") + " ON " + quoted(tableName) + " (status)",
    };
}

std::string dbqueries::SelectAllDeltas::getSql(const std::string& tableName) {
    return kSelectColumns + tableName + " ORDER BY id ASC";
}

std::string dbqueries::CountDeltasByStatus::getSql(const std::string& tableName) {
    return "SELECT status, COUNT(*) FROM " + tableName + " GROUP BY status";
}

DeltaQueueStorage::DeltaQueueStorage(std::shared_ptr<lumivale::sqlite::Database> theDatabase)
    : database(std::move(theDatabase)) {
    createDbTableIfNecessary();
}

DeltaQueueStorage::~DeltaQueueStorage() = default;

std::string DeltaQueueStorage::getTableName() const { return TABLE_NAME; }

void DeltaQueueStorage::createDbTableIfNecessary() {
    const std::string table = getTableName();
    database->runInTransaction([&] {
        database->exec("CREATE TABLE IF NOT EXISTS " + table +
                       " (id INTEGER PRIMARY KEY AUTOINCREMENT,collection_name VARCHAR(256),version_id UNSIGNED BIG "
                       "INT,type INTEGER,primary_key VARCHAR(128),sort_key VARCHAR(128),blob BLOB,status INTEGER)");
        for (const std::string& sql : dbqueries::CreateDeltaQueueTable::getIndexSqls(table)) database->exec(sql);
    }, lumivale::sqlite::Database::TransactionType::Immediate);
}

std::vector<std::pair<SyncProtocol::Delta, SyncProtocol::DeltaStatus>> DeltaQueueStorage::getAllDeltas() {
    // A resend reads the whole queue outside any transaction: one lock for
    // the read instead of eight per row.
    lumivale::sqlite::Database::ScopedLock lock(*database);
    auto statement = database->prepare(dbqueries::SelectAllDeltas::getSql(getTableName()));
    std::vector<std::pair<SyncProtocol::Delta, SyncProtocol::DeltaStatus>> result;
    while (statement.step()) {
        result.emplace_back(readDelta(statement), static_cast<SyncProtocol::DeltaStatus>(statement(6).getInt()));
    }
    return result;
}

std::vector<SyncProtocol::Delta> DeltaQueueStorage::getDeltaRangeByVersionId(const std::string& collectionName,
                                                                             uint64_t lowestVersionId,
                                                                             uint64_t highestVersionId) {
    auto statement = database->prepare(kSelectColumns + getTableName() +
                                       " WHERE  collection_name = ? AND   version_id >= ? AND   version_id <= ? "
                                       "ORDER BY id ASC");
    statement.bind(1, collectionName);
    statement.bind(2, lowestVersionId);
    statement.bind(3, highestVersionId);
    std::vector<SyncProtocol::Delta> result;
    while (statement.step()) result.push_back(readDelta(statement));
    return result;
}

std::vector<SyncProtocol::DeltaStatus> DeltaQueueStorage::getDeltaStatuses(const std::string& collectionName,
                                                                           const std::string& primaryKey) {
    auto statement =
        database->prepare("SELECT status FROM " + getTableName() + " WHERE  collection_name = ? AND   primary_key = ?");
    statement.bind(1, collectionName);
    statement.bind(2, primaryKey);
    std::vector<SyncProtocol::DeltaStatus> result;
    while (statement.step()) result.push_back(static_cast<SyncProtocol::DeltaStatus>(statement(0).getInt()));
    return result;
}

std::optional<SyncProtocol::DeltaStatus> DeltaQueueStorage::getDeltaStatus(const SyncProtocol::Delta& delta) {
    auto statement = database->prepare("SELECT status FROM " + getTableName() + kWhereDelta);
    bindDeltaKey(statement, delta, 1);
    if (!statement.step()) return std::nullopt;
    return static_cast<SyncProtocol::DeltaStatus>(statement(0).getInt());
}

void DeltaQueueStorage::readDeltasInIdRange(int64_t afterId, int64_t upToId, int limit,
                                            std::vector<QueuedDelta>& rows) {
    lumivale::sqlite::Database::ScopedLock lock(*database);
    auto statement = database->prepare(
        dbqueries::concat({kSelectDelta, "id FROM ", getTableName(), " WHERE id > ? AND id <= ? ORDER BY id ASC LIMIT ?"}));
    statement.bind(1, static_cast<long long>(afterId));
    statement.bind(2, static_cast<long long>(upToId));
    statement.bind(3, limit);
    size_t count = 0;
    while (statement.step()) {
        if (count == rows.size()) rows.emplace_back();
        QueuedDelta& queued = rows[count++];
        readDeltaInto(statement, queued.delta);
        queued.id = statement(6).getInt64();
    }
    rows.resize(count);
}

int64_t DeltaQueueStorage::getLastId() {
    // AUTOINCREMENT keeps the highest id ever given in sqlite_sequence, also
    // after its row has gone; without a row there the queue is new.
    auto statement = database->prepare("SELECT seq FROM sqlite_sequence WHERE name = ?");
    statement.bind(1, getTableName());
    return statement.step() ? statement(0).getInt64() : 0;
}

std::vector<std::pair<SyncProtocol::DeltaStatus, uint64_t>> DeltaQueueStorage::countDeltasByStatus() {
    lumivale::sqlite::Database::ScopedLock lock(*database);
    auto statement = database->prepare(dbqueries::CountDeltasByStatus::getSql(getTableName()));
    std::vector<std::pair<SyncProtocol::DeltaStatus, uint64_t>> result;
    while (statement.step()) {
        result.emplace_back(static_cast<SyncProtocol::DeltaStatus>(statement(0).getInt()),
                            statement(1).getUint64());
    }
    return result;
}

int64_t DeltaQueueStorage::insertDelta(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status) {
    auto statement = database->prepare(
        "INSERT INTO " + getTableName() +
        " (collection_name, version_id, type, primary_key, sort_key, blob, status) VALUES (?, ?, ?, ?, ?, ?, ?)");
    // The delta outlives the one step that writes it.
    statement.bindWithoutCopy(1, delta.collectionName);
    statement.bind(2, delta.versionId);
    statement.bind(3, static_cast<int>(delta.type));
    statement.bindWithoutCopy(4, delta.primaryKey);
    statement.bindWithoutCopy(5, delta.sortKey);
    statement.bindBlobWithoutCopy(6, delta.blob.data(), static_cast<unsigned int>(delta.blob.size()));
    statement.bind(7, static_cast<int>(status));
    statement.step();
    return database->lastInsertRowId();
}

void DeltaQueueStorage::updateDeltaStatus(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status) {
    if (status == SyncProtocol::DeltaStatus::PERSISTED) {
        LV_ASSERT_FAIL("DeltaQueueStorage", "Deltas with status=PERSISTED should be deleted from the queue");
    }
    auto statement = database->prepare("UPDATE " + getTableName() + " SET status = ?" + kWhereDelta);
    bindDeltaKey(statement, delta, 2);
    statement.bind(1, static_cast<int>(status));
    statement.step();
}

void DeltaQueueStorage::removeDelta(const SyncProtocol::Delta& delta) {
    auto statement = database->prepare("DELETE FROM " + getTableName() + kWhereDelta);
    bindDeltaKey(statement, delta, 1);
    statement.step();
}

}  // namespace tessarine
}  // namespace lumivale
