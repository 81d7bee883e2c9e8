// The entry object of the library: one store per database file.
//
//   auto store = Tessarine::open(path, transport, threadCreator);
//   store->addDeltaReceivedCallback(...);        // before start()
//   store->setCollectionIndexerFunction(...);    // before start()
//   store->start();                              // the transport starts connecting
//   auto items = store->subscribeCollection("app:Items");
//   items->saveObject("id-1", "sort-1", bytes);
//   ...
//   store->remove();   // only to delete the store's files for good
//
// open builds every component on one SQLite connection, opened with fixed
// tuning (TessarineOptions). The application keeps the transport and the
// thread creator it passes in; a transport that outlives the store is safe:
// every component removes its registrations with it when it is destroyed.
//
// Threads: the instance takes no lock; call it from application threads,
// never from the store's worker or from inside a transport delivery (its
// destruction joins the worker and unregisters from the transport). The
// application's callbacks run on the writing thread after a local write and
// on the worker thread for everything that arrives through the transport.
//
// Errors: open and subscribeCollection log failures at priority 6 and return
// an empty pointer; they never throw.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "tessarine/CallbackManager.h"
#include "tessarine/Collection.h"
#include "tessarine/StoreComponents.h"
#include "tessarine/SyncMetrics.h"
#include "tessarine/SyncProtocol.h"
#include "tessarine/ThreadCreator.h"

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

// The pragmas a store database is opened with. The defaults are the store's
// fixed tuning; applications do not choose other values.
struct TessarineOptions {
    std::string tempStore = "MEMORY";
    std::string journalMode = "WAL";
    std::string synchronous = "NORMAL";
    int busyTimeout = 1000;  // milliseconds
};

class Tessarine {
public:
    // Opens (or creates) the store at path. Empty on failure, after logging
    // "Error while creating tessarine instance: <reason>".
    static std::unique_ptr<Tessarine> open(const std::string& path, std::shared_ptr<SyncProtocol> syncProtocol,
                                           std::shared_ptr<ThreadCreator> threadCreator) noexcept;

    // Builds every component on database (open does this for you); path
    // names its file for remove(). Throws when a component cannot be built
    // or a pointer is null.
    Tessarine(std::shared_ptr<SyncProtocol> syncProtocol, std::shared_ptr<ThreadCreator> threadCreator,
              std::shared_ptr<lumivale::sqlite::Database> database, const std::string& path);
    ~Tessarine();
    Tessarine(const Tessarine&) = delete;
    Tessarine& operator=(const Tessarine&) = delete;

    // Starts the transport; from then on its events reach the store.
    void start() noexcept;

    // A new handle on the collection, subscribing to it (and creating its
    // tables) if needed. Empty, with a log line, for an invalid name or on
    // failure. Every call makes a new handle on the same tables.
    std::unique_ptr<Collection> subscribeCollection(const std::string& collectionName) noexcept;

    // How far synchronisation has got: queued changes by status, jobs
    // waiting on the worker, whether it is retrying a failed job (since when,
    // why), connections seen and when a change was last persisted. Cheap
    // (one short query on the queue table, which may wait for a transaction
    // in progress) and callable from any thread, the worker and transport
    // callbacks included. Empty, after logging "Error while reading sync
    // metrics: <reason>" at priority 6, when the queue cannot be read.
    std::optional<SyncMetrics> getSyncMetrics() const noexcept;

    // Register before start(); registering later is safe too.
    void addDeltaReceivedCallback(const CallbackManager::DeltaReceivedCallback& callback) noexcept;
    void setCollectionIndexerFunction(const CallbackManager::CollectionIndexerFunction& indexer) noexcept;

    // Opens (creating if needed) the database at path with flags read-write |
    // create and issues the four pragmas of options, in the order temp_store,
    // journal_mode, synchronous, busy_timeout. "" and ":memory:" keep SQLite's
    // meaning. Throws lumivale::sqlite::SQLiteException, also when the file
    // could only be opened for reading.
    static std::shared_ptr<lumivale::sqlite::Database> createSqliteDatabase(const std::string& path,
                                                                            const TessarineOptions& options);

    // True when the path can be opened for reading.
    static bool fileExists(const std::string& path);

    // Stops the store (local writes are refused from now on, transport
    // events ignored), drops this instance's reference to the database and
    // deletes the database file, then its "-shm" and "-wal" files, skipping
    // those that do not exist. Returns false at the first existing file that
    // cannot be deleted, leaving the rest; true otherwise, and always for ""
    // and ":memory:". Meant as the last call before destruction.
    bool remove();

private:
    std::shared_ptr<SyncProtocol> syncProtocol;
    std::shared_ptr<ThreadCreator> threadCreator;
    StoreComponents components;
    std::string path;
};

}  // namespace tessarine
}  // namespace lumivale
