#include <gtest/gtest.h>

#include <map>

#include "TestSupport.h"
#include "tessarine/SubscriptionStorage.h"
#include "tessarine/Tessarine.h"

using lumivale::tessarine::SubscriptionStorage;
using lumivale::tessarine::Tessarine;

TEST(SubscriptionStorageTest, RowsKeepTheirNumbersAcrossReopenAndUnknownCollectionsFail) {
    testsupport::TempDir dir;
    {
        SubscriptionStorage storage(Tessarine::createSqliteDatabase(dir.file("s.db"), {}));
        storage.addSubscription("a:b");
        EXPECT_EQ(0u, storage.getSequenceNumber("a:b"));
        storage.updateSequenceNumber("a:b", 42);
        storage.addSubscription("a:b");  // keeps the row as it is
        storage.addSubscription("c:d");
        storage.updateSequenceNumber("never:subscribed", 7);  // creates nothing
        storage.updateSequenceNumber("c:d", UINT64_MAX);
    }
    SubscriptionStorage storage(Tessarine::createSqliteDatabase(dir.file("s.db"), {}));
    std::map<std::string, uint64_t> rows;
    for (const auto& s : storage.getSubscriptions()) rows[s.collectionName] = s.sequenceNumber;
    EXPECT_EQ((std::map<std::string, uint64_t>{{"a:b", 42}, {"c:d", UINT64_MAX}}), rows);

    storage.updateSequenceNumber("a:b", 3);  // smaller numbers overwrite too
    EXPECT_EQ(3u, storage.getSequenceNumber("a:b"));
    try {
        storage.getSequenceNumber("never:subscribed");
        FAIL();
    } catch (const std::runtime_error& e) {
        EXPECT_STREQ("Failed to get sequence number for collection", e.what());
    }
    storage.deleteSubscription("a:b");
    EXPECT_EQ(1u, storage.getSubscriptions().size());
}
