#include "tessarine/CollectionStorageQueries.h"

#include "tessarine/StringUtils.h"

namespace lumivale {
namespace tessarine {
namespace dbqueries {

std::string QueryCollectionWithIndex::getSql(const std::string& objectTableName, const std::string& subquery) {
    return "SELECT primary_key, sort_key, blob, status FROM " + quoted(objectTableName) + " " +
           "WHERE primary_key IN (" + subquery + ") LIMIT ?";
}

std::string QueryCollectionWithIndexSorted::getSql(const std::string& objectTableName,
                                                   const std::string& indexTableName, const std::string& subquery,
                                                   const std::string& direction) {
    return "SELECT obj.primary_key, obj.sort_key, obj.blob, obj.status FROM " + quoted(objectTableName) + " obj " +
           "LEFT OUTER JOIN " + quoted(indexTableName) + " idx " +
           "  ON obj.primary_key = idx.primary_key AND idx.field_name = ? WHERE obj.primary_key IN (" + subquery +
           ") ORDER BY idx.field_value " + direction + " " + "LIMIT ?";
}

}  // namespace dbqueries
}  // namespace tessarine
}  // namespace lumivale
