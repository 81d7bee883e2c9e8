#include "tessarine/CollectionObjectStorage.h"

#include <utility>

#include "sqlite/Database.h"
#include "tessarine/CollectionObjectStorageQueries.h"

namespace lumivale {
namespace tessarine {

namespace {
// Result columns of every object query's select list.
constexpr int kPrimaryKeyColumn = 0;
constexpr int kSortKeyColumn = 1;
constexpr int kBlobColumn = 2;
constexpr int kStatusColumn = 3;
}  // namespace

CollectionObjectStorage::CollectionObjectStorage(std::shared_ptr<lumivale::sqlite::Database> theDatabase)
    : database(std::move(theDatabase)) {}

CollectionObjectStorage::~CollectionObjectStorage() = default;

void CollectionObjectStorage::ensureTableExistsForCollection(const std::string& collectionName) {
    database->exec(dbqueries::CreateCollectionTable::getSql(getTableName(collectionName)));
}

std::unique_ptr<Cursor> CollectionObjectStorage::query(const std::string& collectionName, const std::string& sortKey,
                                                       int limit, bool ascending) {
    auto statement = database->prepare(dbqueries::QueryCollection::getSql(getTableName(collectionName), ascending));
    statement.bind(1, sortKey);
    statement.bind(2, limit);
    return std::make_unique<Cursor>(std::move(statement), kPrimaryKeyColumn, kSortKeyColumn, kBlobColumn,
                                    kStatusColumn);
}

std::unique_ptr<Cursor> CollectionObjectStorage::getObject(const std::string& collectionName,
                                                           const std::string& primaryKey) {
    auto statement = database->prepare(dbqueries::GetObject::getSql(getTableName(collectionName)));
    statement.bind(1, primaryKey);
    return std::make_unique<Cursor>(std::move(statement), kPrimaryKeyColumn, kSortKeyColumn, kBlobColumn,
                                    kStatusColumn);
}

void CollectionObjectStorage::saveObject(const std::string& collectionName, const std::string& primaryKey,
                                         const std::string& sortKey, const unsigned char* blob,
                                         unsigned int blobSize, CollectionStorage::ObjectStatus status) {
    auto statement = database->prepare(dbqueries::SaveObject::getSql(getTableName(collectionName)));
    // The values outlive the one step that writes them.
    statement.bindWithoutCopy(1, primaryKey);
    statement.bindWithoutCopy(2, sortKey);
    statement.bindBlobWithoutCopy(3, blob, blobSize);
    statement.bind(4, static_cast<int>(status));
    statement.step();
}

void CollectionObjectStorage::deleteObject(const std::string& collectionName, const std::string& primaryKey) {
    auto statement = database->prepare(dbqueries::DeleteObject::getSql(getTableName(collectionName)));
    statement.bind(1, primaryKey);
    statement.step();
}

void CollectionObjectStorage::updateObjectStatus(const std::string& collectionName, const std::string& primaryKey,
                                                 CollectionStorage::ObjectStatus status) {
    auto statement = database->prepare(dbqueries::UpdateObjectStatus::getSql(getTableName(collectionName)));
    statement.bind(1, static_cast<int>(status));
    statement.bind(2, primaryKey);
    statement.step();
}

std::string CollectionObjectStorage::getTableName(const std::string& collectionName) {
    return TABLE_NAME_PREFIX + collectionName;
}

}  // namespace tessarine
}  // namespace lumivale
