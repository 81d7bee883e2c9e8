// The index table of each collection: "collection_index_" followed by the
// collection name, holding the (field name, field value) pairs that the
// application's indexer produced for each object, as text.
//
// The table has no key: an object may have any number of rows, repeated field
// names and even identical rows. Two indexes come with it, on
// (primary_key, field_name) for replacing an object's rows and for the sorted
// query's join, and on (field_name, field_value) for subqueries that select
// objects by value.
//
// Every operation finds the table through the virtual getTableName.
// Transactions: none of its own; saveObject deletes before it inserts, so
// callers run it inside a transaction. Threads: no state besides the shared
// Database. Errors: nothing is caught; SQLite errors reach the caller.
#pragma once

#include <memory>
#include <string>
#include <unordered_map>

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class CollectionIndexStorage {
public:
    static inline const std::string TABLE_NAME_PREFIX = "collection_index_";

    // Runs no SQL.
    explicit CollectionIndexStorage(std::shared_ptr<lumivale::sqlite::Database> database);
    virtual ~CollectionIndexStorage();
    CollectionIndexStorage(const CollectionIndexStorage&) = delete;
    CollectionIndexStorage& operator=(const CollectionIndexStorage&) = delete;

    // Creates the table and its two indexes if they are missing.
    virtual void ensureTableExistsForCollection(const std::string& collectionName);

    // Replaces all of the object's rows with one row per entry of fields
    // (field name to field value), duplicates included; empty fields leave
    // the object without rows.
    virtual void saveObject(const std::string& collectionName, const std::string& primaryKey,
                            const std::unordered_multimap<std::string, std::string>& fields);

    // Removes all of the object's rows; no rows is no error.
    virtual void deleteObject(const std::string& collectionName, const std::string& primaryKey);

    // TABLE_NAME_PREFIX followed by the collection name.
    virtual std::string getTableName(const std::string& collectionName);

private:
    std::shared_ptr<lumivale::sqlite::Database> database;
};

}  // namespace tessarine
}  // namespace lumivale
