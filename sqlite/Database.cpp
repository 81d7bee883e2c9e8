#include "sqlite/Database.h"

#include <sqlite3.h>

#include "sqlite/Connection.h"
#include "sqlite/SQLiteException.h"

namespace lumivale {
namespace sqlite {

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

// Undoes the innermost open level. Errors are swallowed: this runs while an
// exception is already on its way, and that exception is the one to report.
void rollbackLevel(Connection& connection, int depth) {
    try {
        if (depth == 0) {
            if (!sqlite3_get_autocommit(connection.handle())) connection.exec("ROLLBACK");
        } else {
            connection.exec("ROLLBACK TO " + savepointName(depth));
            connection.exec("RELEASE " + savepointName(depth));
        }
    } catch (const SQLiteException&) {
    }
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
    std::lock_guard<std::recursive_mutex> lock(connection->mutex());
    connection->exec(sql);
}

Statement Database::prepare(const std::string& sql) {
    std::lock_guard<std::recursive_mutex> lock(connection->mutex());
    sqlite3_stmt* statement = nullptr;
    int rc = sqlite3_prepare_v2(connection->handle(), sql.c_str(), static_cast<int>(sql.size()), &statement,
                                nullptr);
    if (rc != SQLITE_OK) connection->fail(rc, "preparing: " + sql);
    return Statement(connection, statement);
}

void Database::runInTransaction(const std::function<void()>& fn, TransactionType type) {
    std::lock_guard<std::recursive_mutex> lock(connection->mutex());
    Connection& c = *connection;
    const int depth = c.transactionDepth;
    c.exec(depth == 0 ? std::string(beginSql(type)) : "SAVEPOINT " + savepointName(depth));
    c.transactionDepth = depth + 1;
    try {
        fn();
    } catch (...) {
        c.transactionDepth = depth;
        rollbackLevel(c, depth);
        throw;
    }
    c.transactionDepth = depth;
    try {
        c.exec(depth == 0 ? std::string("COMMIT") : "RELEASE " + savepointName(depth));
    } catch (const SQLiteException&) {
        rollbackLevel(c, depth);
        throw;
    }
}

}  // namespace sqlite
}  // namespace lumivale
