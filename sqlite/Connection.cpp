#include "sqlite/Connection.h"

#include <sqlite3.h>

#include "sqlite/SQLiteException.h"

namespace lumivale {
namespace sqlite {

namespace {
// The layer serialises every call itself, so SQLite's own per-connection
// mutex would only be taken a second time; keep it unless the caller asked.
int withThreadingMode(int flags) {
    if (flags & SQLITE_OPEN_FULLMUTEX) return flags;
    return flags | SQLITE_OPEN_NOMUTEX;
}
}  // namespace

Connection::Connection(const std::string& path, int flags) {
    int rc = sqlite3_open_v2(path.c_str(), &db, withThreadingMode(flags), nullptr);
    if (rc != SQLITE_OK) {
        std::string message = db ? sqlite3_errmsg(db) : sqlite3_errstr(rc);
        sqlite3_close(db);
        db = nullptr;
        throw SQLiteException(rc, message, "opening database \"" + path + "\"");
    }
    sqlite3_extended_result_codes(db, 1);
}

Connection::~Connection() {
    cache.clear();
    sqlite3_close_v2(db);
}

void Connection::fail(int code, const std::string& context) const {
    throw SQLiteException(code, sqlite3_errmsg(db), context);
}

void Connection::exec(const std::string& sql) {
    int rc = sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr);
    if (rc != SQLITE_OK) fail(rc, "executing: " + sql);
}

void Connection::execCached(const std::string& sql) {
    sqlite3_stmt* statement = cache.take(sql);
    if (statement == nullptr) {
        int rc = sqlite3_prepare_v2(db, sql.c_str(), static_cast<int>(sql.size()), &statement, nullptr);
        if (rc != SQLITE_OK) fail(rc, "executing: " + sql);
        ++compiledCount;
        if (statement == nullptr) return;  // no statement in the text
    }
    int rc = sqlite3_step(statement);
    if (rc == SQLITE_DONE || rc == SQLITE_ROW) {
        cache.give(statement);
        return;
    }
    // The message must be read before give() resets the statement.
    try {
        fail(rc, "executing: " + sql);
    } catch (...) {
        cache.give(statement);
        throw;
    }
}

}  // namespace sqlite
}  // namespace lumivale
