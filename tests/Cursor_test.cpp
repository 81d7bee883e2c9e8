#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "TestSupport.h"
#include "sqlite/Database.h"
#include "tessarine/Cursor.h"

using lumivale::sqlite::kOpenReadWriteCreate;
using lumivale::sqlite::Database;
using lumivale::tessarine::Cursor;

namespace {

const char* const kNoRow =
    "Assert \\(Cursor:[0-9]+\\): There's no current row\\. Did you forget to call step\\(\\)\\?";

class CursorTest : public ::testing::Test {
protected:
    // Columns in the order status, blob, sort key, primary key, so that a
    // cursor reading by position would be caught.
    std::unique_ptr<Cursor> twoRows() {
        return std::make_unique<Cursor>(
            db->prepare("SELECT 2, x'610062', 'sk1', 'pk1' UNION ALL SELECT 3, NULL, 'sk2', 'pk2'"), 3, 2, 1, 0);
    }
    // abs() overflows on the second row, so the second step fails.
    std::unique_ptr<Cursor> failingOnSecondRow() {
        return std::make_unique<Cursor>(db->prepare("WITH t(n) AS (VALUES (1), (-9223372036854775807 - 1)) "
                                                     "SELECT 'pk', 'sk', x'00', abs(n) FROM t"),
                                        0, 1, 2, 3);
    }

    testsupport::TempDir dir;
    std::shared_ptr<Database> db = std::make_shared<Database>(dir.file("cursor.db"), kOpenReadWriteCreate);
};

TEST_F(CursorTest, ReadsFieldsFromTheirColumnsRepeatedlyAndKeepsReportingTheEndOrAnError) {
    testsupport::LogCapture log;
    auto cursor = twoRows();
    ASSERT_TRUE(cursor->step());
    for (int read = 0; read < 2; ++read) {
        EXPECT_EQ("pk1", cursor->getPrimaryKey());
        EXPECT_EQ("sk1", cursor->getSortKey());
        auto blob = cursor->getBlob();
        EXPECT_EQ(std::string("a\0b", 3), std::string(reinterpret_cast<const char*>(blob.first), blob.second));
        EXPECT_EQ(2, cursor->getStatus());
    }
    ASSERT_TRUE(cursor->step());
    EXPECT_EQ(0u, cursor->getBlob().second);  // NULL blob
    EXPECT_FALSE(cursor->step());
    EXPECT_FALSE(cursor->step());  // a finished statement is not restarted
    cursor->close();
    EXPECT_FALSE(cursor->step());  // no statement left: defined answer, nothing touched
    cursor->close();
    EXPECT_TRUE(log.lines().empty());  // no step failed on the way

    cursor = failingOnSecondRow();
    ASSERT_TRUE(cursor->step());
    EXPECT_FALSE(cursor->step());  // a database error ends the rows, with a warning
    ASSERT_EQ(1u, log.lines().size());
    EXPECT_EQ(5, log.lines()[0].priority);
    EXPECT_EQ(0u, log.lines()[0].message.find("Cursor::step failed: integer overflow"));
}

using CursorDeathTest = CursorTest;

// Every state without a row shares this one check; a failed step is the
// state that has to clear a row that was current.
TEST_F(CursorDeathTest, ReadingAfterAFailedStepAssertsInsteadOfReadingAStaleRow) {
    auto cursor = failingOnSecondRow();
    ASSERT_TRUE(cursor->step());
    EXPECT_FALSE(cursor->step());
    EXPECT_DEATH(cursor->getStatus(), kNoRow);
}

}  // namespace
