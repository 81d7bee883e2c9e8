#include "tools/StoreInspector.h"

#include <sqlite3.h>

#include <algorithm>
#include <filesystem>

#include "sqlite/Database.h"
#include "sqlite/SQLiteException.h"
#include "tessarine/Collection.h"
#include "tessarine/CollectionObjectStorage.h"
#include "tessarine/CollectionObjectStorageQueries.h"
#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/LibraryMetadata.h"
#include "tessarine/StringUtils.h"
#include "tessarine/SubscriptionStorage.h"
#include "tessarine/VersionIdGenerator.h"
#include "tessarine/VersionIdGeneratorQueries.h"

namespace lumivale {
namespace tessarine {
namespace inspect {

namespace {

using lumivale::sqlite::Database;
using lumivale::sqlite::Statement;

std::vector<unsigned char> readBlob(const Statement& statement, int column) {
    auto bytes = statement(column).getBlobDirectBuffer();
    return std::vector<unsigned char>(bytes.first, bytes.first + bytes.second);
}

uint64_t readCount(const Statement& statement, int column) {
    return statement(column).getUint64();
}

bool tableExists(Database& database, const std::string& table) {
    auto statement = database.prepare("SELECT 1 FROM sqlite_master WHERE type = 'table' AND name = ?");
    statement.bind(1, table);
    return statement.step();
}

std::string describe(const lumivale::sqlite::SQLiteException& e) {
    switch (e.code() & 0xff) {
        case SQLITE_BUSY:
        case SQLITE_LOCKED:
            return "the store is locked by another process (waited " +
                   std::to_string(StoreInspector::kBusyTimeout.count()) + " ms): " + e.what();
        case SQLITE_NOTADB: return "not a Tessarine store: the file is not an SQLite database";
        case SQLITE_CORRUPT: return std::string("the database is corrupt: ") + e.what();
    }
    return std::string("cannot read the store: ") + e.what();
}

}  // namespace

StoreInspector::StoreInspector(const std::string& thePath) : path(thePath) {
    // SQLite would report a missing file only as "unable to open".
    std::error_code error;
    if (!std::filesystem::is_regular_file(thePath, error)) throw InspectError("no such file: " + thePath);
    try {
        database = std::make_shared<Database>(thePath, SQLITE_OPEN_READONLY);
        database->exec("PRAGMA busy_timeout=" + std::to_string(kBusyTimeout.count()));
    } catch (const lumivale::sqlite::SQLiteException& e) {
        throw InspectError(describe(e));
    }
    reading([&] {
        if (!tableExists(*database, LibraryMetadataStorage::TABLE_NAME) ||
            !tableExists(*database, DeltaQueueStorage::TABLE_NAME)) {
            throw InspectError("not a Tessarine store: it has no " + LibraryMetadataStorage::TABLE_NAME + " and " +
                               DeltaQueueStorage::TABLE_NAME + " tables");
        }
        return 0;
    });
}

StoreInspector::~StoreInspector() = default;

template <typename Read>
auto StoreInspector::reading(Read read) -> decltype(read()) {
    try {
        std::optional<decltype(read())> result;
        database->runInTransaction([&] { result = read(); }, Database::TransactionType::Deferred);
        return std::move(*result);
    } catch (const lumivale::sqlite::SQLiteException& e) {
        throw InspectError(describe(e));
    }
}

StoreSummary StoreInspector::summary() {
    return reading([&] {
        StoreSummary summary;
        auto metadata = database->prepare("SELECT key, value FROM " + LibraryMetadataStorage::TABLE_NAME);
        while (metadata.step()) {
            std::string key = metadata(0).getText();
            if (key == LibraryMetadata::KEY_CLIENT_UUID) summary.clientId = metadata(1).getText();
            if (key == LibraryMetadata::KEY_VERSION) {
                summary.dataVersion = static_cast<uint64_t>(stringToLongLong(metadata(1).getText()));
            }
        }
        for (const std::string& name : collectionNames()) summary.collections.push_back(collectionSummary(name));
        summary.queue = queueSummary();
        summary.integrity = integrityCheck();
        return summary;
    });
}

// Object tables are the tables named with the object-table prefix and a
// valid collection name that have a status column; the index table of a
// collection "a:b" has the same prefix and could look like the object table
// of a collection "index_a:b", but it has no status column.
std::vector<std::string> StoreInspector::collectionNames() {
    const std::string& prefix = CollectionObjectStorage::TABLE_NAME_PREFIX;
    auto tables = database->prepare(
        "SELECT m.name FROM sqlite_master AS m WHERE m.type = 'table' AND substr(m.name, 1, ?) = ? "
        "AND EXISTS (SELECT 1 FROM pragma_table_info(m.name) WHERE name = 'status') ORDER BY m.name");
    tables.bind(1, static_cast<int>(prefix.size()));
    tables.bind(2, prefix);
    std::vector<std::string> names;
    while (tables.step()) {
        std::string name = tables(0).getText().substr(prefix.size());
        if (Collection::isValidCollectionName(name)) names.push_back(name);
    }
    return names;
}

CollectionSummary StoreInspector::collectionSummary(const std::string& name) {
    CollectionSummary summary;
    summary.name = name;
    auto statuses = database->prepare("SELECT status, COUNT(*) FROM " +
                                      dbqueries::quoted(CollectionObjectStorage::TABLE_NAME_PREFIX + name) +
                                      " GROUP BY status");
    while (statuses.step()) {
        uint64_t count = readCount(statuses, 1);
        switch (statuses(0).getInt()) {
            case 1: summary.pending = count; break;
            case 2: summary.sent = count; break;
            default: summary.persisted += count; break;
        }
    }
    auto versionId = database->prepare(dbqueries::QueryVersionId::getSql(VersionIdGenerator::TABLE_NAME));
    versionId.bind(1, name);
    if (versionId.step()) summary.versionIdCounter = readCount(versionId, 0);
    auto sequence =
        database->prepare("SELECT seq_num FROM " + SubscriptionStorage::TABLE_NAME + " WHERE collection_name = ?");
    sequence.bind(1, name);
    if (sequence.step()) summary.sequenceNumber = readCount(sequence, 0);
    return summary;
}

QueueSummary StoreInspector::queueSummary() {
    QueueSummary summary;
    auto counts = database->prepare(dbqueries::CountDeltasByStatus::getSql(DeltaQueueStorage::TABLE_NAME));
    while (counts.step()) {
        uint64_t count = readCount(counts, 1);
        summary.length += count;
        if (counts(0).getInt() == 1) summary.pending += count;
        if (counts(0).getInt() == 2) summary.sent += count;
    }
    auto oldest = database->prepare("SELECT collection_name, MIN(version_id) FROM " + DeltaQueueStorage::TABLE_NAME +
                                    " GROUP BY collection_name ORDER BY collection_name");
    while (oldest.step()) summary.oldestVersionIds.emplace_back(oldest(0).getText(), readCount(oldest, 1));
    return summary;
}

std::vector<std::string> StoreInspector::integrityCheck() {
    auto check = database->prepare("PRAGMA integrity_check");
    std::vector<std::string> rows;
    while (check.step()) rows.push_back(check(0).getText());
    return rows;
}

std::vector<StoredObject> StoreInspector::objects(const std::string& collectionName) {
    return reading([&] {
        auto names = collectionNames();
        if (std::find(names.begin(), names.end(), collectionName) == names.end()) {
            throw InspectError("the store has no collection " + collectionName);
        }
        auto statement = database->prepare(dbqueries::QueryCollection::getSql(
            CollectionObjectStorage::TABLE_NAME_PREFIX + collectionName, true));
        statement.bind(1, std::string());  // every sort key
        statement.bind(2, -1);             // no limit
        std::vector<StoredObject> objects;
        while (statement.step()) {
            objects.push_back({statement(0).getText(), statement(1).getText(), statement(3).getInt(),
                               readBlob(statement, 2)});
        }
        return objects;
    });
}

std::vector<QueuedDelta> StoreInspector::queue() {
    return reading([&] {
        auto statement = database->prepare(dbqueries::SelectAllDeltas::getSql(DeltaQueueStorage::TABLE_NAME));
        std::vector<QueuedDelta> deltas;
        while (statement.step()) {
            QueuedDelta delta;
            delta.collectionName = statement(0).getText();
            delta.versionId = readCount(statement, 1);
            delta.type = statement(2).getInt();
            delta.primaryKey = statement(3).getText();
            delta.sortKey = statement(4).getText();
            delta.blob = readBlob(statement, 5);
            delta.status = statement(6).getInt();
            deltas.push_back(std::move(delta));
        }
        return deltas;
    });
}

}  // namespace inspect
}  // namespace tessarine
}  // namespace lumivale
