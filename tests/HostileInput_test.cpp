// Input that an application may hand the store by accident or design, all
// through the public API: keys and blobs made of any bytes, very large blobs
// and index subqueries that are not one valid statement. Each is stored
// verbatim or refused with a clear error, and nothing stored before is lost.
#include <gtest/gtest.h>

#include <map>

#include "StoreTestSupport.h"

namespace {

namespace ts = lumivale::tessarine;
using Direction = ts::CollectionStorage::SortDirection;
using testsupport::LogCapture;
using testsupport::StoredObject;
using testsupport::storedObjects;
using testsupport::StoreUnderTest;
using testsupport::TempDir;
using Bytes = std::vector<unsigned char>;

Bytes bytesOf(const std::string& text) { return Bytes(text.begin(), text.end()); }

// Keys that break naive quoting, string handling or formatting.
const std::vector<std::string>& hostileKeys() {
    static const std::vector<std::string> keys{
        "it's", "\"quoted\"", "'); DELETE FROM \"collection_app:items\"; --", std::string("a\0b", 3), "a",
        "\xff\xfe\x80\x01", "Gr\xc3\xbc\xc3\x9f" "e \xe2\x82\xac", "%s%n%d", "{0}", std::string("\0", 1), ""};
    return keys;
}

TEST(HostileInputTest, KeysAndBlobsOfAnyBytesAndTensOfMegabytesRoundTripVerbatimEverywhereAndAcrossReopen) {
    TempDir dir;
    Bytes big(40u << 20);
    for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<unsigned char>(i * 2654435761u >> 13);
    const std::string path = dir.file("store.db");
    const auto& keys = hostileKeys();
    auto sortKeyOf = [&](size_t i) { return keys[(i + 3) % keys.size()] + std::to_string(i); };
    auto blobOf = [&](size_t i) {
        Bytes blob = bytesOf(keys[i]);
        blob.insert(blob.end(), {0, 0xff, '"', '\'', 0});
        return blob;
    };
    std::map<std::string, StoredObject> expected;
    for (size_t i = 0; i < keys.size(); ++i) expected[keys[i]] = {sortKeyOf(i), blobOf(i), 1};
    ts::SyncProtocol::Delta remote;
    remote.clientId = "ANOTHERCLIENT";
    remote.collectionName = "app:items";
    remote.primaryKey = "'; DROP TABLE delta_queue; --\x01\xfe";
    remote.sortKey = std::string("\0\0", 2);
    remote.blob = {0, 0, 0};
    remote.sequenceNumber = 3;
    {
        StoreUnderTest s(path);
        s.store->setCollectionIndexerFunction(
            [](const std::string&, const std::string& key, const std::string& sortKey, const Bytes&) {
                return std::unordered_multimap<std::string, std::string>{{"key", key}, {"sort", sortKey}};
            });
        auto items = s.store->subscribeCollection("app:items");
        ASSERT_TRUE(items);
        for (size_t i = 0; i < keys.size(); ++i) ASSERT_TRUE(items->saveObject(keys[i], sortKeyOf(i), blobOf(i))) << i;

        auto sent = s.transport->sentDeltas();
        auto heard = s.heard.all();
        ASSERT_EQ(keys.size(), sent.size());
        ASSERT_EQ(keys.size(), heard.size());
        for (size_t i = 0; i < keys.size(); ++i) {
            EXPECT_EQ(keys[i], sent[i].primaryKey) << i;
            EXPECT_EQ(sortKeyOf(i), sent[i].sortKey) << i;
            EXPECT_EQ(blobOf(i), sent[i].blob) << i;
            EXPECT_EQ(keys[i], heard[i].primaryKey) << i;
            EXPECT_EQ(blobOf(i), heard[i].blob) << i;
        }
        EXPECT_EQ(expected, storedObjects(items->query("", -1, Direction::ASCENDING)));
        for (size_t i = 0; i < keys.size(); ++i) {
            auto one = storedObjects(items->getObject(keys[i]));
            ASSERT_EQ(1u, one.size()) << i;
            EXPECT_EQ(keys[i], one.begin()->first);
            auto byIndex = storedObjects(items->queryWithIndex(
                "SELECT primary_key FROM {0} WHERE field_name = 'key' AND field_value = ?", {keys[i]}, -1));
            ASSERT_EQ(1u, byIndex.size()) << i;
            EXPECT_EQ(keys[i], byIndex.begin()->first);
        }

        s.transport->onDeltaReceived({remote});
        ASSERT_TRUE(testsupport::waitUntil([&] { return s.heard.size() == keys.size() + 1; }));
        expected[remote.primaryKey] = {remote.sortKey, remote.blob, 3};
        EXPECT_EQ(expected, storedObjects(items->query("", -1, Direction::ASCENDING)));

        ASSERT_TRUE(items->saveObject("big", "s", big));
        EXPECT_TRUE(big == s.heard.all().back().blob && big == s.transport->sentDeltas().back().blob);
        ASSERT_TRUE(items->deleteObject(std::string("a\0b", 3)));
        expected["big"] = {"s", big, 1};
        expected.erase(std::string("a\0b", 3));
        EXPECT_EQ(expected, storedObjects(items->query("", -1, Direction::ASCENDING)));
    }
    StoreUnderTest s(path);
    auto items = s.store->subscribeCollection("app:items");
    EXPECT_EQ(expected, storedObjects(items->query("", -1, Direction::ASCENDING)));
    s.transport->onConnectionEstablished();
    auto resent = s.transport->sentDeltas();
    ASSERT_EQ(keys.size() + 2, resent.size());
    for (size_t i = 0; i < keys.size(); ++i) {
        EXPECT_EQ(keys[i], resent[i].primaryKey) << i;
        EXPECT_EQ(blobOf(i), resent[i].blob) << i;
    }
    EXPECT_TRUE(big == resent[keys.size()].blob);
    EXPECT_EQ(std::string("a\0b", 3), resent.back().primaryKey);
}

TEST(HostileInputTest, IndexSubqueriesThatAreNotOneValidStatementFailAndChangeNothing) {
    TempDir dir;
    StoreUnderTest s(dir.file("store.db"));
    s.store->setCollectionIndexerFunction([](const std::string&, const std::string& key, const std::string&, const Bytes&) {
        return std::unordered_multimap<std::string, std::string>{{"tag", key}};
    });
    auto items = s.store->subscribeCollection("app:items");
    ASSERT_TRUE(items->saveObject("x", "1", Bytes{1}));
    ASSERT_TRUE(items->saveObject("y", "2", Bytes{2}));
    const auto before = storedObjects(items->query("", -1, Direction::ASCENDING));

    LogCapture log;
    // A second statement after the subquery: SQLite would compile the first
    // one and drop the rest without a word.
    EXPECT_FALSE(items->queryWithIndex(
        "SELECT primary_key FROM {0} WHERE field_value = ?) LIMIT ?; DELETE FROM \"collection_app:items\"; --",
        {"x"}, 5));
    EXPECT_FALSE(items->queryWithIndex("SELECT primary_key FROM {0}); DROP TABLE delta_queue; --", {}, 5));
    EXPECT_FALSE(items->queryWithIndex("SELECT primary_key FROM no_such_table", {}, 5));
    EXPECT_FALSE(items->queryWithIndex("SELECT primary_key FROM {0} WHERE field_value = ?", {"x", "surplus"}, 5));
    EXPECT_FALSE(items->queryWithIndexSorted("SELECT primary_key FROM {0}) --", {}, "tag", Direction::ASCENDING, 5));
    auto errors = log.linesStartingWith("Error while querying collection: ");
    ASSERT_EQ(5u, errors.size());
    EXPECT_NE(std::string::npos, errors[0].message.find("more than one statement")) << errors[0].message;

    // A hostile sort field name is only ever a bound value.
    EXPECT_EQ(2u, storedObjects(items->queryWithIndexSorted("SELECT primary_key FROM {0}", {}, "tag' OR 1=1; --",
                                                      Direction::ASCENDING, -1)).size());
    EXPECT_EQ(before, storedObjects(items->query("", -1, Direction::ASCENDING)));
    EXPECT_EQ(1u, storedObjects(items->queryWithIndex("SELECT primary_key FROM {0} WHERE field_value = ?", {"x"}, -1)).size());
    s.transport->onConnectionEstablished();
    EXPECT_EQ(4u, s.transport->sentDeltas().size());  // both writes, sent and resent
}

}  // namespace
