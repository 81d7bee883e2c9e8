// The SQL texts of CollectionIndexStorage. Each builder takes the index
// table's name (never the collection name) and writes it quoted; parameters
// are noted per builder, numbered from 1.
#pragma once

#include <string>
#include <vector>

namespace lumivale {
namespace tessarine {
namespace dbqueries {

struct CreateCollectionIndexTable {
    // The table; no parameters.
    static std::string getSql(const std::string& tableName);
    // Its two indexes, named after the table: "<table>_coll_idx_pk_fname_idx"
    // on (primary_key, field_name), then "<table>_coll_idx_fname_fvalue" on
    // (field_name, field_value).
    static std::vector<std::string> getIndexSqls(const std::string& tableName);
};

// 1 primary key, 2 field name, 3 field value.
struct CollectionIndexSaveObject {
    static std::string getSql(const std::string& tableName);
};

// 1 primary key.
struct CollectionIndexDeleteObject {
    static std::string getSql(const std::string& tableName);
};

}  // namespace dbqueries
}  // namespace tessarine
}  // namespace lumivale
