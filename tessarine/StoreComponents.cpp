#include "tessarine/StoreComponents.h"

#include <stdexcept>
#include <utility>

#include "sqlite/Database.h"
#include "tessarine/CallbackManager.h"
#include "tessarine/CollectionIndexStorage.h"
#include "tessarine/CollectionObjectStorage.h"
#include "tessarine/CollectionStorage.h"
#include "tessarine/DeltaHandler.h"
#include "tessarine/DeltaQueue.h"
#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/LibraryMetadata.h"
#include "tessarine/LibraryMetadataStorage.h"
#include "tessarine/Lifecycle.h"
#include "tessarine/SerializedJobQueue.h"
#include "tessarine/SnapshotConsumer.h"
#include "tessarine/SnapshotGenerator.h"
#include "tessarine/SubscriptionManager.h"
#include "tessarine/SubscriptionStorage.h"
#include "tessarine/SyncMetricsCollector.h"
#include "tessarine/SyncProtocol.h"
#include "tessarine/ThreadCreator.h"
#include "tessarine/VersionIdGenerator.h"
#include "tessarine/VersionVectorStorage.h"

namespace lumivale {
namespace tessarine {

namespace {

template <typename T>
void require(const std::shared_ptr<T>& pointer, const char* what) {
    if (!pointer) throw std::invalid_argument(std::string(what) + " must not be null");
}

}  // namespace

ExponentialBackoff<std::chrono::milliseconds> storeBackoff() {
    using std::chrono::milliseconds;
    return {milliseconds(5), milliseconds(30000), 2, milliseconds(5)};
}

StoreComponents buildStoreComponents(std::shared_ptr<SyncProtocol> syncProtocol,
                                     std::shared_ptr<ThreadCreator> threadCreator,
                                     std::shared_ptr<lumivale::sqlite::Database> database,
                                     std::shared_ptr<DeltaQueueStorage> deltaQueueStorage,
                                     ExponentialBackoff<std::chrono::milliseconds> jobBackoff) {
    require(syncProtocol, "the SyncProtocol");
    require(threadCreator, "the ThreadCreator");
    require(database, "the database");
    StoreComponents c;
    c.database = std::move(database);
    c.subscriptionStorage = std::make_shared<SubscriptionStorage>(c.database);
    c.deltaQueueStorage =
        deltaQueueStorage ? std::move(deltaQueueStorage) : std::make_shared<DeltaQueueStorage>(c.database);
    c.versionVectorStorage = std::make_shared<VersionVectorStorage>(c.database);
    c.metadata = std::make_shared<LibraryMetadata>(std::make_shared<LibraryMetadataStorage>(c.database));
    c.clientId = c.metadata->getClientUuid();
    c.subscriptionManager =
        std::make_shared<SubscriptionManager>(c.database, syncProtocol, c.subscriptionStorage, c.metadata);
    c.versionIdGenerator = std::make_shared<VersionIdGenerator>(c.database);
    c.callbackManager = std::make_shared<CallbackManager>();
    c.collectionStorage = std::make_shared<CollectionStorage>(
        c.database, c.callbackManager, std::make_shared<CollectionIndexStorage>(c.database),
        std::make_shared<CollectionObjectStorage>(c.database), c.versionIdGenerator);
    c.lifecycle = std::make_shared<Lifecycle>();
    c.jobQueue = std::make_shared<SerializedJobQueue>(std::move(threadCreator), jobBackoff);
    c.deltaQueue = std::make_shared<DeltaQueue>(c.database, c.lifecycle, c.deltaQueueStorage, c.jobQueue,
                                                syncProtocol, c.clientId);
    c.deltaHandler = std::make_shared<DeltaHandler>(c.database, c.callbackManager, c.collectionStorage, c.deltaQueue,
                                                    c.lifecycle, syncProtocol, c.jobQueue, c.subscriptionManager,
                                                    c.versionVectorStorage, c.clientId);
    c.snapshotGenerator = std::make_shared<SnapshotGenerator>(c.database, c.collectionStorage, c.subscriptionManager,
                                                              c.versionVectorStorage);
    c.snapshotConsumer = std::make_shared<SnapshotConsumer>(c.deltaQueueStorage, syncProtocol, c.subscriptionManager);
    c.syncMetrics = std::make_shared<SyncMetricsCollector>(syncProtocol, c.deltaQueueStorage, c.jobQueue);
    // Shared, not borrowed: collection handles can keep the delta queue, and
    // with it the worker, alive after the store instance is gone.
    c.deltaQueue->setChangePersistedListener([metrics = c.syncMetrics] { metrics->onChangePersisted(); });
    return c;
}

}  // namespace tessarine
}  // namespace lumivale
