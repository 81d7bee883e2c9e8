#include <gtest/gtest.h>

#include "PipelineFixture.h"

namespace {

using testsupport::LogCapture;
namespace ts = lumivale::tessarine;

// Fails its first `failures` status writes, as a busy or broken database would.
class FlakyDeltaQueueStorage : public ts::DeltaQueueStorage {
public:
    FlakyDeltaQueueStorage(std::shared_ptr<lumivale::sqlite::Database> db, int failures)
        : DeltaQueueStorage(std::move(db)), failuresLeft(failures) {}
    void updateDeltaStatus(const ts::SyncProtocol::Delta& delta, ts::SyncProtocol::DeltaStatus status) override {
        DeltaQueueStorage::updateDeltaStatus(delta, status);
        if (failuresLeft-- > 0) throw std::runtime_error("disk I/O error");
    }
    std::atomic<int> failuresLeft;
};

class DeltaQueueTest : public testsupport::PipelineFixture {
protected:
    void SetUp() override { build(); }

    void listen() {
        deltaQueue->addDeltaStatusUpdatedCallback([this](const Delta& delta, Status status) {
            std::lock_guard<std::mutex> lock(listenedMutex);
            listened.push_back(delta.primaryKey + ":" + std::to_string(static_cast<int>(status)));
        });
    }
    std::vector<std::string> statusesHeard() {
        std::lock_guard<std::mutex> lock(listenedMutex);
        return listened;
    }
    void report(const Delta& delta, Status status) { transport->onDeltaStatusUpdated({delta, status}); }

    std::mutex listenedMutex;
    std::vector<std::string> listened;
};

TEST_F(DeltaQueueTest, StatusUpdatesChangeRowsOnWorkerAndReachListenersOnlyOnChange) {
    listen();
    Delta delta = localSave("a:b", "k");
    report(delta, Status::SENT);
    report(delta, Status::SENT);  // repeats the stored status
    Delta unknown = delta;
    unknown.versionId = 99;
    report(unknown, Status::SENT);  // not queued
    drainJobs();
    EXPECT_EQ(Status::SENT, deltaQueueStorage->getDeltaStatus(delta).value());
    EXPECT_EQ(std::vector<std::string>{"k:2"}, statusesHeard());

    report(delta, Status::PERSISTED);
    drainJobs();
    EXPECT_FALSE(deltaQueueStorage->getDeltaStatus(delta).has_value());
    EXPECT_EQ((std::vector<std::string>{"k:2", "k:3"}), statusesHeard());
    report(delta, Status::PERSISTED);  // the row is gone: nothing more
    report(delta, static_cast<Status>(7));  // unknown status: dropped, never stored
    drainJobs();
    EXPECT_EQ(2u, statusesHeard().size());
}

TEST_F(DeltaQueueTest, ConnectionResendsWholeQueueOldestFirstUntilStopped) {
    LogCapture log;
    transport->onConnectionEstablished();
    ASSERT_EQ(1u, log.linesStartingWith("DeltaQueue::onConnectionEstablished: sending 0 delta(s)").size());

    Delta first = localSave("z:z", "one");
    Delta second = localSave("a:a", "two");
    deltaQueue->updateDeltaStatus(first, Status::SENT);
    transport->clearSent();
    transport->onConnectionEstablished();
    auto sent = transport->sentDeltas();
    ASSERT_EQ(2u, sent.size());
    EXPECT_EQ("one", sent[0].primaryKey);  // SENT deltas go again too
    EXPECT_EQ("two", sent[1].primaryKey);
    for (const auto& d : sent) {
        EXPECT_EQ(clientId, d.clientId);
        EXPECT_EQ(0u, d.sequenceNumber);
    }
    EXPECT_EQ(1u, log.linesStartingWith("DeltaQueue::onConnectionEstablished: sending 2 delta(s)").size());

    transport->setFailDeltas(true);
    transport->onConnectionEstablished();  // must not throw to the transport
    EXPECT_EQ(1u, log.linesStartingWith("Error in DeltaQueue::onConnectionEstablished: delta send failed").size());

    transport->setFailDeltas(false);
    transport->clearSent();
    lifecycle->stop();
    transport->onConnectionEstablished();
    report(first, Status::PERSISTED);
    drainJobs();
    EXPECT_TRUE(transport->sentDeltas().empty());
    EXPECT_EQ(Status::SENT, deltaQueueStorage->getDeltaStatus(first).value());
    EXPECT_EQ(ts::DeltaQueue::PendingStatus::SENT, deltaQueue->getPendingStatus("z:z", "one"));
}

TEST_F(DeltaQueueTest, ThrowingListenerFailsJobButCommittedChangeIsNotRepeated) {
    int calls = 0;
    deltaQueue->addDeltaStatusUpdatedCallback([&](const Delta&, Status) {
        ++calls;
        throw std::runtime_error("listener failed");
    });
    Delta delta = localSave("a:b", "k");
    report(delta, Status::SENT);
    drainJobs();
    EXPECT_EQ(1, calls);
    EXPECT_EQ(Status::SENT, deltaQueueStorage->getDeltaStatus(delta).value());
}

class FlakyDeltaQueueTest : public DeltaQueueTest {
protected:
    void SetUp() override {
        database = ts::Tessarine::createSqliteDatabase(path, {});
        flaky = std::make_shared<FlakyDeltaQueueStorage>(database, 2);
        deltaQueueStorage = flaky;
        build();
    }
    std::shared_ptr<FlakyDeltaQueueStorage> flaky;
};

TEST_F(FlakyDeltaQueueTest, FailedStatusTransactionRollsBackAndIsRetried) {
    LogCapture log;
    listen();
    Delta delta = localSave("a:b", "k");
    report(delta, Status::SENT);
    drainJobs();
    EXPECT_EQ(2u, log.linesStartingWith("Failed to process delta status update").size());
    EXPECT_EQ(Status::SENT, deltaQueueStorage->getDeltaStatus(delta).value());
    EXPECT_EQ(std::vector<std::string>{"k:2"}, statusesHeard());  // once, after the successful attempt
}

using DeltaQueueDeathTest = DeltaQueueTest;

TEST_F(DeltaQueueDeathTest, StoringPersistedIsABrokenInvariant) {
    EXPECT_DEATH(deltaQueueStorage->updateDeltaStatus(localSave("a:b", "k"), Status::PERSISTED),
                 "Assert \\(DeltaQueueStorage:[0-9]+\\): Deltas with status=PERSISTED should be deleted from the queue");
}

}  // namespace
