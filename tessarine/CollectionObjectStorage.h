// The object table of each collection: "collection_" followed by the
// collection name, one row per object (primary_key, sort_key, blob, status).
//
// The table's key is (sort_key, primary_key), which orders the range query,
// and primary_key is unique on its own, so saving an existing primary key
// under a new sort key replaces its row. Keys compare byte for byte. SQLite
// compares table names without regard to ASCII case, so collection names that
// differ only in case share one table.
//
// Every operation finds the table through the virtual getTableName, prepares
// a fresh statement and either steps it once or hands it to the Cursor it
// returns. Deleting or updating a missing key changes nothing and succeeds.
//
// Transactions: none of its own; callers that need atomicity run these
// operations inside one. Threads: no state besides the shared Database, so
// callable from any thread. Errors: nothing is caught; SQLite errors (for
// instance a table that was never created) reach the caller as
// lumivale::sqlite::SQLiteException.
#pragma once

#include <memory>
#include <string>

#include "tessarine/CollectionStorage.h"
#include "tessarine/Cursor.h"

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class CollectionObjectStorage {
public:
    static inline const std::string TABLE_NAME_PREFIX = "collection_";

    // Runs no SQL.
    explicit CollectionObjectStorage(std::shared_ptr<lumivale::sqlite::Database> database);
    virtual ~CollectionObjectStorage();
    CollectionObjectStorage(const CollectionObjectStorage&) = delete;
    CollectionObjectStorage& operator=(const CollectionObjectStorage&) = delete;

    // Creates the table if it is missing.
    virtual void ensureTableExistsForCollection(const std::string& collectionName);

    // Rows with sort key >= sortKey in increasing order (ascending), or <=
    // sortKey in decreasing order; at most limit rows, a negative limit means
    // all. Rows with equal sort keys come in the engine's order.
    virtual std::unique_ptr<Cursor> query(const std::string& collectionName, const std::string& sortKey, int limit,
                                          bool ascending);

    // The object's row, if there is one.
    virtual std::unique_ptr<Cursor> getObject(const std::string& collectionName, const std::string& primaryKey);

    // Inserts the object or replaces the row with its primary key. blob may
    // be null when blobSize is 0; the blob is stored byte for byte.
    virtual void saveObject(const std::string& collectionName, const std::string& primaryKey,
                            const std::string& sortKey, const unsigned char* blob, unsigned int blobSize,
                            CollectionStorage::ObjectStatus status);

    virtual void deleteObject(const std::string& collectionName, const std::string& primaryKey);

    virtual void updateObjectStatus(const std::string& collectionName, const std::string& primaryKey,
                                    CollectionStorage::ObjectStatus status);

    // TABLE_NAME_PREFIX followed by the collection name.
    virtual std::string getTableName(const std::string& collectionName);

private:
    std::shared_ptr<lumivale::sqlite::Database> database;
};

}  // namespace tessarine
}  // namespace lumivale
