#include <gtest/gtest.h>

#include <functional>
#include <mutex>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "tessarine/SyncProtocol.h"

using lumivale::tessarine::SyncProtocol;
using Calls = std::vector<std::string>;

namespace {

// Records the entry points that the two trigger operations reach, then
// delivers as usual. Not for several threads.
class Transport : public SyncProtocol {
public:
    void start() override {}
    void sendSubscriptionRequest(const SubscriptionRequest&) override {}
    int sendDelta(const Delta&) override { return 0; }
    void sendSnapshotRequest(const std::string&, const std::string&) override {}
    void onDeltaReceived(const std::vector<Delta>& deltas) override {
        calls.push_back("entry deltas");
        SyncProtocol::onDeltaReceived(deltas);
    }
    void onDeltaStatusUpdated(const DeltaStatusUpdate& update) override {
        calls.push_back("entry status");
        SyncProtocol::onDeltaStatusUpdated(update);
    }
    Calls calls;
};

}  // namespace

TEST(SyncProtocolTest, EachRegistryNumbersFromOneDeliversOnlyItsOwnEventAndTriggersReachOverrides) {
    Transport transport;
    transport.onConnectionEstablished();  // nothing registered: nothing happens
    Calls& calls = transport.calls;
    std::vector<SyncProtocol::Delta> deltas(2);
    for (int id = 1; id <= 2; ++id) {
        EXPECT_EQ(id, transport.addConnectionEstablishedCallback([&] { calls.push_back("connected"); }));
        EXPECT_EQ(id, transport.addSubscriptionResponseReceivedCallback([&](auto&) { calls.push_back("response"); }));
        EXPECT_EQ(id, transport.addDeltaReceivedCallback(
                          [&](auto& d) { calls.push_back(&d == &deltas ? "deltas" : "copy"); }));
        EXPECT_EQ(id, transport.addDeltaStatusUpdatedCallback([&](auto&) { calls.push_back("status"); }));
        EXPECT_EQ(id, transport.addSnapshotReceivedCallback([&](auto&) { calls.push_back("snapshot"); }));
    }
    transport.onConnectionEstablished();
    transport.onSubscriptionResponseReceived({});
    transport.triggerDeltaReceivedCallbacks(deltas);  // passed on by reference, not copied
    transport.triggerDeltaStatusUpdatedCallbacks({});
    transport.onSnapshotReceived({});
    EXPECT_EQ((Calls{"connected", "connected", "response", "response", "entry deltas", "deltas", "deltas",
                     "entry status", "status", "status", "snapshot", "snapshot"}),
              calls);

    // As the store does with a snapshot: a callback delivers into another registry.
    calls.clear();
    transport.addSnapshotReceivedCallback([&](auto&) { transport.triggerDeltaStatusUpdatedCallbacks({}); });
    transport.onSnapshotReceived({});
    EXPECT_EQ((Calls{"snapshot", "snapshot", "entry status", "status", "status"}), calls);
}

TEST(SyncProtocolTest, ThrowingOrEmptyCallbackEndsDeliveryAndRemovalKeepsOrderWithoutReusingIds) {
    Transport transport;
    std::vector<int> calls;
    bool fail = true;
    transport.addConnectionEstablishedCallback([&] { calls.push_back(1); });
    int second = transport.addConnectionEstablishedCallback([&] {
        if (fail) throw std::runtime_error("callback failed");
        calls.push_back(2);
    });
    transport.addConnectionEstablishedCallback([&] { calls.push_back(3); });
    EXPECT_THROW(transport.onConnectionEstablished(), std::runtime_error);
    fail = false;
    transport.onConnectionEstablished();  // the next delivery calls all again
    int empty = transport.addConnectionEstablishedCallback(SyncProtocol::ConnectionEstablishedCallback());
    EXPECT_THROW(transport.onConnectionEstablished(), std::bad_function_call);
    transport.removeConnectionEstablishedCallback(empty);  // the list lock was released
    transport.removeConnectionEstablishedCallback(second);
    transport.removeConnectionEstablishedCallback(second);
    transport.removeConnectionEstablishedCallback(99);
    EXPECT_EQ(5, transport.addConnectionEstablishedCallback([&] { calls.push_back(5); }));
    transport.onConnectionEstablished();
    EXPECT_EQ((std::vector<int>{1, 1, 2, 3, 1, 2, 3, 1, 3, 5}), calls);
}

TEST(SyncProtocolTest, ConcurrentAddRemoveAndDeliveryFromSeveralThreadsIsRaceFree) {
    constexpr int kThreads = 4, kRounds = 200;
    Transport transport;
    std::mutex mutex;
    std::set<int> ids;
    int delivered = 0;  // only callbacks touch it, serialised by the list lock
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i < kRounds; ++i) {
                int id = transport.addSnapshotReceivedCallback([&](const auto&) { ++delivered; });
                transport.onSnapshotReceived({});
                transport.removeSnapshotReceivedCallback(id);
                std::lock_guard<std::mutex> lock(mutex);
                ids.insert(id);
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(static_cast<size_t>(kThreads * kRounds), ids.size());
    EXPECT_EQ(kThreads * kRounds, *ids.rbegin());  // 1 ... n, each once
    EXPECT_GE(delivered, kThreads * kRounds);      // each delivery reaches at least its own callback
    int before = delivered;
    transport.onSnapshotReceived({});  // every callback is gone
    EXPECT_EQ(before, delivered);
}
