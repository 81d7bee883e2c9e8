// A forward-only reader over the rows of one object query.
//
// Every object query of the store hands out a Cursor that owns one prepared,
// bound and not yet stepped statement and knows which result column holds
// each of the four object fields. Call step() until it returns false and read
// the fields after each true result; close() or destroy the cursor when done.
//
// - step() after the end keeps returning false. A database error during
//   step() is logged at priority 5 and reported as false, and it clears the
//   current row (the row an accessor would read is no longer reliable).
// - step() after close() returns false and touches nothing.
// - Reading a field without a current row (before the first step, after a
//   false step, after close) is a programming error: it fails an assertion
//   through lumivale::assertInternal, which aborts the process.
// - getBlob() points into the current row: the bytes stay valid only until
//   the next step(), close() or destruction; copy them to keep them.
//
// Threads: one thread at a time per cursor. The cursor holds a statement of
// the store's shared connection until it is closed or destroyed.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "sqlite/Statement.h"

namespace lumivale {
namespace tessarine {

class Cursor {
public:
    Cursor(lumivale::sqlite::Statement&& statement, int primaryKeyColumn, int sortKeyColumn, int blobColumn,
           int statusColumn) noexcept;
    Cursor(const Cursor&) = delete;
    Cursor& operator=(const Cursor&) = delete;

    // True when a row is current.
    bool step() noexcept;
    // Releases the statement now, before the cursor itself goes.
    void close() noexcept;

    std::string getPrimaryKey() const noexcept;
    std::string getSortKey() const noexcept;
    // The blob's first byte and byte count, not copied; a NULL or empty blob
    // gives a count of 0.
    std::pair<const unsigned char*, std::size_t> getBlob() const noexcept;
    // The object's CollectionStorage::ObjectStatus as stored.
    int getStatus() const noexcept;

private:
    void checkCurrentRow() const noexcept;
    // Reads the current row's columns under the reader's lock.
    void readRow(const lumivale::sqlite::Statement::RowReader& reader);

    // Held in place rather than on the heap, so that the constructor cannot
    // fail; empty once the cursor is closed.
    std::optional<lumivale::sqlite::Statement> statement;
    bool hasCurrentRow = false;
    // The current row, read under the same lock as the step that found it,
    // so that the getters take no lock. Texts and blob point into the
    // statement and stay valid until the next step.
    std::string_view primaryKey;
    std::string_view sortKey;
    std::pair<const unsigned char*, std::size_t> blob{nullptr, 0};
    int status = 0;
    int primaryKeyColumn;
    int sortKeyColumn;
    int blobColumn;
    int statusColumn;
};

}  // namespace tessarine
}  // namespace lumivale
