// One SQLite connection, shared by every storage class of a store.
//
// Threads: every operation may be called from any thread. All calls on the
// connection, including those of the Statements prepared from it, are
// serialised by one recursive mutex. runInTransaction holds that mutex from
// BEGIN to COMMIT, so a statement that another thread issues meanwhile waits
// until the transaction has ended: it is neither rolled back with it nor
// committed early. On the thread that owns the transaction, statements and
// nested runInTransaction calls go straight through; a nested call is a
// savepoint, so its failure undoes only its own writes.
//
// A function run inside runInTransaction must not wait for another thread
// that uses this database: that thread cannot get in until the transaction
// ends.
//
// Errors: every failure of SQLite throws SQLiteException.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "platform/ThreadAnnotations.h"
#include "sqlite/Statement.h"

namespace lumivale {
namespace sqlite {

class Connection;

// sqlite3_open_v2's flags, named for code that does not include sqlite3.h.
constexpr int kOpenReadOnly = 0x1;
constexpr int kOpenReadWrite = 0x2;
constexpr int kOpenCreate = 0x4;
constexpr int kOpenReadWriteCreate = kOpenReadWrite | kOpenCreate;

// A capability for the thread-safety analysis: the connection's lock, as
// Database::ScopedLock holds it.
class TS_CAPABILITY("mutex") Database {
public:
    // How a transaction takes its locks. The store always uses Immediate (2):
    // it takes the write lock at BEGIN, so a transaction that has started can
    // never fail half-way through on the upgrade from a read to a write lock
    // (a deferred transaction can, and in WAL mode such a busy error is not
    // even retried by the busy timeout). Exclusive would also keep readers of
    // other connections out, which the store does not need.
    enum class TransactionType { Deferred = 1, Immediate = 2, Exclusive = 3 };

    // Keeps other threads off the connection for as long as it lives, so that
    // a run of calls from this thread (reading many rows, each column a call)
    // takes the connection's lock once instead of once per call; this
    // thread's calls go straight through meanwhile. Not a transaction:
    // nothing is begun, committed or rolled back. The rule for transactions
    // holds here too: do not wait for another thread that uses this database
    // while holding it. Not copyable or movable; one thread.
    class TS_SCOPED_CAPABILITY ScopedLock {
    public:
        explicit ScopedLock(Database& database) TS_ACQUIRE(database) TS_NO_THREAD_SAFETY_ANALYSIS;
        ~ScopedLock() TS_RELEASE() TS_NO_THREAD_SAFETY_ANALYSIS;
        ScopedLock(const ScopedLock&) = delete;
        ScopedLock& operator=(const ScopedLock&) = delete;

    private:
        std::shared_ptr<Connection> connection;
    };

    // flags are sqlite3_open_v2's (the store passes kOpenReadWriteCreate).
    // "" and ":memory:" keep SQLite's meaning.
    Database(const std::string& path, int flags);
    ~Database();
    Database(const Database&) = delete;
    Database& operator=(const Database&) = delete;

    // Runs one SQL statement to completion; rows it returns are discarded.
    void exec(const std::string& sql);

    // True when SQLite opened the main database for reading only, which it
    // does without an error when a read-write open meets a file that cannot
    // be written.
    bool isReadOnly() const;

    // True when the calling thread is inside runInTransaction on this
    // database. Never waits for the connection's lock.
    bool isInTransactionOnThisThread() const;

    // How many statements this connection has compiled; one taken from the
    // cache of idle statements is not counted. For tests and benchmarks.
    uint64_t compiledStatementCount() const;

    // The rowid of the last row this connection inserted. Meaningful only
    // inside the transaction that did the insert, which keeps other threads
    // from inserting in between.
    long long lastInsertRowId() const;

    // One statement with ? placeholders: an idle one compiled earlier from
    // the same text if the connection's cache holds one, else compiled now.
    // Text without a statement, or with anything but blanks, comments and
    // semicolons after the first one, throws instead of being cut silently.
    Statement prepare(const std::string& sql);

    // Begins a transaction of the given type, runs fn and commits. If fn
    // throws, everything fn wrote is rolled back and the exception continues
    // unchanged. If the commit itself fails, the transaction is rolled back
    // and SQLiteException is thrown.
    void runInTransaction(const std::function<void()>& fn, TransactionType type);

private:
    std::shared_ptr<Connection> connection;
};

}  // namespace sqlite
}  // namespace lumivale
