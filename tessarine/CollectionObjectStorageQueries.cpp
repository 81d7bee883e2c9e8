#include "tessarine/CollectionObjectStorageQueries.h"

#include "tessarine/StringUtils.h"

namespace lumivale {
namespace tessarine {
namespace dbqueries {

std::string CreateCollectionTable::getSql(const std::string& tableName) {
    return "CREATE TABLE IF NOT EXISTS " + quoted(tableName) +
           " (primary_key VARCHAR(128),sort_key VARCHAR(128),blob BLOB,status INTEGER,"
           "PRIMARY KEY (sort_key, primary_key),UNIQUE (primary_key))";
}

std::string QueryCollection::getSql(const std::string& tableName, bool ascending) {
    return concat({"SELECT primary_key, sort_key, blob, status FROM \"", tableName, "\" WHERE sort_key ",
                   ascending ? ">=" : "<=", " ? ORDER BY sort_key ", ascending ? "ASC" : "DESC", " LIMIT ?"});
}

std::string GetObject::getSql(const std::string& tableName) {
    return concat({"SELECT primary_key, sort_key, blob, status FROM \"", tableName, "\" WHERE primary_key = ?"});
}

std::string SaveObject::getSql(const std::string& tableName) {
    return concat({"INSERT OR REPLACE INTO \"", tableName,
                   "\" (primary_key, sort_key, blob, status) VALUES (?, ?, ?, ?)"});
}

std::string DeleteObject::getSql(const std::string& tableName) {
    return concat({"DELETE FROM \"", tableName, "\" WHERE primary_key = ?"});
}

std::string UpdateObjectStatus::getSql(const std::string& tableName) {
    return concat({"UPDATE \"", tableName, "\" SET status = ? WHERE primary_key = ?"});
}

}  // namespace dbqueries
}  // namespace tessarine
}  // namespace lumivale
