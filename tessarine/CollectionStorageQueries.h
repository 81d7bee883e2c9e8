// The SQL texts of CollectionStorage's indexed queries. Both select the
// object rows whose primary key a caller-supplied subquery returns; the
// subquery is inserted verbatim, its index table name already in place.
#pragma once

#include <string>

namespace lumivale {
namespace tessarine {
namespace dbqueries {

// Parameters: the subquery's, then the limit.
struct QueryCollectionWithIndex {
    static std::string getSql(const std::string& objectTableName, const std::string& subquery);
};

// Parameters: 1 the sort field's name, then the subquery's, then the limit.
// direction is "ASC" or "DESC".
struct QueryCollectionWithIndexSorted {
    static std::string getSql(const std::string& objectTableName, const std::string& indexTableName,
                              const std::string& subquery, const std::string& direction);
};

}  // namespace dbqueries
}  // namespace tessarine
}  // namespace lumivale
