#include <gtest/gtest.h>

#include "TestSupport.h"
#include "sqlite/Database.h"
#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/Tessarine.h"

using lumivale::sqlite::kOpenReadWriteCreate;
using lumivale::sqlite::Database;
using lumivale::tessarine::DeltaQueueStorage;
using lumivale::tessarine::SyncProtocol;
using lumivale::tessarine::Tessarine;
using Status = SyncProtocol::DeltaStatus;

namespace {

SyncProtocol::Delta makeDelta(const std::string& collection, uint64_t versionId, const std::string& key,
                              SyncProtocol::DeltaType type = SyncProtocol::DeltaType::SAVE) {
    SyncProtocol::Delta delta;
    delta.clientId = "WRITER";
    delta.collectionName = collection;
    delta.versionId = versionId;
    delta.primaryKey = key;
    delta.type = type;
    if (type == SyncProtocol::DeltaType::SAVE) {
        delta.sortKey = "sort-" + key;
        delta.blob = {1, 0, static_cast<unsigned char>(versionId)};
    }
    delta.sequenceNumber = 99;
    return delta;
}

class DeltaQueueStorageTest : public ::testing::Test {
protected:
    void reopen() {
        storage.reset();
        db.reset();
        db = Tessarine::createSqliteDatabase(path, {});
        storage = std::make_shared<DeltaQueueStorage>(db);
    }

    testsupport::TempDir dir;
    std::string path = dir.file("queue.db");
    std::shared_ptr<Database> db = Tessarine::createSqliteDatabase(path, {});
    std::shared_ptr<DeltaQueueStorage> storage = std::make_shared<DeltaQueueStorage>(db);
};

TEST_F(DeltaQueueStorageTest, EmptyQueueAnswersEmpty) {
    EXPECT_TRUE(storage->getAllDeltas().empty());
    EXPECT_TRUE(storage->getDeltaRangeByVersionId("a:b", 0, UINT64_MAX).empty());
    EXPECT_TRUE(storage->getDeltaStatuses("a:b", "k").empty());
    EXPECT_FALSE(storage->getDeltaStatus(makeDelta("a:b", 1, "k")).has_value());
    storage->updateDeltaStatus(makeDelta("a:b", 1, "k"), Status::SENT);  // no row: no failure
    storage->removeDelta(makeDelta("a:b", 1, "k"));
    EXPECT_TRUE(storage->getAllDeltas().empty());
}

TEST_F(DeltaQueueStorageTest, RowsComeBackInInsertionOrderWithoutClientIdOrSequenceAndSurviveReopen) {
    storage->insertDelta(makeDelta("z:z", 5, "first"), Status::PENDING);
    storage->insertDelta(makeDelta("a:a", 1, "second", SyncProtocol::DeltaType::DELETE), Status::SENT);
    SyncProtocol::Delta empty = makeDelta("a:a", 2, "third");
    empty.blob.clear();
    empty.sortKey.clear();
    storage->insertDelta(empty, Status::PENDING);
    reopen();

    auto all = storage->getAllDeltas();
    ASSERT_EQ(3u, all.size());
    EXPECT_EQ("first", all[0].first.primaryKey);
    EXPECT_EQ(5u, all[0].first.versionId);
    EXPECT_EQ((std::vector<unsigned char>{1, 0, 5}), all[0].first.blob);
    EXPECT_EQ("sort-first", all[0].first.sortKey);
    EXPECT_EQ(Status::PENDING, all[0].second);
    EXPECT_EQ(SyncProtocol::DeltaType::DELETE, all[1].first.type);
    EXPECT_TRUE(all[1].first.blob.empty());
    EXPECT_EQ(Status::SENT, all[1].second);
    EXPECT_TRUE(all[2].first.blob.empty());
    EXPECT_TRUE(all[2].first.sortKey.empty());
    for (const auto& entry : all) {
        EXPECT_EQ("", entry.first.clientId);
        EXPECT_EQ(0u, entry.first.sequenceNumber);
    }
}

TEST_F(DeltaQueueStorageTest, RangeIsInclusiveAndPerCollection) {
    for (uint64_t v : {3, 1, 2, 4}) storage->insertDelta(makeDelta("a:b", v, "k" + std::to_string(v)), Status::PENDING);
    storage->insertDelta(makeDelta("a:c", 2, "other"), Status::PENDING);
    // Version ids above the signed 64-bit range still round-trip.
    storage->insertDelta(makeDelta("a:b", UINT64_MAX, "huge"), Status::PENDING);

    auto two = storage->getDeltaRangeByVersionId("a:b", 2, 2);
    ASSERT_EQ(1u, two.size());
    EXPECT_EQ("k2", two[0].primaryKey);
    auto middle = storage->getDeltaRangeByVersionId("a:b", 2, 3);
    ASSERT_EQ(2u, middle.size());
    EXPECT_EQ("k3", middle[0].primaryKey);  // insertion order, not version order
    EXPECT_EQ("k2", middle[1].primaryKey);
    EXPECT_TRUE(storage->getDeltaRangeByVersionId("a:b", 0, 0).empty());
    EXPECT_EQ(UINT64_MAX, storage->getAllDeltas().back().first.versionId);
    EXPECT_EQ(Status::PENDING, storage->getDeltaStatus(makeDelta("a:b", UINT64_MAX, "huge")).value());
}

TEST_F(DeltaQueueStorageTest, StatusUpdatesAndRemovalTouchOnlyTheirRow) {
    storage->insertDelta(makeDelta("a:b", 1, "k"), Status::PENDING);
    storage->insertDelta(makeDelta("a:b", 2, "k"), Status::PENDING);
    storage->insertDelta(makeDelta("a:c", 1, "k"), Status::PENDING);
    storage->updateDeltaStatus(makeDelta("a:b", 1, "ignored-key"), Status::SENT);
    EXPECT_EQ(Status::SENT, storage->getDeltaStatus(makeDelta("a:b", 1, "")).value());
    EXPECT_EQ(Status::PENDING, storage->getDeltaStatus(makeDelta("a:c", 1, "")).value());
    auto statuses = storage->getDeltaStatuses("a:b", "k");
    EXPECT_EQ(2u, statuses.size());

    storage->removeDelta(makeDelta("a:b", 1, ""));
    EXPECT_FALSE(storage->getDeltaStatus(makeDelta("a:b", 1, "")).has_value());
    EXPECT_EQ(2u, storage->getAllDeltas().size());
}

TEST(DeltaQueueStorageDeathTest, StoringPersistedIsABrokenInvariant) {
    auto db = std::make_shared<Database>(":memory:", kOpenReadWriteCreate);
    DeltaQueueStorage storage(db);
    EXPECT_DEATH(storage.updateDeltaStatus(makeDelta("a:b", 1, "k"), Status::PERSISTED),
                 "Assert \\(DeltaQueueStorage:[0-9]+\\): Deltas with status=PERSISTED should be deleted from the queue");
}

}  // namespace
