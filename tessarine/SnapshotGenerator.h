// Builds a snapshot of one collection from the local tables: every object in
// ascending sort-key order, the collection's subscription sequence number (0
// without a subscription) and the highest version id recorded for the given
// client.
//
// Threads: runs on the caller's thread, reading in one transaction.
// Errors: SQLiteException passes through.
#pragma once

#include <memory>
#include <string>

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class CollectionStorage;
class SubscriptionManager;
class VersionVectorStorage;

class SnapshotGenerator {
public:
    SnapshotGenerator(std::shared_ptr<lumivale::sqlite::Database> database,
                      std::shared_ptr<CollectionStorage> collectionStorage,
                      std::shared_ptr<SubscriptionManager> subscriptionManager,
                      std::shared_ptr<VersionVectorStorage> versionVectorStorage);
    virtual ~SnapshotGenerator();

    virtual SyncProtocol::Snapshot generateSnapshot(const std::string& collectionName, const std::string& clientId);

private:
    std::shared_ptr<lumivale::sqlite::Database> database;
    std::shared_ptr<CollectionStorage> collectionStorage;
    std::shared_ptr<SubscriptionManager> subscriptionManager;
    std::shared_ptr<VersionVectorStorage> versionVectorStorage;
};

}  // namespace tessarine
}  // namespace lumivale
