#include <gtest/gtest.h>

#include "StoreTestSupport.h"

namespace {

using lumivale::tessarine::Collection;
using Direction = lumivale::tessarine::CollectionStorage::SortDirection;
using testsupport::LogCapture;
using testsupport::rows;

TEST(CollectionNameTest, TwoPartsOfLettersDigitsUnderscoresAroundOneColon) {
    for (const char* name : {"a:b", "app_1:Items", "0:_"}) EXPECT_TRUE(Collection::isValidCollectionName(name)) << name;
    for (const std::string& name : std::vector<std::string>{"", "ab", ":b", "a:", "a:b:c", "a-b:c", "a b:c", "\x80" "a:b", "a:b\xc3\xa9",
                                   "a\"b:c", std::string("a:b\0c", 5)}) {
        EXPECT_FALSE(Collection::isValidCollectionName(name)) << name;
    }
}

class CollectionTest : public ::testing::Test {
protected:
    testsupport::TempDir dir;
    testsupport::StoreUnderTest s{dir.file("store.db")};
    std::unique_ptr<Collection> items = s.store->subscribeCollection("app:items");
};

TEST_F(CollectionTest, WritesTravelAsNumberedDeltasAndReadBack) {
    ASSERT_TRUE(items);
    EXPECT_TRUE(items->saveObject("b", "2", std::vector<unsigned char>{1, 2}));
    EXPECT_TRUE(items->saveObject("a", "1", nullptr, 0));
    EXPECT_TRUE(items->saveObject("c", "3", std::vector<unsigned char>()));
    EXPECT_TRUE(items->deleteObject("c"));
    auto sent = s.transport->sentDeltas();
    ASSERT_EQ(4u, sent.size());
    for (uint64_t i = 0; i < 4; ++i) EXPECT_EQ(i + 1, sent[i].versionId);
    EXPECT_EQ(lumivale::tessarine::SyncProtocol::DeltaType::DELETE, sent[3].type);

    EXPECT_EQ((std::vector<std::string>{"a=1:1:0", "b=2:1:2"}), rows(items->query("", -1, Direction::ASCENDING)));
    EXPECT_EQ((std::vector<std::string>{"b=2:1:2", "a=1:1:0"}), rows(items->query("9", -1, Direction::DESCENDING)));
    auto missing = items->getObject("nope");
    ASSERT_TRUE(missing);  // a cursor, not a failure
    EXPECT_FALSE(missing->step());
}

TEST_F(CollectionTest, FailuresAreLoggedAndLeaveNoTrace) {
    LogCapture log;
    EXPECT_FALSE(items->saveObject("k", "s", nullptr, 3));
    EXPECT_EQ(1u, log.linesStartingWith("Error while updating object: ").size());

    EXPECT_FALSE(items->queryWithIndex("SELEC nonsense FROM {0}", {}, 10));
    EXPECT_FALSE(items->queryWithIndexSorted("SELECT primary_key FROM {0} WHERE", {}, "f", Direction::ASCENDING, 1));
    EXPECT_EQ(2u, log.linesStartingWith("Error while querying collection: ").size());

    s.store->setCollectionIndexerFunction(
        [](const std::string&, const std::string&, const std::string&, const std::vector<unsigned char>&)
            -> std::unordered_multimap<std::string, std::string> { throw std::runtime_error("indexer broke"); });
    EXPECT_FALSE(items->saveObject("k", "s", std::vector<unsigned char>{1}));
    EXPECT_EQ(1u, log.linesStartingWith("Error while updating object: indexer broke").size());
    s.store->setCollectionIndexerFunction(nullptr);

    EXPECT_TRUE(rows(items->query("", -1, Direction::ASCENDING)).empty());
    s.transport->clearSent();
    s.transport->onConnectionEstablished();
    EXPECT_TRUE(s.transport->sentDeltas().empty());  // nothing was queued
    EXPECT_TRUE(items->saveObject("k", "s", std::vector<unsigned char>{1}));
    EXPECT_EQ(2u, s.transport->sentDeltas().back().versionId);  // the failed write used up id 1
}

}  // namespace
