// A delivery that cannot be applied yet holds up the store's worker, which
// retries it; once the cause goes away the store catches up by itself, and
// everything delivered after it is applied in the order it arrived.
#include <gtest/gtest.h>

#include "StoreTestSupport.h"

namespace {

namespace ts = lumivale::tessarine;
using Direction = ts::CollectionStorage::SortDirection;
using Status = ts::SyncProtocol::DeltaStatus;
using testsupport::LogCapture;
using testsupport::remoteDelta;
using testsupport::rows;
using testsupport::waitUntil;

class DeliveryRecoveryTest : public ::testing::Test {
protected:
    void SetUp() override {
        known = s.store->subscribeCollection("app:known");
        ASSERT_TRUE(known);
    }

    // What the application heard, as "collection/key:first blob byte:status", in order.
    std::vector<std::string> heardSoFar() {
        std::vector<std::string> heard;
        for (const ts::Delta& d : s.heard.all()) {
            heard.push_back(d.collectionName + "/" + d.primaryKey + ":" + std::to_string(d.blob.empty() ? 0 : d.blob[0]) +
                            ":" + std::to_string(static_cast<int>(d.status)));
        }
        return heard;
    }

    // Waits until the worker has failed the delivery in front at least twice.
    void waitForRetries(const LogCapture& log, const std::string& reason) {
        ASSERT_TRUE(waitUntil([&] { return log.linesStartingWith("Failed to process received deltas: " + reason).size() >= 2; }));
    }

    testsupport::TempDir dir;
    testsupport::StoreUnderTest s{dir.file("store.db")};
    std::unique_ptr<ts::Collection> known;
};

TEST_F(DeliveryRecoveryTest, ChangeForUnsubscribedCollectionWaitsForSubscriptionThenEverythingAppliesInOrder) {
    LogCapture log;
    // A delivery applies whole or not at all: w waits with x, which has no
    // table until app:later is subscribed.
    s.transport->onDeltaReceived({remoteDelta("app:known", "w", 4, {3}), remoteDelta("app:later", "x", 5, {1})});
    s.transport->onDeltaReceived({remoteDelta("app:known", "y", 6, {1})});
    s.transport->onDeltaReceived({remoteDelta("app:known", "y", 7, {2})});
    // Local writes do not wait for the worker; their status notices do.
    ASSERT_TRUE(known->saveObject("z", "z", std::vector<unsigned char>{9}));
    ts::SyncProtocol::Delta sentZ = s.transport->sentDeltas().back();
    s.transport->onDeltaStatusUpdated({sentZ, Status::SENT});
    waitForRetries(log, "no such table");
    EXPECT_EQ((std::vector<std::string>{"app:known/z:9:1"}), heardSoFar());
    EXPECT_EQ((std::vector<std::string>{"z=z:1:1"}), rows(known->query("", -1, Direction::ASCENDING)));
    // The metrics show the stall: three deliveries and the status notice
    // wait, the notice's change still counts as PENDING.
    auto stalled = s.store->getSyncMetrics();
    ASSERT_TRUE(stalled);
    EXPECT_TRUE(stalled->retrying);
    EXPECT_NE(std::string::npos, stalled->lastError.find("no such table")) << stalled->lastError;
    EXPECT_EQ(4u, stalled->waitingJobs);
    EXPECT_EQ(1u, stalled->queuedPending);

    auto later = s.store->subscribeCollection("app:later");
    ASSERT_TRUE(later);
    ASSERT_TRUE(waitUntil([&] { return heardSoFar().size() == 6; }));
    EXPECT_EQ((std::vector<std::string>{"app:known/z:9:1", "app:known/w:3:3", "app:later/x:1:3", "app:known/y:1:3",
                                        "app:known/y:2:3", "app:known/z:9:2"}),
              heardSoFar());
    EXPECT_EQ((std::vector<std::string>{"x=x:3:1"}), rows(later->query("", -1, Direction::ASCENDING)));
    EXPECT_EQ((std::vector<std::string>{"w=w:3:1", "y=y:3:1", "z=z:2:1"}),
              rows(known->query("", -1, Direction::ASCENDING)));
    ASSERT_TRUE(waitUntil([&] { return s.store->getSyncMetrics()->waitingJobs == 0; }));
    auto recovered = s.store->getSyncMetrics();
    EXPECT_FALSE(recovered->retrying);
    EXPECT_EQ(0u, recovered->queuedPending);
    EXPECT_EQ(1u, recovered->queuedSent);

    // The later changes' sequence number was kept: a reconnection continues
    // from there.
    s.transport->clearSent();
    s.transport->onConnectionEstablished();
    bool resubscribed = false;
    for (const auto& request : s.transport->sentSubscriptions()) {
        if (request.collectionName == "app:known") {
            EXPECT_EQ(7u, request.sequenceNumber);
            resubscribed = true;
        }
    }
    EXPECT_TRUE(resubscribed);
}

TEST_F(DeliveryRecoveryTest, ChangeTheIndexerRejectsIsRetriedUntilTheIndexerIsFixed) {
    auto indexer = [](bool acceptAll) {
        return [acceptAll](const std::string&, const std::string&, const std::string&,
                           const std::vector<unsigned char>& blob) {
            if (!acceptAll && blob.at(0) == 0xEE) throw std::runtime_error("cannot index");
            return std::unordered_multimap<std::string, std::string>{{"first", std::to_string(blob.at(0))}};
        };
    };
    s.store->setCollectionIndexerFunction(indexer(false));
    LogCapture log;
    s.transport->onDeltaReceived({remoteDelta("app:known", "bad", 3, {0xEE})});
    s.transport->onDeltaReceived({remoteDelta("app:known", "good", 4, {1})});
    waitForRetries(log, "cannot index");
    EXPECT_TRUE(rows(known->query("", -1, Direction::ASCENDING)).empty());

    s.store->setCollectionIndexerFunction(indexer(true));
    ASSERT_TRUE(waitUntil([&] { return heardSoFar().size() == 2; }));
    EXPECT_EQ((std::vector<std::string>{"app:known/bad:238:3", "app:known/good:1:3"}), heardSoFar());
    EXPECT_EQ((std::vector<std::string>{"bad=bad:3:1"}),
              rows(known->queryWithIndex("SELECT primary_key FROM {0} WHERE field_name = 'first' AND field_value = '238'",
                                         {}, -1)));
}

}  // namespace
