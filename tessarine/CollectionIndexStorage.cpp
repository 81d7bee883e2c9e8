#include "tessarine/CollectionIndexStorage.h"

#include <utility>

#include "sqlite/Database.h"
#include "tessarine/CollectionIndexStorageQueries.h"

namespace lumivale {
namespace tessarine {

CollectionIndexStorage::CollectionIndexStorage(std::shared_ptr<lumivale::sqlite::Database> theDatabase)
    : database(std::move(theDatabase)) {}

CollectionIndexStorage::~CollectionIndexStorage() = default;

void CollectionIndexStorage::ensureTableExistsForCollection(const std::string& collectionName) {
    std::string tableName = getTableName(collectionName);
    database->exec(dbqueries::CreateCollectionIndexTable::getSql(tableName));
    for (const auto& sql : dbqueries::CreateCollectionIndexTable::getIndexSqls(tableName)) database->exec(sql);
}

void CollectionIndexStorage::saveObject(const std::string& collectionName, const std::string& primaryKey,
                                        const std::unordered_multimap<std::string, std::string>& fields) {
    deleteObject(collectionName, primaryKey);
    if (fields.empty()) return;
    auto statement = database->prepare(dbqueries::CollectionIndexSaveObject::getSql(getTableName(collectionName)));
    // The values outlive each step that writes them.
    statement.bindWithoutCopy(1, primaryKey);
    for (const auto& field : fields) {
        statement.bindWithoutCopy(2, field.first);
        statement.bindWithoutCopy(3, field.second);
        statement.step();
        statement.reset();
    }
}

void CollectionIndexStorage::deleteObject(const std::string& collectionName, const std::string& primaryKey) {
    auto statement = database->prepare(dbqueries::CollectionIndexDeleteObject::getSql(getTableName(collectionName)));
    statement.bind(1, primaryKey);
    statement.step();
}

std::string CollectionIndexStorage::getTableName(const std::string& collectionName) {
    return TABLE_NAME_PREFIX + collectionName;
}

}  // namespace tessarine
}  // namespace lumivale
