#include "tessarine/SnapshotGenerator.h"

#include <exception>

#include "sqlite/Database.h"
#include "tessarine/CollectionStorage.h"
#include "tessarine/Cursor.h"
#include "tessarine/SubscriptionManager.h"
#include "tessarine/VersionVectorStorage.h"

namespace lumivale {
namespace tessarine {

SnapshotGenerator::SnapshotGenerator(std::shared_ptr<lumivale::sqlite::Database> theDatabase,
                                     std::shared_ptr<CollectionStorage> theCollectionStorage,
                                     std::shared_ptr<SubscriptionManager> theSubscriptionManager,
                                     std::shared_ptr<VersionVectorStorage> theVersionVectorStorage)
    : database(std::move(theDatabase)),
      collectionStorage(std::move(theCollectionStorage)),
      subscriptionManager(std::move(theSubscriptionManager)),
      versionVectorStorage(std::move(theVersionVectorStorage)) {}

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
