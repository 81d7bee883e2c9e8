// Version ids and sequence numbers are 64-bit on every ABI. These cases fail
// where such a value passes through a 32-bit type on its way (long or size_t
// on 32-bit ARM, armeabi-v7a), which the armhf configuration of
// scripts/test.sh builds and runs.
#include <gtest/gtest.h>

#include <cstdint>
#include <memory>

#include "TestSupport.h"
#include "sqlite/Database.h"
#include "tessarine/Protocol.h"
#include "tessarine/VersionIdGenerator.h"

using lumivale::sqlite::Database;
using lumivale::sqlite::kOpenReadWriteCreate;
using lumivale::tessarine::SyncProtocol;
using lumivale::tessarine::VersionIdGenerator;
namespace protocol = lumivale::tessarine::protocol;

namespace {

constexpr uint64_t k32BitsFull = 0xFFFFFFFFull;

TEST(WideCountersTest, VersionIdCounterCountsPast32BitsAndKeepsThatAcrossReopen) {
    testsupport::TempDir dir;
    {
        auto database = std::make_shared<Database>(dir.file("store.db"), kOpenReadWriteCreate);
        VersionIdGenerator generator(database);
        generator.initializeVersionId("a:b");
        database->exec("UPDATE collection_version_ids SET version_id = 4294967295 WHERE collection_name = 'a:b'");
        EXPECT_EQ(k32BitsFull + 1, generator.incrementAndGetVersionId("a:b"));
    }
    auto database = std::make_shared<Database>(dir.file("store.db"), kOpenReadWriteCreate);
    VersionIdGenerator generator(database);
    EXPECT_EQ(k32BitsFull + 1, generator.queryVersionId("a:b"));
    EXPECT_EQ(k32BitsFull + 2, generator.incrementAndGetVersionId("a:b"));
}

TEST(WideCountersTest, VersionIdsAndSequenceNumbersPast32BitsCrossTheWireExactly) {
    for (uint64_t value : {k32BitsFull + 1, (k32BitsFull << 16) + 7, (uint64_t{1} << 63) + 1, UINT64_MAX}) {
        SyncProtocol::Delta delta;
        delta.collectionName = "a:b";
        delta.primaryKey = "pk";
        delta.versionId = value;
        uint64_t sequenceNumber = value - 1;
        auto received = protocol::makeTessarineDelta(protocol::makePayloadForSendDelta(delta), sequenceNumber);
        EXPECT_EQ(value, received.versionId);
        EXPECT_EQ(sequenceNumber, received.sequenceNumber);
    }
}

}  // namespace
