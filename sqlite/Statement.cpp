#include "sqlite/Statement.h"

#include <sqlite3.h>

#include "sqlite/Connection.h"
#include "sqlite/SQLiteException.h"

namespace lumivale {
namespace sqlite {

namespace {
using Lock = ConnectionLock;

// The column readers Column and RowReader share; the lock is the caller's.
std::string_view textIn(sqlite3_stmt* s, int index) {
    const unsigned char* text = sqlite3_column_text(s, index);
    if (text == nullptr) return std::string_view();
    return std::string_view(reinterpret_cast<const char*>(text), static_cast<size_t>(sqlite3_column_bytes(s, index)));
}

std::pair<const unsigned char*, std::size_t> blobIn(sqlite3_stmt* s, int index) {
    const void* blob = sqlite3_column_blob(s, index);
    std::size_t size = static_cast<std::size_t>(sqlite3_column_bytes(s, index));
    return {static_cast<const unsigned char*>(blob), blob == nullptr ? 0 : size};
}
}  // namespace

Statement::Statement(std::shared_ptr<Connection> theConnection, sqlite3_stmt* theStatement)
    : connection(std::move(theConnection)), statement(theStatement) {}

Statement::RowReader::RowReader(Statement& theStatement)
    : statement(theStatement), handle(theStatement.checkedHandle("stepping")) {
    statement.connection->mutex().lock();
}

Statement::RowReader::~RowReader() { statement.connection->mutex().unlock(); }

bool Statement::RowReader::step() { return statement.stepLocked(handle); }

int Statement::RowReader::getInt(int column) const { return sqlite3_column_int(handle, column); }

std::string_view Statement::RowReader::getTextView(int column) const { return textIn(handle, column); }

std::pair<const unsigned char*, std::size_t> Statement::RowReader::getBlobDirectBuffer(int column) const {
    return blobIn(handle, column);
}

Statement::Statement(Statement&& other) noexcept
    : connection(std::move(other.connection)), statement(other.statement), finished(other.finished) {
    other.statement = nullptr;
}

Statement& Statement::operator=(Statement&& other) noexcept {
    if (this != &other) {
        finalize();
        connection = std::move(other.connection);
        statement = other.statement;
        finished = other.finished;
        other.statement = nullptr;
    }
    return *this;
}

Statement::~Statement() { finalize(); }

void Statement::finalize() noexcept {
    if (statement == nullptr) return;
    Lock lock(connection->mutex());
    connection->statements().give(statement);
    statement = nullptr;
}

sqlite3_stmt* Statement::checkedHandle(const char* action) const {
    if (statement == nullptr) {
        throw SQLiteException(SQLITE_MISUSE, "statement has been moved from", action);
    }
    return statement;
}

void Statement::fail(int code, const char* action) const {
    const char* sql = sqlite3_sql(statement);
    connection->fail(code, std::string(action) + ": " + (sql ? sql : ""));
}

void Statement::bind(int index, int value) {
    sqlite3_stmt* s = checkedHandle("binding");
    Lock lock(connection->mutex());
    int rc = sqlite3_bind_int(s, index, value);
    if (rc != SQLITE_OK) fail(rc, "binding");
}

void Statement::bind(int index, long long value) {
    sqlite3_stmt* s = checkedHandle("binding");
    Lock lock(connection->mutex());
    int rc = sqlite3_bind_int64(s, index, static_cast<sqlite3_int64>(value));
    if (rc != SQLITE_OK) fail(rc, "binding");
}

void Statement::bind(int index, uint64_t value) { bind(index, static_cast<long long>(value)); }

void Statement::bind(int index, const std::string& value) { bindText(index, value, SQLITE_TRANSIENT); }

void Statement::bindWithoutCopy(int index, const std::string& value) { bindText(index, value, SQLITE_STATIC); }

void Statement::bindBlob(int index, const unsigned char* data, unsigned int size) {
    bindBytes(index, data, size, SQLITE_TRANSIENT);
}

void Statement::bindBlobWithoutCopy(int index, const unsigned char* data, unsigned int size) {
    bindBytes(index, data, size, SQLITE_STATIC);
}

void Statement::bindText(int index, const std::string& value, void (*lifetime)(void*)) {
    sqlite3_stmt* s = checkedHandle("binding");
    Lock lock(connection->mutex());
    int rc = sqlite3_bind_text64(s, index, value.data(), value.size(), lifetime, SQLITE_UTF8);
    if (rc != SQLITE_OK) fail(rc, "binding");
}

void Statement::bindBytes(int index, const unsigned char* data, unsigned int size, void (*lifetime)(void*)) {
    sqlite3_stmt* s = checkedHandle("binding");
    if (data == nullptr && size != 0) {
        throw SQLiteException(SQLITE_MISUSE, "blob of " + std::to_string(size) + " bytes without data",
                              "binding");
    }
    Lock lock(connection->mutex());
    // sqlite3_bind_blob turns a null pointer into NULL; an empty payload is
    // stored as an empty blob instead.
    int rc = size == 0 ? sqlite3_bind_zeroblob(s, index, 0) : sqlite3_bind_blob64(s, index, data, size, lifetime);
    if (rc != SQLITE_OK) fail(rc, "binding");
}

bool Statement::step() {
    sqlite3_stmt* s = checkedHandle("stepping");
    Lock lock(connection->mutex());
    return stepLocked(s);
}

bool Statement::stepLocked(sqlite3_stmt* s) {
    // SQLite would silently restart a finished statement; a reader that steps
    // past the end must keep seeing the end instead.
    if (finished) return false;
    int rc = sqlite3_step(s);
    if (rc == SQLITE_ROW) return true;
    if (rc == SQLITE_DONE) {
        finished = true;
        return false;
    }
    fail(rc, "stepping");
}

void Statement::reset() {
    sqlite3_stmt* s = checkedHandle("resetting");
    Lock lock(connection->mutex());
    // The result repeats the last step's error, which step already reported.
    sqlite3_reset(s);
    finished = false;
}

int Statement::Column::getInt() const {
    sqlite3_stmt* s = statement.checkedHandle("reading a column");
    Lock lock(statement.connection->mutex());
    return sqlite3_column_int(s, index);
}

long long Statement::Column::getInt64() const {
    sqlite3_stmt* s = statement.checkedHandle("reading a column");
    Lock lock(statement.connection->mutex());
    return sqlite3_column_int64(s, index);
}

uint64_t Statement::Column::getUint64() const { return static_cast<uint64_t>(getInt64()); }

std::string Statement::Column::getText() const {
    sqlite3_stmt* s = statement.checkedHandle("reading a column");
    Lock lock(statement.connection->mutex());
    return std::string(textIn(s, index));
}

void Statement::Column::copyTextTo(std::string& target) const {
    sqlite3_stmt* s = statement.checkedHandle("reading a column");
    Lock lock(statement.connection->mutex());
    target.assign(textIn(s, index));
}

std::string_view Statement::Column::getTextView() const {
    sqlite3_stmt* s = statement.checkedHandle("reading a column");
    Lock lock(statement.connection->mutex());
    return textIn(s, index);
}

std::pair<const unsigned char*, std::size_t> Statement::Column::getBlobDirectBuffer() const {
    sqlite3_stmt* s = statement.checkedHandle("reading a column");
    Lock lock(statement.connection->mutex());
    return blobIn(s, index);
}

}  // namespace sqlite
}  // namespace lumivale
