// Internal: the one place where a store's components are built and wired.
//
// buildStoreComponents makes every component on one database, in the order
// in which they must hear events: components register with the transport
// and the lifecycle in their constructors, so on a connection the
// subscriptions go out before the queue resends, and on stop the queue
// stops before the handler. The store instance keeps the result; tests
// build the same wiring and reach each component through it.
//
// Destroying a StoreComponents releases the components in the reverse of
// the members' order below, which is the order the store relies on (the
// lifecycle and the delta queue before the delta handler, the job queue
// after it). Must not be destroyed on the worker or inside a transport
// delivery. Building throws when a component cannot be built or a pointer
// given is null.
#pragma once

#include <chrono>
#include <memory>
#include <string>

#include "tessarine/ExponentialBackoff.h"

class ThreadCreator;

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class CallbackManager;
class CollectionStorage;
class DeltaHandler;
class DeltaQueue;
class DeltaQueueStorage;
class LibraryMetadata;
class Lifecycle;
class SerializedJobQueue;
class SnapshotConsumer;
class SnapshotGenerator;
class SubscriptionManager;
class SubscriptionStorage;
class SyncMetricsCollector;
class SyncProtocol;
class VersionIdGenerator;
class VersionVectorStorage;

struct StoreComponents {
    std::shared_ptr<lumivale::sqlite::Database> database;
    std::shared_ptr<SubscriptionStorage> subscriptionStorage;
    std::shared_ptr<DeltaQueueStorage> deltaQueueStorage;
    std::shared_ptr<VersionVectorStorage> versionVectorStorage;
    std::shared_ptr<LibraryMetadata> metadata;
    std::string clientId;
    std::shared_ptr<SubscriptionManager> subscriptionManager;
    std::shared_ptr<VersionIdGenerator> versionIdGenerator;
    std::shared_ptr<CollectionStorage> collectionStorage;
    std::shared_ptr<CallbackManager> callbackManager;
    std::shared_ptr<SerializedJobQueue> jobQueue;
    std::shared_ptr<DeltaHandler> deltaHandler;
    std::shared_ptr<DeltaQueue> deltaQueue;
    std::shared_ptr<Lifecycle> lifecycle;
    std::shared_ptr<SnapshotGenerator> snapshotGenerator;
    std::shared_ptr<SnapshotConsumer> snapshotConsumer;
    std::shared_ptr<SyncMetricsCollector> syncMetrics;
};

// The worker's pauses between attempts of a failing job: 5 ms, doubling,
// at most 30 s.
ExponentialBackoff<std::chrono::milliseconds> storeBackoff();

// deltaQueueStorage, when given, is used instead of one made on database
// (tests substitute one that fails); jobBackoff is the worker's pauses.
StoreComponents buildStoreComponents(std::shared_ptr<SyncProtocol> syncProtocol,
                                     std::shared_ptr<ThreadCreator> threadCreator,
                                     std::shared_ptr<lumivale::sqlite::Database> database,
                                     std::shared_ptr<DeltaQueueStorage> deltaQueueStorage = nullptr,
                                     ExponentialBackoff<std::chrono::milliseconds> jobBackoff = storeBackoff());

}  // namespace tessarine
}  // namespace lumivale
