#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "TestSupport.h"
#include "server/MemoryLogStorage.h"
#include "server/ServerProtocol.h"
#include "server/SqliteLogStorage.h"
#include "server/SyncServer.h"
#include "tessarine/Protocol.h"

namespace {

namespace ts = lumivale::tessarine;
namespace protocol = lumivale::tessarine::protocol;
using ts::server::SyncServer;
using Delta = ts::SyncProtocol::Delta;
using Outcome = SyncServer::Outcome;

Delta change(const std::string& clientId, uint64_t versionId, const std::string& key, const std::string& sortKey = "s",
             std::vector<unsigned char> blob = {1}, const std::string& collection = "app:notes") {
    return {clientId, collection, versionId, key, sortKey, ts::SyncProtocol::DeltaType::SAVE, std::move(blob), 0};
}

Delta deletion(const std::string& clientId, uint64_t versionId, const std::string& key) {
    Delta delta = change(clientId, versionId, key, "", {});
    delta.type = ts::SyncProtocol::DeltaType::DELETE;
    return delta;
}

// One client session; what the server sends it is read back with the
// store's own readers, so every payload is checked to be what a store reads.
struct Client {
    explicit Client(SyncServer& theServer) : server(theServer) {
        id = theServer.attach([this](std::vector<unsigned char> payload) { payloads.push_back(std::move(payload)); });
    }

    SyncServer::Receipt send(const Delta& delta) {
        return server.receive(id, protocol::TOPIC_CHANGE_RECORD, protocol::makePayloadForSendDelta(delta));
    }
    SyncServer::Receipt subscribe(const std::string& clientId, uint64_t sequenceNumber,
                                  const std::string& collection = "app:notes") {
        ts::SyncProtocol::SubscriptionRequest request{"\x01", collection, clientId, sequenceNumber};
        return server.receive(id, protocol::TOPIC_SUBSCRIBE_COLLECTION, protocol::makePayloadForSubscription(request));
    }
    SyncServer::Receipt requestSnapshot(const std::string& clientId) {
        return server.receive(id, protocol::TOPIC_SNAPSHOT, protocol::makePayloadForSnapshotRequest("app:notes", clientId));
    }

    // Every payload received since the last call, one line each:
    // "list <seq>: <client>/<version> <key>=<blob size>" or
    // "snapshot <seq> v<version>: <key>@<sort> ...".
    std::vector<std::string> take() {
        std::vector<std::string> lines;
        for (const auto& bytes : payloads) {
            ts::SyncProtocol::ServerPayload payload = protocol::deserializeServerPayload(bytes);
            if (payload.type == ts::SyncProtocol::PayloadType::SNAPSHOT) {
                ts::SyncProtocol::Snapshot snapshot = protocol::deserializeSnapshot(payload.data);
                std::string line = "snapshot " + std::to_string(snapshot.sequenceNumber) + " v" +
                                   std::to_string(snapshot.versionId) + ":";
                for (const auto& object : snapshot.objects) line += " " + object.primaryKey + "@" + object.sortKey;
                lines.push_back(line);
                continue;
            }
            for (const Delta& delta : protocol::deserializeDeltaList(payload.data)) {
                std::string kind = delta.type == ts::SyncProtocol::DeltaType::DELETE ? " delete " : " ";
                lines.push_back("list " + std::to_string(delta.sequenceNumber) + ": " + delta.clientId + "/" +
                                std::to_string(delta.versionId) + kind + delta.primaryKey + "=" +
                                std::to_string(delta.blob.size()));
            }
        }
        payloads.clear();
        return lines;
    }

    SyncServer& server;
    SyncServer::SessionId id;
    std::vector<std::vector<unsigned char>> payloads;
};

using Lines = std::vector<std::string>;

// Every rule holds over both storages: in memory (the reference server) and
// in a SQLite file (the networked server).
enum class Storage { MEMORY, SQLITE };

class SyncServerTest : public ::testing::TestWithParam<Storage> {
protected:
    std::unique_ptr<ts::server::LogStorage> makeStorage() {
        if (GetParam() == Storage::MEMORY) return std::make_unique<ts::server::MemoryLogStorage>();
        return std::make_unique<ts::server::SqliteLogStorage>(dir.file("server.db"));
    }

    testsupport::TempDir dir;
    SyncServer server{makeStorage()};
};

INSTANTIATE_TEST_SUITE_P(Storages, SyncServerTest, ::testing::Values(Storage::MEMORY, Storage::SQLITE),
                         [](const auto& paramInfo) { return paramInfo.param == Storage::MEMORY ? "Memory" : "Sqlite"; });

TEST_P(SyncServerTest, ChangeIsAcceptedOncePerClientCollectionAndVersionAndAResendIsEchoedToItsWriterOnly) {
    Client writer(server), reader(server), outsider(server);
    writer.subscribe("A", 0);
    reader.subscribe("B", 0);
    EXPECT_EQ((Lines{"snapshot 0 v0:"}), writer.take());
    reader.take();

    EXPECT_EQ(Outcome::CHANGE_ACCEPTED, writer.send(change("A", 1, "k1")).outcome);
    EXPECT_EQ((Lines{"list 1: A/1 k1=1"}), writer.take());
    EXPECT_EQ((Lines{"list 1: A/1 k1=1"}), reader.take());

    // The resend carries other bytes: had it been applied again, the object
    // would now hold three bytes.
    SyncServer::Receipt resend = writer.send(change("A", 1, "k1", "s", {9, 9, 9}));
    EXPECT_EQ(Outcome::CHANGE_ECHOED, resend.outcome);
    EXPECT_EQ(1u, resend.sequenceNumber);
    EXPECT_EQ((Lines{"list 1: A/1 k1=1"}), writer.take());
    EXPECT_TRUE(reader.take().empty());
    EXPECT_EQ(std::vector<unsigned char>{1}, server.objects("app:notes").at(0).blob);

    // Another client's version 1, and A's version 1 in another collection,
    // are other changes.
    EXPECT_EQ(Outcome::CHANGE_ACCEPTED, reader.send(change("B", 1, "k2")).outcome);
    EXPECT_EQ(Outcome::CHANGE_ACCEPTED, writer.send(change("A", 1, "k1", "s", {1}, "app:other")).outcome);
    EXPECT_EQ((Lines{"list 2: B/1 k2=1"}), writer.take());
    EXPECT_EQ((Lines{"list 2: B/1 k2=1"}), reader.take());
    EXPECT_EQ(2u, server.sequenceNumber("app:notes"));
    EXPECT_EQ(1u, server.sequenceNumber("app:other"));

    // A later echo carries the last sequence number, which the writer has
    // been sent everything up to: it must not send the writer back to 1.
    EXPECT_EQ(Outcome::CHANGE_ECHOED, writer.send(change("A", 1, "k1")).outcome);
    EXPECT_EQ((Lines{"list 2: A/1 k1=1"}), writer.take());

    // A writer that follows nothing gets no echo; the subscribers still get
    // its change, once.
    EXPECT_EQ(Outcome::CHANGE_ACCEPTED, outsider.send(change("C", 4, "k3")).outcome);
    EXPECT_EQ(Outcome::CHANGE_ECHOED, outsider.send(change("C", 4, "k3")).outcome);
    EXPECT_TRUE(outsider.take().empty());
    EXPECT_EQ((Lines{"list 3: C/4 k3=1"}), reader.take());
    EXPECT_EQ(4u, server.highestVersionId("app:notes", "C"));
}

TEST_P(SyncServerTest, SubscriptionFromNGetsTheChangesAfterNInOrderAndThenEveryNewChange) {
    Client writer(server), late(server);
    writer.send(change("A", 1, "k1"));
    writer.send(change("A", 2, "k2", "s", {1, 2}));
    writer.send(deletion("A", 3, "k1"));

    EXPECT_EQ(Outcome::SUBSCRIBED, late.subscribe("B", 1).outcome);
    EXPECT_EQ((Lines{"list 2: A/2 k2=2", "list 3: A/3 delete k1=0"}), late.take());
    writer.send(change("A", 4, "k4"));
    EXPECT_EQ((Lines{"list 4: A/4 k4=1"}), late.take());
    EXPECT_TRUE(writer.take().empty());  // never subscribed

    // Asking again on the same session (a repeated request, or a client
    // that has not applied everything yet) sends nothing twice.
    EXPECT_EQ(Outcome::SUBSCRIBED, late.subscribe("B", 1).outcome);
    EXPECT_EQ(Outcome::SUBSCRIBED, late.subscribe("B", 0).outcome);
    EXPECT_TRUE(late.take().empty());
    writer.send(change("A", 6, "k6"));
    EXPECT_EQ((Lines{"list 5: A/6 k6=1"}), late.take());

    // Up to date: nothing to catch up, but followed from now on.
    Client current(server);
    SyncServer::Receipt receipt = current.subscribe("C", 5);
    EXPECT_EQ(Outcome::SUBSCRIBED, receipt.outcome);
    EXPECT_EQ(5u, receipt.sequenceNumber);
    EXPECT_TRUE(current.take().empty());
    writer.send(change("A", 7, "k7"));
    EXPECT_EQ((Lines{"list 6: A/7 k7=1"}), current.take());
}

TEST_P(SyncServerTest, SubscriptionFromZeroAndSnapshotRequestsGetSortedSnapshotsWithTheRequestersVersion) {
    Client writer(server);
    writer.send(change("A", 1, "k1", "c"));
    writer.send(change("A", 5, "k2", "a"));
    writer.send(change("B", 7, "k4", "b"));
    writer.send(change("B", 8, "k3", "b"));
    writer.send(change("A", 3, "k5", "d"));  // late and lower: not A's highest
    writer.send(deletion("B", 9, "k5"));

    Client joiner(server);
    joiner.subscribe("J", 0);
    EXPECT_EQ((Lines{"snapshot 6 v0: k2@a k3@b k4@b k1@c"}), joiner.take());
    writer.send(change("A", 6, "k6"));
    EXPECT_EQ((Lines{"list 7: A/6 k6=1"}), joiner.take());

    Client asker(server);
    EXPECT_EQ(Outcome::SNAPSHOT_SENT, asker.requestSnapshot("B").outcome);
    EXPECT_EQ(Outcome::SNAPSHOT_SENT, asker.requestSnapshot("A").outcome);
    EXPECT_EQ((Lines{"snapshot 7 v9: k2@a k3@b k4@b k1@c k6@s", "snapshot 7 v6: k2@a k3@b k4@b k1@c k6@s"}),
              asker.take());
    writer.send(change("A", 7, "k7"));
    EXPECT_TRUE(asker.take().empty());  // a snapshot request subscribes to nothing

    // A client further along than the server (which has lost its memory
    // since) is given a snapshot.
    Client ahead(server);
    ahead.subscribe("Z", 99);
    EXPECT_EQ((Lines{"snapshot 8 v0: k2@a k3@b k4@b k1@c k6@s k7@s"}), ahead.take());
}

// A store may ask from an older number than it has applied. Another
// client's change that a later one supersedes would then be applied over
// newer content, so it is left out; the client's own changes stay, since
// they retire its queue in order. A client at 0 whose changes were accepted
// may hold objects deleted since, which a snapshot would never delete.
TEST_P(SyncServerTest, CatchUpLeavesOutOthersSupersededChangesKeepsOwnOnesAndSnapshotsOnlyNewClients) {
    Client writer(server);
    writer.send(change("B", 1, "k1"));
    writer.send(change("A", 1, "k1"));
    writer.send(change("B", 2, "k1"));
    writer.send(change("B", 3, "k2"));
    writer.send(deletion("B", 4, "k2"));
    writer.send(change("A", 2, "k3"));

    Client a(server), b(server), fresh(server);
    a.subscribe("A", 0);
    EXPECT_EQ((Lines{"list 2: A/1 k1=1", "list 3: B/2 k1=1", "list 5: B/4 delete k2=0", "list 6: A/2 k3=1"}),
              a.take());
    b.subscribe("B", 1);
    EXPECT_EQ((Lines{"list 3: B/2 k1=1", "list 4: B/3 k2=1", "list 5: B/4 delete k2=0", "list 6: A/2 k3=1"}),
              b.take());
    fresh.subscribe("C", 0);
    EXPECT_EQ((Lines{"snapshot 6 v0: k1@s k3@s"}), fresh.take());
}

TEST_P(SyncServerTest, PayloadsThatDoNotParseAreDroppedAndLoggedAndReachNoOne) {
    testsupport::LogCapture log;
    Client sender(server), subscriber(server);
    subscriber.subscribe("B", 0);
    subscriber.take();

    const std::vector<unsigned char> garbage{0xff, 0x00, 0x13, 0x37, 0x01};
    std::vector<std::pair<std::string, std::vector<unsigned char>>> bad = {
        {protocol::TOPIC_CHANGE_RECORD, garbage},
        {protocol::TOPIC_CHANGE_RECORD, {}},
        {protocol::TOPIC_SUBSCRIBE_COLLECTION, garbage},
        {protocol::TOPIC_SNAPSHOT, garbage},
        {"/some_other_topic", protocol::makePayloadForSendDelta(change("A", 1, "k"))},
        {protocol::TOPIC_CHANGE_RECORD, protocol::makePayloadForSendDelta(change("A", 1, "k", "s", {}, "no colon"))},
        {protocol::TOPIC_CHANGE_RECORD, protocol::makePayloadForSendDelta(change("", 1, "k"))},
        {protocol::TOPIC_SUBSCRIBE_COLLECTION, protocol::makePayloadForSubscription({"\x01", "x:y;DROP", "A", 0})},
        {protocol::TOPIC_SUBSCRIBE_COLLECTION, protocol::makePayloadForSubscription({"\x01", "app:notes", "", 0})},
        {protocol::TOPIC_SNAPSHOT, protocol::makePayloadForSnapshotRequest("app:notes", "")},
        // A subscription offered as a change.
        {protocol::TOPIC_CHANGE_RECORD, protocol::makePayloadForSubscription({"\x01", "app:notes", "A", 0})},
    };
    for (const auto& [topic, bytes] : bad) {
        EXPECT_EQ(Outcome::DROPPED, server.receive(sender.id, topic, bytes).outcome) << topic;
    }
    EXPECT_EQ(Outcome::DROPPED, server.receive(12345, protocol::TOPIC_CHANGE_RECORD,
                                               protocol::makePayloadForSendDelta(change("A", 1, "k")))
                                    .outcome);
    EXPECT_EQ(bad.size() + 1, log.linesStartingWith("SyncServer: dropped a payload").size());
    EXPECT_TRUE(sender.take().empty());
    EXPECT_TRUE(subscriber.take().empty());
    EXPECT_EQ(0u, server.sequenceNumber("app:notes"));
    EXPECT_EQ(0u, server.highestVersionId("app:notes", "A"));

    EXPECT_EQ(Outcome::CHANGE_ACCEPTED, sender.send(change("A", 1, "k")).outcome);
    EXPECT_EQ((Lines{"list 1: A/1 k=1"}), subscriber.take());
}

TEST_P(SyncServerTest, DetachedSessionIsForgottenWithItsSubscriptions) {
    Client writer(server), gone(server);
    gone.subscribe("B", 0);
    gone.take();
    server.detach(gone.id);
    server.detach(gone.id);  // twice: nothing happens
    writer.send(change("A", 1, "k"));
    EXPECT_TRUE(gone.take().empty());
    EXPECT_EQ(Outcome::DROPPED, gone.subscribe("B", 0).outcome);
}

// A change the storage failed to record must not be overtaken in the log by
// the same session's later changes: they wait for the next subscription,
// after which the client sends them all again, in order.
TEST(SyncServerLostChangeTest, LaterChangesOfTheSessionWaitForTheNextSubscription) {
    struct FailingOnce : ts::server::MemoryLogStorage {
        std::optional<Delta> append(const Delta& delta) override {
            if (std::exchange(failNext, false)) throw std::runtime_error("the disk is full");
            return MemoryLogStorage::append(delta);
        }
        bool failNext = true;
    };
    SyncServer server(std::make_unique<FailingOnce>());
    Client writer(server);
    writer.subscribe("w", 0);
    EXPECT_EQ(Outcome::DROPPED, writer.send(change("w", 1, "a")).outcome);
    EXPECT_EQ(Outcome::DROPPED, writer.send(change("w", 2, "b")).outcome);
    EXPECT_EQ(0u, server.sequenceNumber("app:notes"));
    writer.subscribe("w", 0);
    writer.take();
    writer.send(change("w", 1, "a"));
    writer.send(change("w", 2, "b"));
    EXPECT_EQ((Lines{"list 1: w/1 a=1", "list 2: w/2 b=1"}), writer.take());
}

TEST(SqliteLogStorageTest, ReopenedFileServesOnWithItsLogAndRefusesAcceptedChangesAgain) {
    testsupport::TempDir dir;
    {
        SyncServer first(std::make_unique<ts::server::SqliteLogStorage>(dir.file("server.db")));
        Client writer(first);
        writer.send(change("A", 1, "k1"));
        writer.send(change("A", 2, "k2", "s", {7, 0, 8}));
    }
    SyncServer reopened(std::make_unique<ts::server::SqliteLogStorage>(dir.file("server.db")));
    Client writer(reopened);
    EXPECT_EQ(Outcome::CHANGE_ECHOED, writer.send(change("A", 2, "k2")).outcome);
    EXPECT_EQ(3u, writer.send(change("B", 1, "k3")).sequenceNumber);
    Client reader(reopened);
    reader.subscribe("C", 1);
    EXPECT_EQ((std::vector<std::string>{"list 2: A/2 k2=3", "list 3: B/1 k3=1"}), reader.take());
    EXPECT_EQ(2u, reopened.highestVersionId("app:notes", "A"));
}

}  // namespace
