#include "tessarine/SnapshotGenerator.h"

#include <exception>

#include "sqlite/Database.h"
#include "tessarine/CollectionStorage.h"
#include "tessarine/Cursor.h"
#include "tessarine/SubscriptionManager.h"
#include "tessarine/VersionVectorStorage.h"

namespace lumivale {
namespace tessarine {

SnapshotGenerator::SnapshotGenerator(std::shared_ptr<lumivale::sqlite::Database> database,
                                     std::shared_ptr<CollectionStorage> collectionStorage,
                                     std::shared_ptr<SubscriptionManager> subscriptionManager,
                                     std::shared_ptr<VersionVectorStorage> versionVectorStorage)
    : database(std::move(database)),
      collectionStorage(std::move(collectionStorage)),
      subscriptionManager(std::move(subscriptionManager)),
      versionVectorStorage(std::move(versionVectorStorage)) {}

SnapshotGenerator::~SnapshotGenerator() = default;

SyncProtocol::Snapshot SnapshotGenerator::generateSnapshot(const std::string& collectionName,
                                                           const std::string& clientId) {
    collectionStorage->ensureTableExistsForCollection(collectionName);
    SyncProtocol::Snapshot snapshot;
    snapshot.collectionName = collectionName;
    database->runInTransaction([&] {
        std::unique_ptr<Cursor> cursor = collectionStorage->query(collectionName, "", -1, true);
        try {
            snapshot.sequenceNumber = subscriptionManager->getSequenceNumber(collectionName);
        } catch (const std::exception&) {
            snapshot.sequenceNumber = 0;  // not subscribed
        }
        snapshot.versionId = versionVectorStorage->getCollectionVersion(collectionName, clientId);
        while (cursor->step()) {
            auto blob = cursor->getBlob();
            snapshot.objects.push_back({cursor->getPrimaryKey(), cursor->getSortKey(),
                                        std::vector<unsigned char>(blob.first, blob.first + blob.second)});
        }
    }, lumivale::sqlite::Database::TransactionType::Immediate);
    return snapshot;
}

}  // namespace tessarine
}  // namespace lumivale
