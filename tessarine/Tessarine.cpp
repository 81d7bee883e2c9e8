#include "tessarine/Tessarine.h"

#include <cstdio>
#include <exception>
#include <fstream>
#include <utility>

#include "platform/Log.h"
#include "sqlite/Database.h"
#include "sqlite/SQLiteException.h"
#include "tessarine/Lifecycle.h"
#include "tessarine/StoreLog.h"
#include "tessarine/SubscriptionManager.h"
#include "tessarine/SyncMetricsCollector.h"

namespace lumivale {
namespace tessarine {

std::unique_ptr<Tessarine> Tessarine::open(const std::string& path, std::shared_ptr<SyncProtocol> syncProtocol,
                                           std::shared_ptr<ThreadCreator> threadCreator) noexcept {
    try {
        return std::make_unique<Tessarine>(std::move(syncProtocol), std::move(threadCreator),
                                           createSqliteDatabase(path, TessarineOptions()), path);
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error while creating tessarine instance: %s", e.what());
        return nullptr;
    }
}

Tessarine::Tessarine(std::shared_ptr<SyncProtocol> theSyncProtocol, std::shared_ptr<ThreadCreator> theThreadCreator,
                     std::shared_ptr<lumivale::sqlite::Database> database, const std::string& thePath)
    : syncProtocol(theSyncProtocol),
      threadCreator(theThreadCreator),
      components(buildStoreComponents(theSyncProtocol, theThreadCreator, std::move(database))),
      path(thePath) {}

Tessarine::~Tessarine() = default;

void Tessarine::start() noexcept { syncProtocol->start(); }

std::unique_ptr<Collection> Tessarine::subscribeCollection(const std::string& collectionName) noexcept {
    if (!Collection::isValidCollectionName(collectionName)) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error subscribing to a collection: Invalid collection name.");
        return nullptr;
    }
    try {
        // The tables are made before the server is asked for the collection,
        // so that its first changes never arrive for tables that do not
        // exist yet (they would fail and wait for a retry).
        auto collection = std::make_unique<Collection>(components.collectionStorage, components.deltaHandler,
                                                       components.snapshotGenerator, collectionName);
        components.subscriptionManager->subscribeCollection(collectionName);
        return collection;
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error while subscribing to collection %s: %s",
                    collectionName.c_str(), e.what());
        return nullptr;
    }
}

std::optional<SyncMetrics> Tessarine::getSyncMetrics() const noexcept {
    try {
        return components.syncMetrics->read();
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error while reading sync metrics: %s", e.what());
        return std::nullopt;
    }
}

void Tessarine::addDeltaReceivedCallback(const CallbackManager::DeltaReceivedCallback& callback) noexcept {
    components.callbackManager->addDeltaReceivedCallback(callback);
}

void Tessarine::setCollectionIndexerFunction(const CallbackManager::CollectionIndexerFunction& indexer) noexcept {
    components.callbackManager->setCollectionIndexerFunction(indexer);
}

std::shared_ptr<lumivale::sqlite::Database> Tessarine::createSqliteDatabase(const std::string& path,
                                                                            const TessarineOptions& options) {
    auto database = std::make_shared<lumivale::sqlite::Database>(path, lumivale::sqlite::kOpenReadWriteCreate);
    // SQLite falls back to reading only when the file cannot be written; a
    // store that opened so could not even subscribe to its collections.
    if (database->isReadOnly()) {
        throw lumivale::sqlite::SQLiteException(lumivale::sqlite::kErrorReadOnly, "the database file cannot be written",
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
    components.lifecycle->stop();
    components.database.reset();
    if (path.empty() || path == ":memory:") return true;
    for (const std::string& file : {path, path + "-shm", path + "-wal"}) {
        if (fileExists(file) && std::remove(file.c_str()) != 0) return false;
    }
    return true;
}

}  // namespace tessarine
}  // namespace lumivale
