// The application's handle on one collection of a store.
//
// Reads go straight to the collection's tables and return a Cursor; an empty
// pointer means the query failed (logged), not that nothing matched. Writes
// never touch the tables directly: each becomes a local delta, numbered with
// the collection's next version id, that is queued for the server, applied
// with status PENDING and reported to the application's callbacks before the
// call returns. Every failure below is caught here, logged at priority 6 with
// its message and turned into an empty pointer or false. A failed write may
// have used up a version id, so version ids can have gaps.
//
// The handle keeps the store's components (and its worker thread) alive for
// as long as it lives, even after the Tessarine instance is gone. Destroying
// it changes nothing stored; the subscription stays.
//
// Threads: no lock; any application thread may call any operation, several
// handles on one collection may be used at once.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "tessarine/CollectionStorage.h"
#include "tessarine/Cursor.h"
#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {

class DeltaHandler;
class SnapshotGenerator;

class Collection {
public:
    // Creates the collection's tables and version counter if missing (this
    // may throw); does not check the name.
    Collection(std::shared_ptr<CollectionStorage> collectionStorage, std::shared_ptr<DeltaHandler> deltaHandler,
               std::shared_ptr<SnapshotGenerator> snapshotGenerator, const std::string& collectionName);

    // Objects from sortKey upward (ASCENDING) or downward, inclusive, in
    // sort-key order; at most limit, a negative limit means all.
    std::unique_ptr<Cursor> query(const std::string& sortKey, int limit,
                                  CollectionStorage::SortDirection direction) noexcept;
    // Objects whose primary key indexQuery selects: SQL over the index table
    // (written "{0}", columns primary_key, field_name, field_value), with
    // indexQueryArgs bound to its ? marks as text, in order.
    std::unique_ptr<Cursor> queryWithIndex(const std::string& indexQuery,
                                           const std::vector<std::string>& indexQueryArgs, int limit);
    // As queryWithIndex, ordered by the text value of the indexed field
    // sortFieldName; objects without that field come first ascending.
    std::unique_ptr<Cursor> queryWithIndexSorted(const std::string& indexQuery,
                                                 const std::vector<std::string>& indexQueryArgs,
                                                 const std::string& sortFieldName,
                                                 CollectionStorage::SortDirection direction, int limit);
    // A cursor with at most one row.
    std::unique_ptr<Cursor> getObject(const std::string& primaryKey) noexcept;

    // Saves the object (creating or replacing it); true when the change was
    // accepted, stored and queued.
    bool saveObject(const std::string& primaryKey, const std::string& sortKey, const unsigned char* blob,
                    unsigned int blobSize) noexcept;
    bool saveObject(const std::string& primaryKey, const std::string& sortKey,
                    const std::vector<unsigned char>& blob) noexcept;
    bool deleteObject(const std::string& primaryKey) noexcept;

    // Two non-empty parts of ASCII letters, digits and underscores joined by
    // one colon, such as "app_1:Items".
    static bool isValidCollectionName(const std::string& name);

private:
    bool write(SyncProtocol::DeltaType type, const std::string& primaryKey, const std::string& sortKey,
               const unsigned char* blob, unsigned int blobSize, const char* errorFormat) noexcept;

    std::shared_ptr<CollectionStorage> collectionStorage;
    std::shared_ptr<DeltaHandler> deltaHandler;
    std::shared_ptr<SnapshotGenerator> snapshotGenerator;
    std::string collectionName;
};

}  // namespace tessarine
}  // namespace lumivale
