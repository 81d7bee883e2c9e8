// The SQL texts of CollectionObjectStorage. Each builder takes the object
// table's name (never the collection name), writes it quoted and returns the
// statement text; parameters are noted per builder, numbered from 1.
#pragma once

#include <string>

namespace lumivale {
namespace tessarine {
namespace dbqueries {

// No parameters.
struct CreateCollectionTable {
    static std::string getSql(const std::string& tableName);
};

// 1 sort-key bound (text, inclusive), 2 limit.
struct QueryCollection {
    static std::string getSql(const std::string& tableName, bool ascending);
};

// 1 primary key.
struct GetObject {
    static std::string getSql(const std::string& tableName);
};

// 1 primary key, 2 sort key, 3 blob, 4 status.
struct SaveObject {
    static std::string getSql(const std::string& tableName);
};

// 1 primary key.
struct DeleteObject {
    static std::string getSql(const std::string& tableName);
};

// 1 status, 2 primary key.
struct UpdateObjectStatus {
    static std::string getSql(const std::string& tableName);
};

}  // namespace dbqueries
}  // namespace tessarine
}  // namespace lumivale
