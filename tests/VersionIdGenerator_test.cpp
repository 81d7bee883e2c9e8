#include <gtest/gtest.h>

#include <memory>
#include <stdexcept>
#include <string>

#include "TestSupport.h"
#include "sqlite/Database.h"
#include "tessarine/VersionIdGenerator.h"

using lumivale::sqlite::kOpenReadWriteCreate;
using lumivale::sqlite::Database;
using lumivale::tessarine::VersionIdGenerator;

namespace {

// Fails the read that follows the increment while failRead is set.
class FailingReadGenerator : public VersionIdGenerator {
public:
    using VersionIdGenerator::VersionIdGenerator;
    bool failRead = false;
    uint64_t queryVersionId(const std::string& collectionName) override {
        if (failRead) throw std::runtime_error("read failed");
        return VersionIdGenerator::queryVersionId(collectionName);
    }
};

class VersionIdGeneratorTest : public ::testing::Test {
protected:
    void reopen() {
        generator.reset();
        db = std::make_shared<Database>(dir.file("versions.db"), kOpenReadWriteCreate);
        generator = std::make_unique<FailingReadGenerator>(db);
    }

    long long rowCount() {
        auto statement = db->prepare("SELECT COUNT(*) FROM collection_version_ids");
        statement.step();
        return statement(0).getInt64();
    }

    testsupport::TempDir dir;
    std::shared_ptr<Database> db = std::make_shared<Database>(dir.file("versions.db"), kOpenReadWriteCreate);
    std::unique_ptr<FailingReadGenerator> generator = std::make_unique<FailingReadGenerator>(db);
};

TEST_F(VersionIdGeneratorTest, CountersAreIndependentCaseSensitiveSurviveReopeningAndNeedTheirRow) {
    for (const char* name : {"a:b", "a:c", "A:b"}) generator->initializeVersionId(name);
    EXPECT_EQ(1u, generator->incrementAndGetVersionId("a:b"));
    EXPECT_EQ(2u, generator->incrementAndGetVersionId("a:b"));
    EXPECT_EQ(1u, generator->incrementAndGetVersionId("a:c"));
    EXPECT_EQ(3u, generator->incrementAndGetVersionId("a:b"));
    EXPECT_EQ(1u, generator->incrementAndGetVersionId("A:b"));
    // Past 32 bits, also on 32-bit ABIs, and kept so across reopening.
    db->exec("UPDATE collection_version_ids SET version_id = 4294967295 WHERE collection_name = 'A:b'");
    EXPECT_EQ(0x100000000u, generator->incrementAndGetVersionId("A:b"));
    reopen();
    generator->initializeVersionId("a:b");  // reopening the collection keeps its counter
    EXPECT_EQ(4u, generator->incrementAndGetVersionId("a:b"));
    EXPECT_EQ(2u, generator->incrementAndGetVersionId("a:c"));
    EXPECT_EQ(0x100000000u, generator->queryVersionId("A:b"));
    EXPECT_EQ(0x100000001u, generator->incrementAndGetVersionId("A:b"));
    // A collection never initialised has no counter: 0, and no row is made.
    EXPECT_EQ(0u, generator->queryVersionId("never:opened"));
    EXPECT_EQ(0u, generator->incrementAndGetVersionId("never:opened"));
    EXPECT_EQ(3, rowCount());
}

// A failure after the increment must roll it back, or an id would be used up
// that nobody received.
TEST_F(VersionIdGeneratorTest, FailureBetweenIncrementAndReadLeavesCounterUnchanged) {
    generator->initializeVersionId("a:b");
    EXPECT_EQ(1u, generator->incrementAndGetVersionId("a:b"));
    generator->failRead = true;
    EXPECT_THROW(generator->incrementAndGetVersionId("a:b"), std::runtime_error);
    generator->failRead = false;
    EXPECT_EQ(1u, generator->queryVersionId("a:b"));
    EXPECT_EQ(2u, generator->incrementAndGetVersionId("a:b"));
}

}  // namespace
