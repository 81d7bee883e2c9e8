#include <gtest/gtest.h>

#include "PipelineFixture.h"
#include "tessarine/SnapshotGenerator.h"

namespace {

using testsupport::LogCapture;
namespace ts = lumivale::tessarine;

class SnapshotTest : public testsupport::PipelineFixture {
protected:
    void SetUp() override {
        build();
        subscriptionManager->subscribeCollection("a:b");
        collectionStorage->ensureTableExistsForCollection("a:b");
    }

    void receive(const ts::SyncProtocol::Snapshot& snapshot) {
        transport->onSnapshotReceived(snapshot);
        drainJobs();  // status jobs and the delivery
        drainJobs();  // status recomputations they post
    }

    static ts::SyncProtocol::Snapshot snapshotOf(std::vector<std::string> keys, uint64_t sequenceNumber,
                                                uint64_t versionId) {
        ts::SyncProtocol::Snapshot snapshot;
        snapshot.collectionName = "a:b";
        snapshot.sequenceNumber = sequenceNumber;
        snapshot.versionId = versionId;
        for (const auto& key : keys) snapshot.objects.push_back({key, "sort-" + key, {static_cast<unsigned char>(key[0])}});
        return snapshot;
    }
};

TEST_F(SnapshotTest, ObjectsArriveAsOneBatchOfSnapshotSavesAndLocalObjectsStay) {
    localSave("a:b", "local");
    std::vector<Delta> batch;
    transport->addDeltaReceivedCallback([&](const std::vector<Delta>& deltas) { batch = deltas; });
    receive(snapshotOf({"x", "y", "z"}, 30, 0));

    ASSERT_EQ(3u, batch.size());
    for (size_t i = 0; i < 3; ++i) {
        EXPECT_EQ(std::string(1, "xyz"[i]), batch[i].primaryKey);
        EXPECT_EQ("snapshot_store", batch[i].clientId);
        EXPECT_EQ(0u, batch[i].versionId);
        EXPECT_EQ(30u, batch[i].sequenceNumber);
        EXPECT_EQ(ts::SyncProtocol::DeltaType::SAVE, batch[i].type);
        EXPECT_EQ(3, object("a:b", batch[i].primaryKey).first);
    }
    EXPECT_EQ(1, object("a:b", "local").first);  // version 1 not covered by versionId 0: still queued
    EXPECT_EQ(1u, deltaQueueStorage->getAllDeltas().size());
    EXPECT_EQ(30u, subscriptionManager->getSequenceNumber("a:b"));
}

TEST_F(SnapshotTest, CoveredLocalChangesAreRetiredBeforeObjectsApply) {
    localSave("a:b", "k");
    localSave("a:b", "j");
    localSave("a:b", "later");
    localSave("c:d", "elsewhere");  // version 1 of another collection: not covered
    receive(snapshotOf({"k", "j"}, 8, 2));
    EXPECT_EQ(2u, deltaQueueStorage->getAllDeltas().size());
    EXPECT_EQ(std::make_pair(3, std::vector<unsigned char>{'k'}), object("a:b", "k"));  // the server's copy
    EXPECT_EQ(3, object("a:b", "j").first);
    EXPECT_EQ(1, object("a:b", "later").first);

    std::vector<Delta> batch{Delta()};
    transport->addDeltaReceivedCallback([&](const std::vector<Delta>& deltas) { batch = deltas; });
    receive(snapshotOf({}, 9, 3));
    EXPECT_TRUE(batch.empty());  // an empty snapshot still delivers, with nothing in it
    auto left = deltaQueueStorage->getAllDeltas();
    ASSERT_EQ(1u, left.size());
    EXPECT_EQ("c:d", left[0].first.collectionName);
}

TEST_F(SnapshotTest, FailingDeliveryIsLoggedAndThrownToTransport) {
    LogCapture log;
    transport->addDeltaReceivedCallback([](const std::vector<Delta>&) { throw std::runtime_error("delivery broke"); });
    EXPECT_THROW(transport->onSnapshotReceived(snapshotOf({"x"}, 1, 0)), std::runtime_error);
    EXPECT_EQ(1u, log.linesStartingWith("Error while processing snapshot: delivery broke").size());
}

TEST_F(SnapshotTest, GeneratedSnapshotListsObjectsInSortOrderWithNumbers) {
    ts::SnapshotGenerator& generator = *snapshotGenerator;
    auto unsubscribed = generator.generateSnapshot("n:s", "OTHERCLIENT");
    EXPECT_EQ("n:s", unsubscribed.collectionName);
    EXPECT_EQ(0u, unsubscribed.sequenceNumber);
    EXPECT_TRUE(unsubscribed.objects.empty());

    transport->onDeltaReceived({testsupport::remoteDelta("a:b", "b", 4, {2}), testsupport::remoteDelta("a:b", "a", 7, {1})});
    drainJobs();
    auto snapshot = generator.generateSnapshot("a:b", "OTHERCLIENT");
    EXPECT_EQ("a:b", snapshot.collectionName);
    EXPECT_EQ(7u, snapshot.sequenceNumber);
    EXPECT_EQ(7u, snapshot.versionId);
    ASSERT_EQ(2u, snapshot.objects.size());
    EXPECT_EQ("a", snapshot.objects[0].primaryKey);  // sort keys a < b
    EXPECT_EQ(std::vector<unsigned char>{1}, snapshot.objects[0].blob);
    EXPECT_EQ(0u, generator.generateSnapshot("a:b", "NOBODY").versionId);
}

}  // namespace
