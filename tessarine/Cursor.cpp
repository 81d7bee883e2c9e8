#include "tessarine/Cursor.h"

#include "platform/Assert.h"
#include "platform/Log.h"
#include "sqlite/SQLiteException.h"

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
        hasCurrentRow = statement->step();
    } catch (const lumivale::sqlite::SQLiteException& e) {
        hasCurrentRow = false;
        lv_printLog(LogPriority::kWarn, "tessarine", "Cursor::step failed: %s", e.what());
    }
    return hasCurrentRow;
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
    return (*statement)(primaryKeyColumn).getText();
}

std::string Cursor::getSortKey() const noexcept {
    checkCurrentRow();
    return (*statement)(sortKeyColumn).getText();
}

std::pair<const unsigned char*, std::size_t> Cursor::getBlob() const noexcept {
    checkCurrentRow();
    return (*statement)(blobColumn).getBlobDirectBuffer();
}

int Cursor::getStatus() const noexcept {
    checkCurrentRow();
    return (*statement)(statusColumn).getInt();
}

}  // namespace tessarine
}  // namespace lumivale
