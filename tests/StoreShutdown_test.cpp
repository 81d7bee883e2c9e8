// Destroying the store, and then the last collection handle, while the
// transport keeps delivering from several threads and the application keeps
// writing: nothing hangs, nothing runs on a destroyed component, and every
// acknowledged write is in the file afterwards.
#include <gtest/gtest.h>

#include <atomic>
#include <cstdio>
#include <condition_variable>
#include <functional>
#include <map>
#include <set>
#include <thread>

#include "StoreTestSupport.h"

namespace {

namespace ts = lumivale::tessarine;
using Bytes = std::vector<unsigned char>;

// A transport that only counts what it is asked to send.
class CountingTransport : public ts::SyncProtocol {
public:
    void start() override {}
    void sendSubscriptionRequest(const SubscriptionRequest&) override { ++subscriptions; }
    int sendDelta(const Delta&) override { return ++deltas; }
    void sendSnapshotRequest(const std::string&, const std::string&) override {}
    std::atomic<int> subscriptions{0};
    std::atomic<int> deltas{0};
};

// How many batches of each kind the application's callback has heard, and
// a way to wait for the next one. Delivering threads wait here before they
// deliver again, so that the worker's queue never runs away from it; once
// the components are gone nothing is heard any more and they stop waiting.
class Progress {
public:
    void heard(const std::vector<ts::Delta>& deltas) {
        std::lock_guard<std::mutex> lock(mutex);
        for (const ts::Delta& delta : deltas) ++count[delta.primaryKey.substr(0, delta.primaryKey.find('-'))];
        changed.notify_all();
    }
    int of(const std::string& kind) {
        std::lock_guard<std::mutex> lock(mutex);
        return count[kind];
    }
    void waitFor(const std::string& kind, int atLeast) {
        std::unique_lock<std::mutex> lock(mutex);
        changed.wait(lock, [&] { return count[kind] >= atLeast || released.count(kind) != 0; });
    }
    // Nothing of this kind will be heard any more: waiting for it ends.
    void release(const std::string& kind) {
        std::lock_guard<std::mutex> lock(mutex);
        released.insert(kind);
        changed.notify_all();
    }

private:
    std::mutex mutex;
    std::condition_variable changed;
    std::map<std::string, int> count;  // by key prefix: "remote", "snap", "main", "writer"
    std::set<std::string> released;
};

// Ends and joins the test's threads also when an assertion leaves early.
class ThreadsGuard {
public:
    explicit ThreadsGuard(std::function<void()> theStopAll) : stopAll(std::move(theStopAll)) {}
    ~ThreadsGuard() {
        stopAll();
        for (std::thread& thread : threads) {
            if (thread.joinable()) thread.join();
        }
    }
    std::vector<std::thread> threads;

private:
    std::function<void()> stopAll;
};

TEST(StoreShutdownTest, DestroyingStoreThenLastHandleWhileTransportDeliversAndAppWritesIsSafe) {
    testsupport::TempDir dir;
    const std::string path = dir.file("store.db");
    std::map<std::string, Bytes> acknowledged;
    std::mutex acknowledgedMutex;
    auto acknowledge = [&](const std::string& key, const Bytes& blob) {
        std::lock_guard<std::mutex> lock(acknowledgedMutex);
        acknowledged[key] = blob;
    };

    // Connections come by the thousand: keep their progress notes out of the
    // test's output, but count warnings and errors, of which there must be
    // none.
    std::atomic<int> warnings{0};
    lumivale::setLogSink([&](int priority, const std::string&, const std::string& message) {
        if (priority < 5) return;
        ++warnings;
        std::fprintf(stderr, "%d %s\n", priority, message.c_str());
    });
    testsupport::runWithWatchdog("store shutdown under load", std::chrono::seconds(120), [&] {
        Progress progress;  // outlives the store, whose worker reports to it
        auto transport = std::make_shared<CountingTransport>();
        auto store = ts::Tessarine::open(path, transport, std::make_shared<testsupport::CountingThreadCreator>());
        ASSERT_TRUE(store);
        store->addDeltaReceivedCallback([&](const std::vector<ts::Delta>& deltas) { progress.heard(deltas); });
        auto mainHandle = store->subscribeCollection("app:items");
        auto writerHandle = store->subscribeCollection("app:items");
        ASSERT_TRUE(mainHandle && writerHandle && store->subscribeCollection("app:remote"));
        store->start();
        std::atomic<bool> stopDelivering{false};
        std::atomic<bool> stopWriting{false};
        ThreadsGuard guard([&] {
            stopWriting = true;
            stopDelivering = true;
            for (const char* kind : {"remote", "snap"}) progress.release(kind);
        });

        // Another client's changes, each with a status notice for one of
        // our own changes in front of it.
        guard.threads.emplace_back([&] {
            for (int i = 1; !stopDelivering; ++i) {
                ts::SyncProtocol::Delta own;
                own.collectionName = "app:items";
                own.versionId = static_cast<uint64_t>(i % 50 + 1);
                transport->onDeltaStatusUpdated(
                    {own, i % 3 ? ts::SyncProtocol::DeltaStatus::SENT : ts::SyncProtocol::DeltaStatus::PERSISTED});
                transport->onDeltaReceived({testsupport::remoteDelta(
                    "app:remote", "remote-" + std::to_string(i % 10), static_cast<uint64_t>(i),
                    {static_cast<unsigned char>(i)})});
                progress.waitFor("remote", i);
            }
        });
        // Connections (each resends the queue) and snapshots that cover some
        // of our own changes.
        guard.threads.emplace_back([&] {
            for (int i = 1; !stopDelivering; ++i) {
                transport->onConnectionEstablished();
                ts::SyncProtocol::Snapshot snapshot;
                snapshot.collectionName = "app:items";
                snapshot.objects = {{"snap-" + std::to_string(i % 4), "s", Bytes{1, 2}}};
                snapshot.sequenceNumber = static_cast<uint64_t>(i);
                snapshot.versionId = static_cast<uint64_t>(i % 20);
                transport->onSnapshotReceived(snapshot);
                progress.waitFor("snap", i);
            }
        });
        // An application thread that writes through a handle of its own and
        // destroys it last, while the transport still delivers.
        std::atomic<int> writerSaves{0};
        guard.threads.emplace_back([&, handle = std::move(writerHandle)]() mutable {
            for (int i = 0; !stopWriting; ++i) {
                Bytes blob{static_cast<unsigned char>(i), static_cast<unsigned char>(i >> 8), 7};
                std::string key = "writer-" + std::to_string(i % 40);
                EXPECT_TRUE(handle->saveObject(key, "w", blob)) << key;
                acknowledge(key, blob);
                ++writerSaves;
            }
            handle.reset();  // the last holder: the components and the worker go here
            progress.release("remote");
        });
        auto mainSaves = [&](int from, int to) {
            for (int i = from; i < to; ++i) {
                Bytes blob{static_cast<unsigned char>(i), 1};
                std::string key = "main-" + std::to_string(i);
                ASSERT_TRUE(mainHandle->saveObject(key, "m", blob));
                acknowledge(key, blob);
            }
        };

        mainSaves(0, 20);
        ASSERT_TRUE(testsupport::waitUntil([&] { return progress.of("remote") >= 20 && progress.of("snap") >= 5; }));
        store.reset();
        progress.release("snap");  // the snapshot consumer went with the store
        // The handles keep the other components and the worker alive.
        mainSaves(20, 40);
        const int remoteBefore = progress.of("remote");
        EXPECT_TRUE(testsupport::waitUntil([&] { return progress.of("remote") >= remoteBefore + 10; }));
        mainHandle.reset();
        ASSERT_TRUE(testsupport::waitUntil([&] { return writerSaves.load() >= 40; }));
        stopWriting = true;
        guard.threads[2].join();
        // The transport outlives the store: its events now reach no one.
        transport->onConnectionEstablished();
        transport->onDeltaReceived({});
        transport->onSnapshotReceived({});
    });

    lumivale::setLogSink(nullptr);
    EXPECT_EQ(0, warnings.load());

    testsupport::StoreUnderTest reopened(path);
    auto items = reopened.store->subscribeCollection("app:items");
    ASSERT_TRUE(items);
    for (const auto& [key, blob] : acknowledged) {
        auto cursor = items->getObject(key);
        ASSERT_TRUE(cursor && cursor->step()) << key << " was acknowledged but is gone";
        auto stored = cursor->getBlob();
        EXPECT_EQ(blob, Bytes(stored.first, stored.first + stored.second)) << key;
    }
}

}  // namespace
