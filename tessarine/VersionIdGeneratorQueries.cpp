#include "tessarine/VersionIdGeneratorQueries.h"

namespace lumivale {
namespace tessarine {
namespace dbqueries {

std::string CreateVersionIdTable::getSql(const std::string& tableName) {
    return "CREATE TABLE IF NOT EXISTS " + tableName +
           " (collection_name VARCHAR(256),version_id UNSIGNED BIG INT,PRIMARY KEY (collection_name))";
}

std::string InitializeVersionId::getSql(const std::string& tableName) {
    return "INSERT OR IGNORE INTO " + tableName + " (collection_name, version_id) VALUES (?, 0)";
}

std::string IncrementVersionId::getSql(const std::string& tableName) {
    return "UPDATE " + tableName + " SET version_id = version_id + 1 WHERE collection_name = ?";
}

std::string QueryVersionId::getSql(const std::string& tableName) {
    return "SELECT version_id FROM " + tableName + " WHERE collection_name = ?";
}

}  // namespace dbqueries
}  // namespace tessarine
}  // namespace lumivale
