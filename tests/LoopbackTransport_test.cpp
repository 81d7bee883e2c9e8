#include <gtest/gtest.h>

#include <algorithm>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "server/LoopbackTransport.h"
#include "server/SyncServer.h"
#include "tessarine/Protocol.h"

namespace {

namespace ts = lumivale::tessarine;
namespace protocol = lumivale::tessarine::protocol;
using ts::server::FaultRates;
using ts::server::LoopbackTransport;
using ts::server::SyncServer;
using testsupport::waitUntil;
using Delta = ts::SyncProtocol::Delta;
using Direction = LoopbackTransport::Direction;

Delta change(const std::string& clientId, uint64_t versionId, const std::string& key) {
    return {clientId, "app:notes", versionId, key, key, ts::SyncProtocol::DeltaType::SAVE, {1}, 0};
}

ts::SyncProtocol::SubscriptionRequest subscription(const std::string& clientId, uint64_t sequenceNumber) {
    return {"\x01", "app:notes", clientId, sequenceNumber};
}

// Records, in order, every event the transport delivers and the threads it
// delivers them on.
class Recorder {
public:
    explicit Recorder(ts::SyncProtocol& transport) {
        transport.addConnectionEstablishedCallback([this] { record("connected"); });
        transport.addSubscriptionResponseReceivedCallback([this](const ts::SyncProtocol::SubscriptionResponse& r) {
            record("subscribed " + r.collectionName + " " + std::to_string(r.sequenceNumber));
        });
        transport.addDeltaStatusUpdatedCallback([this](const ts::SyncProtocol::DeltaStatusUpdate& update) {
            record("status " + std::to_string(update.delta.versionId) + " " +
                   std::to_string(static_cast<int>(update.status)));
        });
        transport.addDeltaReceivedCallback([this](const std::vector<Delta>& deltas) {
            for (const Delta& d : deltas) {
                record("delta " + d.clientId + "/" + std::to_string(d.versionId) + " @" +
                       std::to_string(d.sequenceNumber));
            }
        });
        transport.addSnapshotReceivedCallback([this](const ts::SyncProtocol::Snapshot& s) {
            record("snapshot @" + std::to_string(s.sequenceNumber) + " objects " + std::to_string(s.objects.size()));
        });
    }

    std::vector<std::string> events() const {
        std::lock_guard<std::mutex> lock(mutex);
        return recorded;
    }
    size_t count(const std::string& event) const {
        auto all = events();
        return static_cast<size_t>(std::count(all.begin(), all.end(), event));
    }
    bool waitFor(size_t eventCount) const {
        return waitUntil([&] { return events().size() >= eventCount; });
    }
    std::set<std::thread::id> threads() const {
        std::lock_guard<std::mutex> lock(mutex);
        return threadIds;
    }

private:
    void record(const std::string& event) {
        std::lock_guard<std::mutex> lock(mutex);
        recorded.push_back(event);
        threadIds.insert(std::this_thread::get_id());
    }

    mutable std::mutex mutex;
    std::vector<std::string> recorded;
    std::set<std::thread::id> threadIds;
};

// A raw client session on the server for the other side of a test.
SyncServer::SessionId peer(SyncServer& server) {
    return server.attach([](std::vector<unsigned char>) {});
}

void peerSends(SyncServer& server, SyncServer::SessionId session, const Delta& delta) {
    ASSERT_EQ(SyncServer::Outcome::CHANGE_ACCEPTED,
              server.receive(session, protocol::TOPIC_CHANGE_RECORD, protocol::makePayloadForSendDelta(delta)).outcome);
}

TEST(LoopbackTransportTest, DeliversEveryEventOnItsOwnThreadAndNothingWhileDown) {
    auto server = std::make_shared<SyncServer>();
    SyncServer::SessionId other = peer(*server);
    auto transport = std::make_shared<LoopbackTransport>(server);
    Recorder recorder(*transport);

    transport->start();
    transport->sendSubscriptionRequest(subscription("A", 0));
    ASSERT_TRUE(recorder.waitFor(3));
    EXPECT_EQ(1, transport->sendDelta(change("A", 1, "k")));
    ASSERT_TRUE(recorder.waitFor(5));
    // A resend of the accepted change is reported SENT again and echoed.
    transport->sendDelta(change("A", 1, "k"));
    ASSERT_TRUE(recorder.waitFor(7));
    EXPECT_EQ((std::vector<std::string>{"connected", "subscribed app:notes 0", "snapshot @0 objects 0", "status 1 2",
                                        "delta A/1 @1", "status 1 2", "delta A/1 @1"}),
              recorder.events());
    std::set<std::thread::id> threads = recorder.threads();
    ASSERT_EQ(1u, threads.size());
    EXPECT_NE(std::this_thread::get_id(), *threads.begin());

    // Held back on the link when the link goes down: never delivered.
    transport->setFaults(Direction::TO_CLIENT, FaultRates{0, 0, 1.0, std::chrono::milliseconds(60000)});
    peerSends(*server, other, change("B", 1, "k1"));
    transport->disconnect();
    EXPECT_FALSE(transport->isConnected());
    EXPECT_EQ(0, transport->sendDelta(change("A", 2, "k2")));
    peerSends(*server, other, change("B", 2, "k3"));
    EXPECT_EQ(3u, server->sequenceNumber("app:notes"));

    transport->setFaults(Direction::TO_CLIENT, FaultRates{});
    transport->connect();
    transport->connect();  // already up: nothing happens
    EXPECT_TRUE(transport->isConnected());
    transport->sendSubscriptionRequest(subscription("C", 0));
    ASSERT_TRUE(recorder.waitFor(10));
    const std::vector<std::string> events = recorder.events();
    EXPECT_EQ((std::vector<std::string>{"connected", "subscribed app:notes 3", "snapshot @3 objects 3"}),
              std::vector<std::string>(events.begin() + 7, events.end()));
}

TEST(LoopbackTransportTest, InjectedFaultsFollowTheSeedKeepTheOrderAndADropTakesTheLinkDown) {
    auto server = std::make_shared<SyncServer>();
    SyncServer::SessionId other = peer(*server);

    auto doubling = std::make_shared<LoopbackTransport>(server, 5);
    Recorder doubled(*doubling);
    doubling->setFaults(Direction::TO_CLIENT, FaultRates{0, 1.0, 0});
    auto slow = std::make_shared<LoopbackTransport>(server, 6);
    Recorder delayed(*slow);
    slow->setFaults(Direction::TO_CLIENT, FaultRates{0, 0, 1.0, std::chrono::milliseconds(3)});
    for (auto* transport : {doubling.get(), slow.get()}) {
        transport->start();
        transport->sendSubscriptionRequest(subscription("A", 0));
    }
    ASSERT_TRUE(doubled.waitFor(4));
    ASSERT_TRUE(delayed.waitFor(3));
    for (uint64_t version = 1; version <= 20; ++version) peerSends(*server, other, change("B", version, "k"));
    ASSERT_TRUE(doubled.waitFor(4 + 40));
    ASSERT_TRUE(delayed.waitFor(3 + 20));
    EXPECT_EQ(2u, doubled.count("snapshot @0 objects 0"));
    for (uint64_t sequence = 1; sequence <= 20; ++sequence) {
        std::string event = "delta B/" + std::to_string(sequence) + " @" + std::to_string(sequence);
        EXPECT_EQ(event, doubled.events()[2 + 2 * sequence]);
        EXPECT_EQ(event, doubled.events()[3 + 2 * sequence]);
        EXPECT_EQ(event, delayed.events()[2 + sequence]);
    }
    EXPECT_EQ(21u, slow->faultCounts().delayed);
    EXPECT_EQ(21u, doubling->faultCounts().duplicated);

    auto lossy = std::make_shared<LoopbackTransport>(server, 7);
    lossy->setFaults(Direction::TO_SERVER, FaultRates{1.0, 0, 0});
    lossy->start();
    lossy->sendDelta(change("A", 1, "k"));
    ASSERT_TRUE(waitUntil([&] { return !lossy->isConnected(); }));
    EXPECT_EQ(1u, lossy->faultCounts().dropped);
    EXPECT_EQ(20u, server->sequenceNumber("app:notes"));

    // The same seed, rates and messages give the same faults; another seed
    // other ones.
    auto faultsFor = [&](uint64_t seed) {
        auto transport = std::make_shared<LoopbackTransport>(server, seed);
        transport->setFaults(Direction::TO_SERVER, FaultRates{0, 0.5, 0.5, std::chrono::milliseconds(1)});
        transport->start();
        for (int i = 0; i < 40; ++i) transport->sendSubscriptionRequest(subscription("S", 0));
        auto counts = transport->faultCounts();
        return std::make_pair(counts.duplicated, counts.delayed);
    };
    auto first = faultsFor(42);
    EXPECT_EQ(first, faultsFor(42));
    EXPECT_NE(first, faultsFor(43));
    EXPECT_GT(first.first, 0u);
    EXPECT_GT(first.second, 0u);
}

}  // namespace
