#include "tessarine/Tessarine.h"

#include <cstdio>
#include <exception>
#include <fstream>
#include <stdexcept>

#include "platform/Log.h"
#include "sqlite/Database.h"
#include "sqlite/SQLiteException.h"
#include "tessarine/CollectionIndexStorage.h"
#include "tessarine/CollectionObjectStorage.h"
#include "tessarine/DeltaHandler.h"
#include "tessarine/DeltaQueue.h"
#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/ExponentialBackoff.h"
#include "tessarine/LibraryMetadata.h"
#include "tessarine/Lifecycle.h"
#include "tessarine/SerializedJobQueue.h"
#include "tessarine/SnapshotConsumer.h"
#include "tessarine/SnapshotGenerator.h"
#include "tessarine/SubscriptionManager.h"
#include "tessarine/SubscriptionStorage.h"
#include "tessarine/SyncMetricsCollector.h"
#include "tessarine/VersionIdGenerator.h"
#include "tessarine/VersionVectorStorage.h"

namespace lumivale {
namespace tessarine {

namespace {

constexpr int kOpenReadWriteCreate = 6;  // SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE
constexpr int kSqliteReadOnly = 8;       // SQLITE_READONLY

// The worker's pauses between attempts of a failing job: 5 ms, doubling,
// at most 30 s.
ExponentialBackoff<std::chrono::milliseconds> storeBackoff() {
    using std::chrono::milliseconds;
    return {milliseconds(5), milliseconds(30000), 2, milliseconds(5)};
}

template <typename T>
const std::shared_ptr<T>& required(const std::shared_ptr<T>& pointer, const char* what) {
    if (!pointer) throw std::invalid_argument(std::string(what) + " must not be null");
    return pointer;
}

}  // namespace

std::unique_ptr<Tessarine> Tessarine::open(const std::string& path, std::shared_ptr<SyncProtocol> syncProtocol,
                                           std::shared_ptr<ThreadCreator> threadCreator) noexcept {
    try {
        auto database = createSqliteDatabase(path, TessarineOptions());
        auto versionVectorStorage = std::make_shared<VersionVectorStorage>(database);
        auto subscriptionStorage = std::make_shared<SubscriptionStorage>(database);
        auto deltaQueueStorage = std::make_shared<DeltaQueueStorage>(database);
        return std::make_unique<Tessarine>(std::move(syncProtocol), std::move(threadCreator), database,
                                           versionVectorStorage, subscriptionStorage, deltaQueueStorage, path);
    } catch (const std::exception& e) {
        lv_printLog(6, "tessarine", "Error while creating tessarine instance: %s", e.what());
        return nullptr;
    }
}

// Components register with the transport and the lifecycle in their
// constructors, so this order is the order in which they hear events: on a
// connection the subscriptions go out before the queue resends, and on stop
// the queue stops before the handler.
Tessarine::Tessarine(std::shared_ptr<SyncProtocol> syncProtocol, std::shared_ptr<ThreadCreator> threadCreator,
                     std::shared_ptr<lumivale::sqlite::Database> database,
                     std::shared_ptr<VersionVectorStorage> versionVectorStorage,
                     std::shared_ptr<SubscriptionStorage> subscriptionStorage,
                     std::shared_ptr<DeltaQueueStorage> deltaQueueStorage, const std::string& path)
    : syncProtocol(required(syncProtocol, "the SyncProtocol")),
      threadCreator(required(threadCreator, "the ThreadCreator")),
      database(required(database, "the database")),
      versionVectorStorage(required(versionVectorStorage, "the VersionVectorStorage")),
      path(path) {
    required(subscriptionStorage, "the SubscriptionStorage");
    required(deltaQueueStorage, "the DeltaQueueStorage");
    auto metadata = std::make_shared<LibraryMetadata>(std::make_shared<LibraryMetadataStorage>(this->database));
    clientId = metadata->getClientUuid();
    subscriptionManager = std::make_shared<SubscriptionManager>(this->database, this->syncProtocol,
                                                                subscriptionStorage, metadata);
    versionIdGenerator = std::make_shared<VersionIdGenerator>(this->database);
    callbackManager = std::make_shared<CallbackManager>();
    collectionStorage = std::make_shared<CollectionStorage>(
        this->database, callbackManager, std::make_shared<CollectionIndexStorage>(this->database),
        std::make_shared<CollectionObjectStorage>(this->database), versionIdGenerator);
    lifecycle = std::make_shared<Lifecycle>();
    auto jobQueue = std::make_shared<SerializedJobQueue>(this->threadCreator, storeBackoff());
    deltaQueue = std::make_shared<DeltaQueue>(this->database, lifecycle, deltaQueueStorage, jobQueue,
                                              this->syncProtocol, clientId);
    deltaHandler = std::make_shared<DeltaHandler>(this->database, callbackManager, collectionStorage, deltaQueue,
                                                  lifecycle, this->syncProtocol, jobQueue, subscriptionManager,
                                                  this->versionVectorStorage, clientId);
    snapshotGenerator = std::make_shared<SnapshotGenerator>(this->database, collectionStorage, subscriptionManager,
                                                            this->versionVectorStorage);
    snapshotConsumer = std::make_shared<SnapshotConsumer>(deltaQueueStorage, this->syncProtocol, subscriptionManager);
    syncMetrics = std::make_shared<SyncMetricsCollector>(this->syncProtocol, deltaQueueStorage, jobQueue);
    // Shared, not borrowed: collection handles can keep the delta queue, and
    // with it the worker, alive after this instance is gone.
    deltaQueue->setChangePersistedListener([metrics = syncMetrics] { metrics->onChangePersisted(); });
}

Tessarine::~Tessarine() = default;

void Tessarine::start() noexcept { syncProtocol->start(); }

std::unique_ptr<Collection> Tessarine::subscribeCollection(const std::string& collectionName) noexcept {
    if (!Collection::isValidCollectionName(collectionName)) {
        lv_printLog(6, "tessarine", "Error subscribing to a collection: Invalid collection name.");
        return nullptr;
    }
    try {
        // The tables are made before the server is asked for the collection,
        // so that its first changes never arrive for tables that do not
        // exist yet (they would fail and wait for a retry).
        auto collection = std::make_unique<Collection>(collectionStorage, deltaHandler, snapshotGenerator,
                                                       collectionName);
        subscriptionManager->subscribeCollection(collectionName);
        return collection;
    } catch (const std::exception& e) {
        lv_printLog(6, "tessarine", "Error while subscribing to collection %s: %s", collectionName.c_str(), e.what());
        return nullptr;
    }
}

std::optional<SyncMetrics> Tessarine::getSyncMetrics() const noexcept {
    try {
        return syncMetrics->read();
    } catch (const std::exception& e) {
        lv_printLog(6, "tessarine", "Error while reading sync metrics: %s", e.what());
        return std::nullopt;
    }
}

void Tessarine::addDeltaReceivedCallback(const CallbackManager::DeltaReceivedCallback& callback) noexcept {
    callbackManager->addDeltaReceivedCallback(callback);
}

void Tessarine::setCollectionIndexerFunction(const CallbackManager::CollectionIndexerFunction& indexer) noexcept {
    callbackManager->setCollectionIndexerFunction(indexer);
}

std::shared_ptr<lumivale::sqlite::Database> Tessarine::createSqliteDatabase(const std::string& path,
                                                                            const TessarineOptions& options) {
    auto database = std::make_shared<lumivale::sqlite::Database>(path, kOpenReadWriteCreate);
    // SQLite falls back to reading only when the file cannot be written; a
    // store that opened so could not even subscribe to its collections.
    if (database->isReadOnly()) {
        throw lumivale::sqlite::SQLiteException(kSqliteReadOnly, "the database file cannot be written",
                                                "opening database \"" + path + "\"");
    }
    database->exec("PRAGMA temp_store=" + options.tempStore);
    database->exec("PRAGMA journal_mode=" + options.journalMode);
    database->exec("PRAGMA synchronous=" + options.synchronous);
    database->exec("PRAGMA busy_timeout=" + std::to_string(options.busyTimeout));
    return database;
}

bool Tessarine::fileExists(const std::string& path) { return std::ifstream(path).good(); }

bool Tessarine::remove() {
    lifecycle->stop();
    database.reset();
    if (path.empty() || path == ":memory:") return true;
    for (const std::string& file : {path, path + "-shm", path + "-wal"}) {
        if (fileExists(file) && std::remove(file.c_str()) != 0) return false;
    }
    return true;
}

}  // namespace tessarine
}  // namespace lumivale
