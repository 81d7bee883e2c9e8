#include <gtest/gtest.h>

#include "PipelineFixture.h"

namespace {

using testsupport::LogCapture;
namespace ts = lumivale::tessarine;
using ObjectStatus = ts::CollectionStorage::ObjectStatus;

class DeltaHandlerTest : public testsupport::PipelineFixture {
protected:
    void SetUp() override {
        build();
        subscriptionManager->subscribeCollection("a:b");
        collectionStorage->ensureTableExistsForCollection("a:b");
    }

    void deliver(const std::vector<Delta>& deltas) {
        transport->onDeltaReceived(deltas);
        drainJobs();
    }
    void report(const Delta& delta, Status status) {
        transport->onDeltaStatusUpdated({delta, status});
        drainJobs();  // the queue's job
        drainJobs();  // the status job it posts
    }
    Delta echo(Delta delta, uint64_t sequenceNumber) {
        delta.clientId = clientId;
        delta.sequenceNumber = sequenceNumber;
        return delta;
    }
};

TEST_F(DeltaHandlerTest, LocalSaveIsQueuedSentStoredPendingAndReportedAtOnce) {
    localSave("a:b", "k", {1, 0, 2});
    EXPECT_EQ(ts::DeltaQueue::PendingStatus::PENDING, deltaQueue->getPendingStatus("a:b", "k"));
    EXPECT_EQ(1, object("a:b", "k").first);
    ASSERT_EQ(1u, transport->sentDeltas().size());
    EXPECT_EQ(clientId, transport->sentDeltas()[0].clientId);
    auto got = heard.all();  // synchronously, on this thread
    ASSERT_EQ(1u, got.size());
    EXPECT_EQ(Status::PENDING, got[0].status);
    EXPECT_EQ((std::vector<unsigned char>{1, 0, 2}), got[0].blob);
    EXPECT_EQ("s-k", got[0].sortKey);
}

// A transport that does not take a change (offline, a full buffer) must not
// fail an offline-first write, and must not let a later change of the same
// collection reach the server before it.
TEST_F(DeltaHandlerTest, ThrowingTransportKeepsWritesQueuedUntilTheNextConnectionResendsThemInOrder) {
    LogCapture log;
    transport->setFailDeltas(true);
    localSave("a:b", "k", {1});
    transport->setFailDeltas(false);
    localSave("a:b", "k", {2});
    EXPECT_EQ(1u, log.linesStartingWith("Transport did not take a change, kept queued for the next connection: "
                                        "delta send failed").size());
    EXPECT_EQ(5, log.linesStartingWith("Transport did not take").front().priority);
    EXPECT_TRUE(transport->sentDeltas().empty());
    EXPECT_EQ(2u, deltaQueueStorage->getAllDeltas().size());
    EXPECT_EQ(std::make_pair(1, std::vector<unsigned char>{2}), object("a:b", "k"));
    EXPECT_EQ(2u, heard.all().size());  // both writes reported PENDING

    transport->onConnectionEstablished();
    localSave("a:b", "k", {3});
    std::vector<uint64_t> versions;
    for (const Delta& delta : transport->sentDeltas()) versions.push_back(delta.versionId);
    EXPECT_EQ((std::vector<uint64_t>{1, 2, 3}), versions);
}

TEST_F(DeltaHandlerTest, RemoteDeltasApplyAsPersistedUnlessLocalChangeIsQueued) {
    localSave("a:b", "mine", {1});
    deliver({testsupport::remoteDelta("a:b", "theirs", 10, {2}), testsupport::remoteDelta("a:b", "mine", 11, {3})});
    EXPECT_EQ(std::make_pair(3, std::vector<unsigned char>{2}), object("a:b", "theirs"));
    EXPECT_EQ(std::make_pair(1, std::vector<unsigned char>{1}), object("a:b", "mine"));  // local change wins
    auto got = heard.all();
    ASSERT_EQ(3u, got.size());
    EXPECT_EQ(Status::PERSISTED, got[1].status);
    EXPECT_EQ(Status::PERSISTED, got[2].status);  // reported even though not applied
    EXPECT_EQ(11u, subscriptionManager->getSequenceNumber("a:b"));
    EXPECT_EQ(11u, versionVectorStorage->getCollectionVersion("a:b", "OTHERCLIENT"));

    Delta remove = testsupport::remoteDelta("a:b", "theirs", 12);
    remove.type = ts::SyncProtocol::DeltaType::DELETE;
    deliver({remove});
    EXPECT_EQ(0, object("a:b", "theirs").first);
}

// Sequence numbers and version vectors are stored once per delivery, not per
// delta; what they hold afterwards must be what a delta-by-delta update gives.
TEST_F(DeltaHandlerTest, DeliveryOverSeveralCollectionsAndClientsStoresEachOnesLastSequenceAndHighestVersion) {
    subscriptionManager->subscribeCollection("a:c");
    collectionStorage->ensureTableExistsForCollection("a:c");
    auto from = [&](const std::string& client, const std::string& collection, uint64_t version, uint64_t sequence) {
        Delta delta = testsupport::remoteDelta(collection, "k" + std::to_string(sequence), sequence);
        delta.clientId = client;
        delta.versionId = version;
        return delta;
    };
    Delta own = localSave("a:c", "mine");
    deliver({from("X", "a:b", 5, 30), from("Y", "a:b", 9, 31), from("X", "a:c", 2, 7), from("X", "a:b", 4, 32),
             from("Y", "a:b", 12, 33), echo(own, 8)});
    EXPECT_EQ(33u, subscriptionManager->getSequenceNumber("a:b"));
    EXPECT_EQ(8u, subscriptionManager->getSequenceNumber("a:c"));  // an own delta moves it too
    EXPECT_EQ(5u, versionVectorStorage->getCollectionVersion("a:b", "X"));  // highest, not last
    EXPECT_EQ(12u, versionVectorStorage->getCollectionVersion("a:b", "Y"));
    EXPECT_EQ(2u, versionVectorStorage->getCollectionVersion("a:c", "X"));
    EXPECT_EQ(0u, versionVectorStorage->getCollectionVersion("a:c", clientId));
    deliver({from("X", "a:b", 3, 34)});  // lower than stored: kept
    EXPECT_EQ(5u, versionVectorStorage->getCollectionVersion("a:b", "X"));
    deliver({from("Z", "a:b", UINT64_MAX - 1, 35), from("Z", "a:b", 9, 36)});  // compared unsigned
    EXPECT_EQ(UINT64_MAX - 1, versionVectorStorage->getCollectionVersion("a:b", "Z"));
}

TEST_F(DeltaHandlerTest, OwnEchoRetiresQueueRowWithoutRewritingObject) {
    Delta first = localSave("a:b", "k", {1});
    Delta second = localSave("a:b", "k", {2});
    Delta changed = echo(first, 20);
    changed.blob = {99};
    deliver({changed});
    EXPECT_EQ(std::make_pair(1, std::vector<unsigned char>{2}), object("a:b", "k"));  // second still queued
    deliver({echo(second, 21)});
    EXPECT_EQ(std::make_pair(3, std::vector<unsigned char>{2}), object("a:b", "k"));
    EXPECT_TRUE(deltaQueueStorage->getAllDeltas().empty());
    EXPECT_EQ(21u, subscriptionManager->getSequenceNumber("a:b"));

    collectionStorage->updateObjectStatus("a:b", "k", ObjectStatus::SENT);
    deliver({echo(second, 22)});  // row already gone: no recomputation, number still stored
    EXPECT_EQ(2, object("a:b", "k").first);
    EXPECT_EQ(22u, subscriptionManager->getSequenceNumber("a:b"));
    EXPECT_EQ(Status::PERSISTED, heard.all().back().status);
}

// An object's status is its least advanced queued change's; a PERSISTED
// report and the server's echo may come in either order; a deleted object
// has no row to update, but its change's status is still reported.
TEST_F(DeltaHandlerTest, StatusFollowsLeastAdvancedQueuedDeltaWhateverTheOrderOfReportAndEcho) {
    Delta older = localSave("a:b", "k");
    Delta newer = localSave("a:b", "k");
    report(older, Status::SENT);
    EXPECT_EQ(1, object("a:b", "k").first);
    report(older, Status::PERSISTED);
    EXPECT_EQ(1, object("a:b", "k").first);
    report(newer, Status::SENT);
    EXPECT_EQ(2, object("a:b", "k").first);
    deliver({echo(newer, 1)});
    EXPECT_EQ(3, object("a:b", "k").first);
    report(newer, Status::PERSISTED);  // finds no row: reaches nobody
    std::vector<Status> statuses;
    for (const auto& d : heard.all()) statuses.push_back(d.status);
    EXPECT_EQ((std::vector<Status>{Status::PENDING, Status::PENDING, Status::SENT, Status::PERSISTED, Status::SENT,
                                   Status::PERSISTED}),
              statuses);

    Delta reportedFirst = localSave("a:b", "r");
    report(reportedFirst, Status::PERSISTED);
    deliver({echo(reportedFirst, 2)});
    EXPECT_EQ(3, object("a:b", "r").first);
    EXPECT_EQ(9u, heard.all().size());  // PENDING, PERSISTED (status), PERSISTED (echo)

    Delta remove{"", "a:b", 0, "k", "", ts::SyncProtocol::DeltaType::DELETE, {}, 0};
    remove.versionId = deltaHandler->addLocalDeltaWithNextVersionId(remove);
    report(remove, Status::SENT);
    EXPECT_EQ(0, object("a:b", "k").first);
    EXPECT_EQ(Status::SENT, heard.all().back().status);
    EXPECT_EQ(ts::SyncProtocol::DeltaType::DELETE, heard.all().back().type);
}

TEST_F(DeltaHandlerTest, StoppedHandlerRefusesWritesAndDropsEvents) {
    lifecycle->stop();
    uint64_t before = versionIdGenerator->queryVersionId("a:b");
    try {
        localSave("a:b", "k");
        FAIL();
    } catch (const std::runtime_error& e) {
        EXPECT_STREQ("DeltaHandler already stopped", e.what());
    }
    EXPECT_EQ(before + 1, versionIdGenerator->queryVersionId("a:b"));  // the id is used up
    deliver({testsupport::remoteDelta("a:b", "k", 1)});
    EXPECT_EQ(0, object("a:b", "k").first);
    EXPECT_TRUE(heard.all().empty());
}

TEST_F(DeltaHandlerTest, CallbacksSurviveThrowingAndEmptyCallbacksAndBadNumbers) {
    LogCapture log;
    callbackManager->addDeltaReceivedCallback([](const std::vector<ts::Delta>&) { throw std::runtime_error("app bug"); });
    callbackManager->addDeltaReceivedCallback(ts::CallbackManager::DeltaReceivedCallback());
    int after = 0;
    callbackManager->addDeltaReceivedCallback([&](const std::vector<ts::Delta>&) { ++after; });
    localSave("a:b", "k");
    EXPECT_EQ(1, after);
    EXPECT_EQ(1u, log.linesStartingWith("Exception in delta callback: app bug").size());
    EXPECT_EQ(2u, log.linesStartingWith("Exception in delta callback: ").size());

    Delta odd = testsupport::remoteDelta("a:b", "k", 1);
    odd.type = static_cast<ts::SyncProtocol::DeltaType>(9);
    ts::Delta api = deltaHandler->convertMQTTDeltaToApiDelta(odd, static_cast<Status>(0));
    EXPECT_EQ("k", api.primaryKey);
    EXPECT_EQ(1u, log.linesStartingWith("Unknown delta type: 9").size());
    EXPECT_EQ(1u, log.linesStartingWith("Unknow delta status: 0").size());
    EXPECT_EQ(ObjectStatus::PERSISTED, deltaHandler->convToObjectStatus(static_cast<ts::DeltaQueue::PendingStatus>(7)));
    EXPECT_EQ(1u, log.linesStartingWith("Unknown pending status: 7").size());

    deliver({odd, testsupport::remoteDelta("a:b", "fine", 2)});  // the unknown type is dropped, the rest applied
    EXPECT_EQ(3, object("a:b", "fine").first);
    EXPECT_EQ(1u, log.linesStartingWith("Dropping received delta of unknown type: 9").size());
}

TEST_F(DeltaHandlerTest, ApplyingUnknownTypeIsABrokenInvariant) {
    Delta odd = testsupport::remoteDelta("a:b", "k", 1);
    odd.type = static_cast<ts::SyncProtocol::DeltaType>(5);
    EXPECT_DEATH(deltaHandler->applyDelta(odd, ObjectStatus::PERSISTED),
                 "Assert \\(DeltaHandler:[0-9]+\\): Unknown delta type: 5");
}

}  // namespace
