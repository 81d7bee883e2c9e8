// The one entry through which the store reads and writes collection data.
//
// For each collection it combines the object table (CollectionObjectStorage),
// the index table (CollectionIndexStorage) and the version counter
// (VersionIdGenerator). Every save runs the application's indexer, when one is
// set, and rewrites the object's index rows from its result, so index rows
// always follow the object rows. It also builds the two queries that select
// objects through a caller-supplied subquery over the index table.
//
// Transactions: only ensureTableExistsForCollection opens one (and the version
// counter its own). Saves, deletes and status updates run in the caller's
// transaction, so that an object and its index rows change together.
//
// Threads: no lock of its own; callable from any thread, as safe as the
// shared Database. The indexer runs on the saving thread, inside the
// caller's transaction.
//
// Errors: nothing is caught. SQLite errors (lumivale::sqlite::SQLiteException,
// also for a subquery that is not valid SQL), exceptions thrown by the indexer
// and std::bad_alloc reach the caller.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "tessarine/Cursor.h"

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class CallbackManager;
class CollectionIndexStorage;
class CollectionObjectStorage;
class VersionIdGenerator;

class CollectionStorage {
public:
    // Order of an indexed, sorted query. Only ASCENDING (1) is tested for:
    // every other value sorts descending.
    enum class SortDirection : int32_t { ASCENDING = 1, DESCENDING = 2 };

    // The number kept in an object's status column: how far the object's
    // queued local changes have got. PERSISTED means nothing is queued.
    enum class ObjectStatus : int32_t { PENDING = 1, SENT = 2, PERSISTED = 3 };

    // Only stores its collaborators; runs no SQL.
    CollectionStorage(std::shared_ptr<lumivale::sqlite::Database> database,
                      std::shared_ptr<CallbackManager> callbackManager,
                      std::shared_ptr<CollectionIndexStorage> indexStorage,
                      std::shared_ptr<CollectionObjectStorage> objectStorage,
                      std::shared_ptr<VersionIdGenerator> versionIdGenerator);
    virtual ~CollectionStorage();
    CollectionStorage(const CollectionStorage&) = delete;
    CollectionStorage& operator=(const CollectionStorage&) = delete;

    // Creates the collection's object table, index table with its indexes and
    // version counter, in one transaction: all exist afterwards or, on an
    // error, none of this call's changes do. Idempotent; keeps an existing
    // counter.
    virtual void ensureTableExistsForCollection(const std::string& collectionName);

    // Objects from sortKey upward (ascending) or downward, inclusive, ordered
    // by sort key; at most limit rows, a negative limit means all.
    virtual std::unique_ptr<Cursor> query(const std::string& collectionName, const std::string& sortKey, int limit,
                                          bool ascending);

    // Objects whose primary key indexQuery selects, in the engine's order, at
    // most limit (negative: all). indexQuery is SQL inserted verbatim, with
    // every "{0}" replaced by the quoted index table name; indexQueryArgs are
    // bound as text to its ? parameters in order and the limit to the
    // parameter after them. Neither the SQL nor the argument count is checked.
    virtual std::unique_ptr<Cursor> queryWithIndex(const std::string& collectionName, const std::string& indexQuery,
                                                   const std::vector<std::string>& indexQueryArgs, int limit);

    // As queryWithIndex, ordered by the text value of each object's index
    // rows named sortFieldName (binary collation). Objects without such a row
    // come first ascending and last descending; an object with several such
    // rows comes once per row.
    virtual std::unique_ptr<Cursor> queryWithIndexSorted(const std::string& collectionName,
                                                         const std::string& indexQuery,
                                                         const std::vector<std::string>& indexQueryArgs,
                                                         const std::string& sortFieldName, SortDirection direction,
                                                         int limit);

    // At most one row.
    virtual std::unique_ptr<Cursor> getObject(const std::string& collectionName, const std::string& primaryKey);

    // Upserts the object, then replaces all its index rows with the indexer's
    // output for it; without an indexer the object is left with no index rows.
    virtual void saveObject(const std::string& collectionName, const std::string& primaryKey,
                            const std::string& sortKey, const unsigned char* blob, unsigned int blobSize,
                            ObjectStatus status);
    // The same for a blob the caller holds as a vector, which the indexer is
    // then given without a copy.
    void saveObject(const std::string& collectionName, const std::string& primaryKey, const std::string& sortKey,
                    const std::vector<unsigned char>& blob, ObjectStatus status);

    // Removes the object row and all the object's index rows.
    virtual void deleteObject(const std::string& collectionName, const std::string& primaryKey);

    virtual void updateObjectStatus(const std::string& collectionName, const std::string& primaryKey,
                                    ObjectStatus status);

    // The collection's next version id, committed in a transaction of its own.
    virtual uint64_t incrementAndGetVersionId(const std::string& collectionName);

private:
    // blobVector, when not null, holds the same bytes as blob.
    void writeObject(const std::string& collectionName, const std::string& primaryKey, const std::string& sortKey,
                     const unsigned char* blob, unsigned int blobSize, const std::vector<unsigned char>* blobVector,
                     ObjectStatus status);

    std::shared_ptr<lumivale::sqlite::Database> database;
    std::shared_ptr<CallbackManager> callbackManager;
    std::shared_ptr<CollectionIndexStorage> indexStorage;
    std::shared_ptr<CollectionObjectStorage> objectStorage;
    std::shared_ptr<VersionIdGenerator> versionIdGenerator;
};

}  // namespace tessarine
}  // namespace lumivale
