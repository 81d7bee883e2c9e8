// A prepared statement of a Database, and the column handle that reads its
// current row.
//
// Movable, not copyable; the destructor gives the compiled statement back to
// its connection's cache (reset, bindings cleared) for the next prepare of
// the same SQL, and a moved-from Statement owns nothing and gives nothing. Parameter indexes
// start at 1, column indexes at 0, as in SQLite.
//
// Threads: every call takes the connection's mutex, so statements of one
// Database may be used from several threads (one thread per statement at a
// time). A statement keeps its connection open even after the Database
// object that prepared it is gone.
//
// Errors: SQLite failures throw SQLiteException; so does using a moved-from
// statement.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

struct sqlite3_stmt;

namespace lumivale {
namespace sqlite {

class Connection;

class Statement {
public:
    // Names one column of the current row; valid only while that row is.
    class Column {
    public:
        int getInt() const;
        long long getInt64() const;
        // The 64 bits as bind(int, uint64_t) stored them.
        uint64_t getUint64() const;
        std::string getText() const;  // empty for NULL; may hold zero bytes
        // Copies the text into target, reusing its storage.
        void copyTextTo(std::string& target) const;
        // The text in place, valid until the statement is stepped, reset or
        // destroyed; empty for NULL.
        std::string_view getTextView() const;
        // The bytes in place, valid until the statement is stepped, reset or
        // destroyed. NULL and zero-length values give a count of 0.
        std::pair<const unsigned char*, std::size_t> getBlobDirectBuffer() const;

    private:
        friend class Statement;
        Column(const Statement& theStatement, int theIndex) : statement(theStatement), index(theIndex) {}
        const Statement& statement;
        int index;
    };

    // Steps the statement and reads the rows it finds holding the
    // connection's lock for its whole life, taken once, so that a row costs
    // no more than SQLite's own calls: the way to read many rows. Reads are
    // as Column's and valid while the row is. The statement must outlive it;
    // one thread uses it. The constructor throws SQLiteException for a
    // moved-from statement.
    class RowReader {
    public:
        explicit RowReader(Statement& statement);
        ~RowReader();
        RowReader(const RowReader&) = delete;
        RowReader& operator=(const RowReader&) = delete;

        bool step();  // as Statement::step
        int getInt(int column) const;
        std::string_view getTextView(int column) const;
        std::pair<const unsigned char*, std::size_t> getBlobDirectBuffer(int column) const;

    private:
        Statement& statement;
        sqlite3_stmt* handle;
    };

    Statement(Statement&& other) noexcept;
    Statement& operator=(Statement&& other) noexcept;
    ~Statement();
    Statement(const Statement&) = delete;
    Statement& operator=(const Statement&) = delete;

    void bind(int index, int value);
    void bind(int index, long long value);
    // Stored as SQLite's signed 64-bit integer, bit for bit: values above
    // INT64_MAX read back negative with getInt64, intact with getUint64.
    void bind(int index, uint64_t value);
    void bind(int index, const std::string& value);  // TEXT, copied at bind time
    // A BLOB of size bytes, copied at bind time. (nullptr, 0) binds an empty
    // blob, not NULL.
    void bindBlob(int index, const unsigned char* data, unsigned int size);
    // As bind and bindBlob, without the copy: SQLite reads the caller's
    // bytes, which must stay alive and unchanged until the statement is
    // reset or destroyed. For values written at once by one step.
    void bindWithoutCopy(int index, const std::string& value);
    void bindBlobWithoutCopy(int index, const unsigned char* data, unsigned int size);

    // True when a row is current; false once the statement has run to its
    // end, and on every further call until reset().
    bool step();
    void reset();

    Column operator()(int column) const { return Column(*this, column); }

private:
    friend class Database;
    Statement(std::shared_ptr<Connection> connection, sqlite3_stmt* statement);

    // lifetime is SQLite's destructor argument: SQLITE_TRANSIENT copies.
    void bindText(int index, const std::string& value, void (*lifetime)(void*));
    void bindBytes(int index, const unsigned char* data, unsigned int size, void (*lifetime)(void*));
    sqlite3_stmt* checkedHandle(const char* action) const;
    // step's work, with the connection's lock already held.
    bool stepLocked(sqlite3_stmt* handle);
    [[noreturn]] void fail(int code, const char* action) const;
    void finalize() noexcept;

    std::shared_ptr<Connection> connection;
    sqlite3_stmt* statement = nullptr;
    bool finished = false;
};

}  // namespace sqlite
}  // namespace lumivale
