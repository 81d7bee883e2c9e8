#include <gtest/gtest.h>

#include <chrono>
#include <regex>

#include "TestSupport.h"
#include "sqlite/Database.h"
#include "tessarine/LibraryMetadata.h"
#include "tessarine/Tessarine.h"

using lumivale::sqlite::kOpenReadWriteCreate;

using lumivale::tessarine::LibraryMetadata;
using lumivale::tessarine::LibraryMetadataStorage;
using lumivale::tessarine::Tessarine;

namespace {

class FixedRandomMetadata : public LibraryMetadata {
public:
    using LibraryMetadata::LibraryMetadata;
    uint32_t generateRandom32() override { return values[next++ % 3]; }

private:
    uint32_t values[3] = {0, 1, 255};
    int next = 0;
};

std::shared_ptr<LibraryMetadata> open(const std::string& path) {
    auto db = Tessarine::createSqliteDatabase(path, {});
    return std::make_shared<LibraryMetadata>(std::make_shared<LibraryMetadataStorage>(db));
}

}  // namespace

TEST(LibraryMetadataTest, FreshDatabaseGetsTimestampedIdThatReopeningKeeps) {
    testsupport::TempDir dir;
    auto before = std::chrono::duration_cast<std::chrono::seconds>(
        std::chrono::system_clock::now().time_since_epoch()).count();
    std::string id = open(dir.file("a.db"))->getClientUuid();
    auto after = std::chrono::duration_cast<std::chrono::seconds>(
        std::chrono::system_clock::now().time_since_epoch()).count();

    EXPECT_TRUE(std::regex_match(id, std::regex("[0-9A-F]{32}"))) << id;
    long long stamp = std::stoll(id.substr(0, 8), nullptr, 16);
    EXPECT_GE(stamp, before & 0xFFFFFFFF);
    EXPECT_LE(stamp, after & 0xFFFFFFFF);

    auto reopened = open(dir.file("a.db"));
    EXPECT_EQ(id, reopened->getClientUuid());
    EXPECT_EQ(1u, reopened->getVersion());
    EXPECT_FALSE(reopened->needsUpdate());
    EXPECT_NE(id, open(dir.file("b.db"))->getClientUuid());
}

TEST(LibraryMetadataTest, StoredVersionDecidesUpdateAndExistingRowsAreNeverReplaced) {
    auto db = std::make_shared<lumivale::sqlite::Database>(":memory:", kOpenReadWriteCreate);
    auto storage = std::make_shared<LibraryMetadataStorage>(db);
    try {
        storage->getString("version");
        FAIL() << "missing key was found";
    } catch (const LibraryMetadataStorage::KeyNotFoundError& e) {
        EXPECT_STREQ("Key not found: \"version\"", e.what());
    }
    storage->setString("version", "0");
    storage->setString("client_id", "GIVEN");
    LibraryMetadata metadata(storage);
    EXPECT_EQ("GIVEN", metadata.getClientUuid());
    EXPECT_EQ(0u, metadata.getVersion());
    EXPECT_TRUE(metadata.needsUpdate());
    storage->setInt64("version", 1);
    EXPECT_FALSE(metadata.needsUpdate());
    storage->setString("version", "  42abc");
    EXPECT_EQ(42, storage->getInt64("version"));
    // The random fields of a new id: padded hex of the draws.
    EXPECT_EQ("0000000000000001000000FF", FixedRandomMetadata(storage).generateClientUuid().substr(8));
}
