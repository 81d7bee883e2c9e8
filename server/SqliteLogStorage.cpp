#include "server/SqliteLogStorage.h"

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

constexpr const char* kChangeColumns =
    "client_id, collection, version_id, primary_key, sort_key, type, blob, sequence";

std::unique_ptr<sqlite::Database> openDatabase(const std::string& path) {
    auto database = std::make_unique<sqlite::Database>(path, sqlite::kOpenReadWriteCreate);
    // First, so that opening waits for readers of the file (and the recovery
    // after a crash) instead of failing.
    database->exec("PRAGMA busy_timeout = 5000");
    database->exec("PRAGMA journal_mode = WAL");
    database->exec("PRAGMA synchronous = FULL");
    database->exec(
        "CREATE TABLE IF NOT EXISTS changes ("
        " collection TEXT NOT NULL, sequence INTEGER NOT NULL, client_id TEXT NOT NULL,"
        " version_id INTEGER NOT NULL, primary_key TEXT NOT NULL, sort_key TEXT NOT NULL,"
        " type INTEGER NOT NULL, blob BLOB NOT NULL,"
        " PRIMARY KEY (collection, sequence), UNIQUE (collection, client_id, version_id))");
    database->exec(
        "CREATE TABLE IF NOT EXISTS objects ("
        " collection TEXT NOT NULL, primary_key TEXT NOT NULL, sort_key TEXT NOT NULL, blob BLOB NOT NULL,"
        " PRIMARY KEY (collection, primary_key))");
    return database;
}

void bindBlob(sqlite::Statement& statement, int index, const std::vector<unsigned char>& blob) {
    statement.bindBlob(index, blob.data(), static_cast<unsigned int>(blob.size()));
}

std::vector<unsigned char> readBlob(const sqlite::Statement& statement, int column) {
    auto bytes = statement(column).getBlobDirectBuffer();
    return std::vector<unsigned char>(bytes.first, bytes.first + bytes.second);
}

}  // namespace

SqliteLogStorage::SqliteLogStorage(const std::string& path)
    : database(openDatabase(path)),
      selectAccepted(database->prepare(std::string("SELECT ") + kChangeColumns +
                                       " FROM changes WHERE collection = ? AND client_id = ? AND version_id = ?")),
      insertChange(database->prepare(
          "INSERT INTO changes (client_id, collection, version_id, primary_key, sort_key, type, blob, sequence)"
          " VALUES (?, ?, ?, ?, ?, ?, ?, ?)")),
      saveObject(database->prepare(
          "INSERT OR REPLACE INTO objects (collection, primary_key, sort_key, blob) VALUES (?, ?, ?, ?)")),
      deleteObject(database->prepare("DELETE FROM objects WHERE collection = ? AND primary_key = ?")),
      selectChangesAfter(database->prepare(std::string("SELECT ") + kChangeColumns +
                                           " FROM changes WHERE collection = ? AND sequence > ? ORDER BY sequence")),
      selectLastSequence(database->prepare("SELECT IFNULL(MAX(sequence), 0) FROM changes WHERE collection = ?")),
      selectHighestVersion(database->prepare(
          "SELECT version_id FROM changes WHERE collection = ? AND client_id = ? ORDER BY version_id DESC LIMIT 1")),
      selectObjects(database->prepare(
          "SELECT primary_key, sort_key, blob FROM objects WHERE collection = ? ORDER BY sort_key, primary_key")) {}

SyncProtocol::Delta SqliteLogStorage::readChange(sqlite::Statement& statement) {
    SyncProtocol::Delta change;
    change.clientId = statement(0).getText();
    change.collectionName = statement(1).getText();
    change.versionId = statement(2).getUint64();
    change.primaryKey = statement(3).getText();
    change.sortKey = statement(4).getText();
    change.type = static_cast<SyncProtocol::DeltaType>(statement(5).getInt());
    change.blob = readBlob(statement, 6);
    change.sequenceNumber = statement(7).getUint64();
    return change;
}

std::optional<SyncProtocol::Delta> SqliteLogStorage::findAccepted(const SyncProtocol::Delta& change) {
    selectAccepted.reset();
    selectAccepted.bind(1, change.collectionName);
    selectAccepted.bind(2, change.clientId);
    selectAccepted.bind(3, change.versionId);
    if (!selectAccepted.step()) return std::nullopt;
    return readChange(selectAccepted);
}

std::optional<SyncProtocol::Delta> SqliteLogStorage::append(const SyncProtocol::Delta& change) {
    SyncProtocol::Delta logged = change;
    database->runInTransaction(
        [&] {
            logged.sequenceNumber = lastSequenceNumber(change.collectionName) + 1;
            insertChange.reset();
            insertChange.bind(1, change.clientId);
            insertChange.bind(2, change.collectionName);
            insertChange.bind(3, change.versionId);
            insertChange.bind(4, change.primaryKey);
            insertChange.bind(5, change.sortKey);
            insertChange.bind(6, static_cast<int>(change.type));
            bindBlob(insertChange, 7, change.blob);
            insertChange.bind(8, logged.sequenceNumber);
            insertChange.step();
            sqlite::Statement& apply = change.type == SyncProtocol::DeltaType::DELETE ? deleteObject : saveObject;
            apply.reset();
            apply.bind(1, change.collectionName);
            apply.bind(2, change.primaryKey);
            if (change.type != SyncProtocol::DeltaType::DELETE) {
                apply.bind(3, change.sortKey);
                bindBlob(apply, 4, change.blob);
            }
            apply.step();
        },
        sqlite::Database::TransactionType::Immediate);
    return logged;
}

std::vector<SyncProtocol::Delta> SqliteLogStorage::changesAfter(const std::string& collectionName,
                                                                uint64_t sequenceNumber) {
    selectChangesAfter.reset();
    selectChangesAfter.bind(1, collectionName);
    selectChangesAfter.bind(2, sequenceNumber);
    std::vector<SyncProtocol::Delta> changes;
    while (selectChangesAfter.step()) changes.push_back(readChange(selectChangesAfter));
    return changes;
}

uint64_t SqliteLogStorage::lastSequenceNumber(const std::string& collectionName) {
    selectLastSequence.reset();
    selectLastSequence.bind(1, collectionName);
    selectLastSequence.step();
    return selectLastSequence(0).getUint64();
}

std::optional<uint64_t> SqliteLogStorage::highestVersionId(const std::string& collectionName,
                                                           const std::string& clientId) {
    selectHighestVersion.reset();
    selectHighestVersion.bind(1, collectionName);
    selectHighestVersion.bind(2, clientId);
    if (!selectHighestVersion.step()) return std::nullopt;
    return selectHighestVersion(0).getUint64();
}

std::vector<SyncProtocol::TessarineObject> SqliteLogStorage::objects(const std::string& collectionName) {
    selectObjects.reset();
    selectObjects.bind(1, collectionName);
    std::vector<SyncProtocol::TessarineObject> result;
    while (selectObjects.step()) {
        result.push_back({selectObjects(0).getText(), selectObjects(1).getText(), readBlob(selectObjects, 2)});
    }
    return result;
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
