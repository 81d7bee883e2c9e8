#include "sqlite/Database.h"

#include <sqlite3.h>

#include <thread>

#include "sqlite/Connection.h"
#include "sqlite/SQLiteException.h"

namespace lumivale {
namespace sqlite {

static_assert(kOpenReadOnly == SQLITE_OPEN_READONLY && kOpenReadWrite == SQLITE_OPEN_READWRITE &&
                  kOpenCreate == SQLITE_OPEN_CREATE,
              "the named open flags are sqlite3.h's");
static_assert(kErrorReadOnly == SQLITE_READONLY, "the named result code is sqlite3.h's");

namespace {

const char* beginSql(Database::TransactionType type) {
    switch (type) {
        case Database::TransactionType::Deferred: return "BEGIN DEFERRED";
        case Database::TransactionType::Exclusive: return "BEGIN EXCLUSIVE";
        case Database::TransactionType::Immediate: break;
    }
    return "BEGIN IMMEDIATE";
}

std::string savepointName(int depth) { return "tessarine_nested_" + std::to_string(depth); }

// One open level of a transaction, for as long as it lives: counted in the
// connection's depth and, for the outermost level, the calling thread marked
// as the owner.
class OpenLevel {
public:
    OpenLevel(Connection& theConnection, int theDepth) : connection(theConnection), depth(theDepth) {
        theConnection.transactionDepth = theDepth + 1;
        if (theDepth == 0) theConnection.transactionOwner = std::this_thread::get_id();
    }
    ~OpenLevel() {
        connection.transactionDepth = depth;
        if (depth == 0) connection.transactionOwner = std::thread::id();
    }
    OpenLevel(const OpenLevel&) = delete;
    OpenLevel& operator=(const OpenLevel&) = delete;

private:
    Connection& connection;
    int depth;
};

// Undoes the innermost open level. Errors are swallowed: this runs while an
// exception is already on its way, and that exception is the one to report.
void rollbackLevel(Connection& connection, int depth) {
    try {
        if (depth == 0) {
            if (!sqlite3_get_autocommit(connection.handle())) connection.execCached("ROLLBACK");
        } else {
            connection.execCached("ROLLBACK TO " + savepointName(depth));
            connection.execCached("RELEASE " + savepointName(depth));
        }
    } catch (const SQLiteException&) {
    }
}

// True when text, what follows the first statement of a prepared string,
// holds more than blanks, comments and semicolons.
bool holdsAnotherStatement(sqlite3* handle, const char* text, const char* end) {
    while (text != nullptr && text < end) {
        sqlite3_stmt* extra = nullptr;
        const char* next = nullptr;
        int rc = sqlite3_prepare_v2(handle, text, static_cast<int>(end - text), &extra, &next);
        sqlite3_finalize(extra);
        if (rc != SQLITE_OK || extra != nullptr) return true;
        if (next == nullptr || next <= text) return false;
        text = next;
    }
    return false;
}

}  // namespace

Database::Database(const std::string& path, int flags)
    : connection(std::make_shared<Connection>(path, flags)) {}

Database::~Database() = default;

Database::ScopedLock::ScopedLock(Database& database) : connection(database.connection) {
    connection->mutex().lock();
}

Database::ScopedLock::~ScopedLock() { connection->mutex().unlock(); }

void Database::exec(const std::string& sql) {
    ConnectionLock lock(connection->mutex());
    connection->exec(sql);
}

bool Database::isReadOnly() const {
    ConnectionLock lock(connection->mutex());
    return sqlite3_db_readonly(connection->handle(), "main") == 1;
}

bool Database::isInTransactionOnThisThread() const {
    return connection->transactionOwner.load() == std::this_thread::get_id();
}

uint64_t Database::compiledStatementCount() const {
    ConnectionLock lock(connection->mutex());
    return connection->compiledCount;
}

long long Database::lastInsertRowId() const {
    ConnectionLock lock(connection->mutex());
    return sqlite3_last_insert_rowid(connection->handle());
}

Statement Database::prepare(const std::string& sql) {
    ConnectionLock lock(connection->mutex());
    if (sqlite3_stmt* cached = connection->statements().take(sql)) return Statement(connection, cached);
    sqlite3_stmt* statement = nullptr;
    const char* tail = nullptr;
    int rc = sqlite3_prepare_v2(connection->handle(), sql.c_str(), static_cast<int>(sql.size()), &statement, &tail);
    if (rc != SQLITE_OK) connection->fail(rc, "preparing: " + sql);
    ++connection->compiledCount;
    Statement prepared(connection, statement);
    // SQLite compiles the first statement and silently ignores the rest of
    // the text. Text meant as one statement (an application's index
    // subquery is spliced into one) must not lose a part unnoticed.
    if (statement == nullptr) throw SQLiteException(SQLITE_ERROR, "no statement in the text", "preparing: " + sql);
    if (holdsAnotherStatement(connection->handle(), tail, sql.c_str() + sql.size())) {
        throw SQLiteException(SQLITE_ERROR, "more than one statement in the text", "preparing: " + sql);
    }
    return prepared;
}

void Database::runInTransaction(const std::function<void()>& fn, TransactionType type) {
    ConnectionLock lock(connection->mutex());
    Connection& c = *connection;
    const int depth = c.transactionDepth;
    c.execCached(depth == 0 ? std::string(beginSql(type)) : "SAVEPOINT " + savepointName(depth));
    OpenLevel level(c, depth);
    try {
        fn();
    } catch (...) {
        rollbackLevel(c, depth);
        throw;
    }
    try {
        c.execCached(depth == 0 ? std::string("COMMIT") : "RELEASE " + savepointName(depth));
    } catch (const SQLiteException&) {
        rollbackLevel(c, depth);
        throw;
    }
}

}  // namespace sqlite
}  // namespace lumivale
