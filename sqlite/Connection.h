// Internal to the SQLite access layer: the one sqlite3 handle of a Database,
// the recursive lock that serialises every call on it, the depth of the
// transaction that the mutex's owner has open, and the cache of its idle
// compiled statements.
//
// Database and every Statement prepared from it share the Connection, so a
// statement that outlives its Database (a cursor the application still holds)
// keeps the handle and the mutex valid. Every member function except the
// constructor expects the caller to hold mutex().
#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <string>
#include <thread>

#include "sqlite/ConnectionMutex.h"
#include "sqlite/StatementCache.h"

struct sqlite3;

namespace lumivale {
namespace sqlite {

class Connection {
public:
    Connection(const std::string& path, int flags);
    ~Connection();
    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;

    sqlite3* handle() const { return db; }
    ConnectionMutex& mutex() TS_RETURN_CAPABILITY(lock) { return lock; }

    // Throws SQLiteException with the connection's current error message.
    [[noreturn]] void fail(int code, const std::string& context) const;

    // Runs SQL that may return rows (which are discarded); throws on error.
    void exec(const std::string& sql);
    // Runs one statement that returns no rows, compiled once and then taken
    // from the cache (BEGIN, COMMIT and the like); throws on error.
    void execCached(const std::string& sql);

    StatementCache& statements() { return cache; }
    // Statements compiled on this connection so far (cache hits excluded).
    uint64_t compiledCount = 0;

    // Transactions nest: depth 0 means autocommit. Owned by the thread that
    // holds mutex() for the whole of the outermost transaction.
    int transactionDepth = 0;
    // The thread that has a transaction open, or no thread. Written under
    // mutex(), read without it: a thread asking whether it is itself inside
    // a transaction must not wait for another thread's.
    std::atomic<std::thread::id> transactionOwner{};

private:
    sqlite3* db = nullptr;
    ConnectionMutex lock;
    StatementCache cache;
};

}  // namespace sqlite
}  // namespace lumivale
