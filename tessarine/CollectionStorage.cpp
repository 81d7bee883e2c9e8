#include "tessarine/CollectionStorage.h"

#include <unordered_map>
#include <utility>

#include "sqlite/Database.h"
#include "tessarine/CallbackManager.h"
#include "tessarine/CollectionIndexStorage.h"
#include "tessarine/CollectionObjectStorage.h"
#include "tessarine/CollectionStorageQueries.h"
#include "tessarine/StringUtils.h"
#include "tessarine/VersionIdGenerator.h"

namespace lumivale {
namespace tessarine {

namespace {

// The place-holder in an index subquery for the index table's name.
const char* const kIndexTablePlaceholder = "{0}";

// Binds each argument as text from parameter firstIndex on, then the limit
// after them.
void bindArgumentsAndLimit(lumivale::sqlite::Statement& statement, int firstIndex,
                           const std::vector<std::string>& arguments, int limit) {
    int index = firstIndex;
    for (const auto& argument : arguments) statement.bind(index++, argument);
    statement.bind(index, limit);
}

std::unique_ptr<Cursor> makeObjectCursor(lumivale::sqlite::Statement&& statement) {
    // Both indexed queries select primary key, sort key, blob, status.
    return std::make_unique<Cursor>(std::move(statement), 0, 1, 2, 3);
}

}  // namespace

CollectionStorage::CollectionStorage(std::shared_ptr<lumivale::sqlite::Database> theDatabase,
                                     std::shared_ptr<CallbackManager> theCallbackManager,
                                     std::shared_ptr<CollectionIndexStorage> theIndexStorage,
                                     std::shared_ptr<CollectionObjectStorage> theObjectStorage,
                                     std::shared_ptr<VersionIdGenerator> theVersionIdGenerator)
    : database(std::move(theDatabase)),
      callbackManager(std::move(theCallbackManager)),
      indexStorage(std::move(theIndexStorage)),
      objectStorage(std::move(theObjectStorage)),
      versionIdGenerator(std::move(theVersionIdGenerator)) {}

CollectionStorage::~CollectionStorage() = default;

void CollectionStorage::ensureTableExistsForCollection(const std::string& collectionName) {
    database->runInTransaction(
        [this, collectionName] {
            objectStorage->ensureTableExistsForCollection(collectionName);
            indexStorage->ensureTableExistsForCollection(collectionName);
            versionIdGenerator->initializeVersionId(collectionName);
        },
        lumivale::sqlite::Database::TransactionType::Immediate);
}

std::unique_ptr<Cursor> CollectionStorage::query(const std::string& collectionName, const std::string& sortKey,
                                                 int limit, bool ascending) {
    return objectStorage->query(collectionName, sortKey, limit, ascending);
}

std::unique_ptr<Cursor> CollectionStorage::queryWithIndex(const std::string& collectionName,
                                                          const std::string& indexQuery,
                                                          const std::vector<std::string>& indexQueryArgs,
                                                          int limit) {
    std::string indexTableName = indexStorage->getTableName(collectionName);
    std::string subquery = stringReplace(indexQuery, kIndexTablePlaceholder, dbqueries::quoted(indexTableName));
    std::string objectTableName = objectStorage->getTableName(collectionName);
    auto statement = database->prepare(dbqueries::QueryCollectionWithIndex::getSql(objectTableName, subquery));
    bindArgumentsAndLimit(statement, 1, indexQueryArgs, limit);
    return makeObjectCursor(std::move(statement));
}

std::unique_ptr<Cursor> CollectionStorage::queryWithIndexSorted(const std::string& collectionName,
                                                                const std::string& indexQuery,
                                                                const std::vector<std::string>& indexQueryArgs,
                                                                const std::string& sortFieldName,
                                                                SortDirection direction, int limit) {
    std::string indexTableName = indexStorage->getTableName(collectionName);
    std::string subquery = stringReplace(indexQuery, kIndexTablePlaceholder, dbqueries::quoted(indexTableName));
    std::string objectTableName = objectStorage->getTableName(collectionName);
    const char* directionText = direction == SortDirection::ASCENDING ? "ASC" : "DESC";
    auto statement = database->prepare(
        dbqueries::QueryCollectionWithIndexSorted::getSql(objectTableName, indexTableName, subquery, directionText));
    statement.bind(1, sortFieldName);
    bindArgumentsAndLimit(statement, 2, indexQueryArgs, limit);
    return makeObjectCursor(std::move(statement));
}

std::unique_ptr<Cursor> CollectionStorage::getObject(const std::string& collectionName,
                                                     const std::string& primaryKey) {
    return objectStorage->getObject(collectionName, primaryKey);
}

void CollectionStorage::saveObject(const std::string& collectionName, const std::string& primaryKey,
                                   const std::string& sortKey, const unsigned char* blob, unsigned int blobSize,
                                   ObjectStatus status) {
    writeObject(collectionName, primaryKey, sortKey, blob, blobSize, nullptr, status);
}

void CollectionStorage::saveObject(const std::string& collectionName, const std::string& primaryKey,
                                   const std::string& sortKey, const std::vector<unsigned char>& blob,
                                   ObjectStatus status) {
    writeObject(collectionName, primaryKey, sortKey, blob.data(), static_cast<unsigned int>(blob.size()), &blob,
                status);
}

void CollectionStorage::writeObject(const std::string& collectionName, const std::string& primaryKey,
                                    const std::string& sortKey, const unsigned char* blob, unsigned int blobSize,
                                    const std::vector<unsigned char>* blobVector, ObjectStatus status) {
    objectStorage->saveObject(collectionName, primaryKey, sortKey, blob, blobSize, status);
    std::unordered_multimap<std::string, std::string> fields;
    CallbackManager::CollectionIndexerFunction indexer = callbackManager->getCollectionIndexerFunction();
    if (indexer) {
        // The indexer takes a vector; a caller that has one spares the copy.
        std::vector<unsigned char> copy;
        if (blobVector == nullptr) copy.assign(blob, blob + blobSize);
        fields = indexer(collectionName, primaryKey, sortKey, blobVector != nullptr ? *blobVector : copy);
    }
    // Also without an indexer: the object's old index rows must go.
    indexStorage->saveObject(collectionName, primaryKey, fields);
}

void CollectionStorage::deleteObject(const std::string& collectionName, const std::string& primaryKey) {
    objectStorage->deleteObject(collectionName, primaryKey);
    indexStorage->deleteObject(collectionName, primaryKey);
}

void CollectionStorage::updateObjectStatus(const std::string& collectionName, const std::string& primaryKey,
                                           ObjectStatus status) {
    objectStorage->updateObjectStatus(collectionName, primaryKey, status);
}

uint64_t CollectionStorage::incrementAndGetVersionId(const std::string& collectionName) {
    return versionIdGenerator->incrementAndGetVersionId(collectionName);
}

}  // namespace tessarine
}  // namespace lumivale
