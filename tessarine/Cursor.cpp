#include "tessarine/Cursor.h"

#include <exception>

#include "platform/Assert.h"
#include "platform/Log.h"
#include "tessarine/StoreLog.h"

namespace lumivale {
namespace tessarine {

Cursor::Cursor(lumivale::sqlite::Statement&& theStatement, int thePrimaryKeyColumn, int theSortKeyColumn,
               int theBlobColumn, int theStatusColumn) noexcept
    : statement(std::move(theStatement)),
      primaryKeyColumn(thePrimaryKeyColumn),
      sortKeyColumn(theSortKeyColumn),
      blobColumn(theBlobColumn),
      statusColumn(theStatusColumn) {}

bool Cursor::step() noexcept {
    if (!statement) return false;
    try {
        lumivale::sqlite::Statement::RowReader reader(*statement);
        hasCurrentRow = reader.step();
        if (hasCurrentRow) readRow(reader);
    } catch (const std::exception& e) {
        hasCurrentRow = false;
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "Cursor::step failed: %s", e.what());
    }
    return hasCurrentRow;
}

void Cursor::readRow(const lumivale::sqlite::Statement::RowReader& reader) {
    primaryKey = reader.getTextView(primaryKeyColumn);
    sortKey = reader.getTextView(sortKeyColumn);
    blob = reader.getBlobDirectBuffer(blobColumn);
    status = reader.getInt(statusColumn);
}

void Cursor::close() noexcept {
    hasCurrentRow = false;
    statement.reset();
}

void Cursor::checkCurrentRow() const noexcept {
    if (!hasCurrentRow) {
        LV_ASSERT_FAIL("Cursor", "There's no current row. Did you forget to call step()?");
    }
}

std::string Cursor::getPrimaryKey() const noexcept {
    checkCurrentRow();
    return std::string(primaryKey);
}

std::string Cursor::getSortKey() const noexcept {
    checkCurrentRow();
    return std::string(sortKey);
}

std::pair<const unsigned char*, std::size_t> Cursor::getBlob() const noexcept {
    checkCurrentRow();
    return blob;
}

int Cursor::getStatus() const noexcept {
    checkCurrentRow();
    return status;
}

}  // namespace tessarine
}  // namespace lumivale
