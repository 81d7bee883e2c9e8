// The SQL texts of VersionIdGenerator. The table has a fixed name, written
// into the SQL without quotes; parameters are noted per builder.
#pragma once

#include <string>

namespace lumivale {
namespace tessarine {
namespace dbqueries {

// No parameters.
struct CreateVersionIdTable {
    static std::string getSql(const std::string& tableName);
};

// 1 collection name. Creates the collection's row at 0 unless it exists.
struct InitializeVersionId {
    static std::string getSql(const std::string& tableName);
};

// 1 collection name.
struct IncrementVersionId {
    static std::string getSql(const std::string& tableName);
};

// 1 collection name; one column, the version id.
struct QueryVersionId {
    static std::string getSql(const std::string& tableName);
};

}  // namespace dbqueries
}  // namespace tessarine
}  // namespace lumivale
