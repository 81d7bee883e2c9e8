#include "tessarine/CollectionIndexStorageQueries.h"

#include "tessarine/StringUtils.h"

namespace lumivale {
namespace tessarine {
namespace dbqueries {

std::string CreateCollectionIndexTable::getSql(const std::string& tableName) {
    return "CREATE TABLE IF NOT EXISTS " + quoted(tableName) +
           " (primary_key VARCHAR(128),field_name VARCHAR(128),field_value VARCHAR(128))";
}

std::vector<std::string> CreateCollectionIndexTable::getIndexSqls(const std::string& tableName) {
    return {
        "CREATE INDEX IF NOT EXISTS " + quoted(tableName + "_coll_idx_pk_fname_idx") + " ON " + quoted(tableName) +
            " (primary_key, field_name)",
        "CREATE INDEX IF NOT EXISTS " + quoted(tableName + "_coll_idx_fname_fvalue") + " ON " + quoted(tableName) +
            " (field_name, field_value)",
    };
}

std::string CollectionIndexSaveObject::getSql(const std::string& tableName) {
    return "INSERT OR REPLACE INTO " + quoted(tableName) + " " + "(primary_key, field_name, field_value) " +
           "VALUES (?, ?, ?)";
}

std::string CollectionIndexDeleteObject::getSql(const std::string& tableName) {
    return "DELETE FROM " + quoted(tableName) + " " + "WHERE primary_key = ?";
}

}  // namespace dbqueries
}  // namespace tessarine
}  // namespace lumivale
