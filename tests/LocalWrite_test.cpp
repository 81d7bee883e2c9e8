// The local write path as an application meets it: a change reaches the
// transport only after it has committed, in version-id order, and code that
// the store calls (transport, callbacks, indexer) may write through the store
// without hanging it. Each case runs while another thread writes too, under a
// watchdog, so a deadlock fails the test instead of stalling the run.
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include <unistd.h>

#include "FaultyVfs.h"
#include "StoreTestSupport.h"

namespace {

namespace ts = lumivale::tessarine;
using Bytes = std::vector<unsigned char>;
using testsupport::FaultyVfs;
using testsupport::LogCapture;
using testsupport::waitUntil;

const char* const kRefusedWrite =
    "Error while updating object: a change cannot be written from code that the store runs inside its own "
    "transaction (an indexer)";

class LocalWriteTest : public ::testing::Test {
protected:
    // Runs body under a watchdog while another thread writes into "app:others".
    void withWriterAndWatchdog(const std::function<void()>& body) {
        testsupport::runWithWatchdog("a write from code the store calls", std::chrono::seconds(60), [&] {
            std::atomic<bool> stop{false};
            std::atomic<int> written{0};
            std::thread writer([&] {
                for (int i = 0; !stop; ++i) written += others->saveObject("bg-" + std::to_string(i), "s", Bytes{1});
            });
            body();
            waitUntil([&] { return written.load() > 0; });
            stop = true;
            writer.join();
        });
    }

    bool stored(const std::string& key) {
        auto cursor = items->getObject(key);
        return cursor && cursor->step();
    }

    // The versions of one collection's deltas, in the order the transport got them.
    std::vector<uint64_t> sentVersions(const std::string& collection) {
        std::vector<uint64_t> versions;
        for (const auto& delta : s.transport->sentDeltas()) {
            if (delta.collectionName == collection) versions.push_back(delta.versionId);
        }
        return versions;
    }

    FaultyVfs vfs;  // first: the store opens its file through it
    testsupport::TempDir dir;
    testsupport::StoreUnderTest s{dir.file("store.db")};
    std::unique_ptr<ts::Collection> items = s.store->subscribeCollection("app:items");
    std::unique_ptr<ts::Collection> others = s.store->subscribeCollection("app:others");
};

TEST_F(LocalWriteTest, WritesFromTheTransportAndFromCallbacksWorkCompletelyAndKeepVersionOrder) {
    std::atomic<bool> fromSend{false}, fromLocalCallback{false}, fromWorkerCallback{false};
    s.transport->setOnSend([&](const ts::SyncProtocol::Delta& delta) {
        if (delta.primaryKey == "a") fromSend = items->saveObject("from-send", "s", Bytes{2});
    });
    s.store->addDeltaReceivedCallback([&](const std::vector<ts::Delta>& deltas) {
        const ts::Delta& delta = deltas.front();
        if (delta.primaryKey == "b" && delta.status == ts::SyncProtocol::DeltaStatus::PENDING) {
            fromLocalCallback = items->saveObject("from-callback", "s", Bytes{3});
        } else if (delta.primaryKey == "remote") {
            fromWorkerCallback = items->saveObject("from-worker", "s", Bytes{5});
        }
    });
    withWriterAndWatchdog([&] {
        ASSERT_TRUE(items->saveObject("a", "s", Bytes{1}));
        ASSERT_TRUE(items->saveObject("b", "s", Bytes{1}));
        s.transport->onDeltaReceived({testsupport::remoteDelta("app:items", "remote", 1, {4})});
        ASSERT_TRUE(waitUntil([&] { return stored("from-worker"); }));
    });
    EXPECT_TRUE(fromSend && fromLocalCallback && fromWorkerCallback);
    // Each handed over once, after the change being sent when it was made.
    EXPECT_EQ((std::vector<uint64_t>{1, 2, 3, 4, 5}), sentVersions("app:items"));
    for (const char* key : {"a", "b", "from-send", "from-callback", "from-worker", "remote"}) {
        EXPECT_TRUE(stored(key)) << key;
    }
}

TEST_F(LocalWriteTest, WritesFromTheIndexerAreRefusedAtOnceOnLocalSavesAndDeliveries) {
    std::atomic<int> refused{0};
    s.store->setCollectionIndexerFunction([&](const std::string& collection, const std::string& key,
                                              const std::string&, const Bytes&) {
        if (collection == "app:items" && !items->saveObject("from-indexer-" + key, "s", Bytes{1})) ++refused;
        return std::unordered_multimap<std::string, std::string>{};
    });
    LogCapture log;
    withWriterAndWatchdog([&] {
        EXPECT_TRUE(items->saveObject("local", "s", Bytes{1}));
        s.transport->onDeltaReceived({testsupport::remoteDelta("app:items", "remote", 1, {4})});
        ASSERT_TRUE(waitUntil([&] { return stored("remote"); }));
    });
    EXPECT_EQ(2, refused.load());
    auto lines = log.linesStartingWith(kRefusedWrite);
    ASSERT_EQ(2u, lines.size());
    EXPECT_EQ(6, lines[0].priority);
    EXPECT_FALSE(stored("from-indexer-local") || stored("from-indexer-remote"));
    EXPECT_EQ((std::vector<uint64_t>{1}), sentVersions("app:items"));
    s.store->setCollectionIndexerFunction(nullptr);
    EXPECT_TRUE(items->saveObject("after", "s", Bytes{1}));  // the store still works
}

// Most storage failures surface only at COMMIT, after everything the write
// does has run: the change must not have been handed over by then.
TEST_F(LocalWriteTest, WriteWhoseCommitFailsNeverReachesTheTransport) {
    for (FaultyVfs::Fault fault : {FaultyVfs::Fault::IO_ERROR, FaultyVfs::Fault::DISK_FULL}) {
        // The indexer runs inside the write's transaction, after its version
        // id has committed: the next write to disk is the COMMIT.
        s.store->setCollectionIndexerFunction([&](const std::string&, const std::string& key, const std::string&,
                                                  const Bytes&) {
            if (key == "doomed") FaultyVfs::inject(fault);
            return std::unordered_multimap<std::string, std::string>{};
        });
        s.transport->clearSent();
        LogCapture log;
        EXPECT_FALSE(items->saveObject("doomed", "s", Bytes{1}));
        FaultyVfs::inject(FaultyVfs::Fault::NONE);
        EXPECT_EQ(1u, log.linesStartingWith("Error while updating object: ").size());
        EXPECT_TRUE(s.transport->sentDeltas().empty());
        EXPECT_FALSE(stored("doomed"));
        s.transport->onConnectionEstablished();  // nor was it queued for a resend
        for (const auto& delta : s.transport->sentDeltas()) EXPECT_NE("doomed", delta.primaryKey);
        EXPECT_TRUE(items->saveObject("fine", "s", Bytes{1}));
        EXPECT_TRUE(stored("fine"));
    }
}

// Writers on several threads and resends on connection at once: a new
// change must never overtake older ones that a resend has not sent yet.
// Nothing is ever persisted here, so every resend starts at version 1 and
// each collection's versions at the transport run 1, 2, 3... from there.
TEST_F(LocalWriteTest, EachCollectionReachesTheTransportInVersionOrderWhileResendsRun) {
    constexpr int kWriters = 3;
#ifdef TESSARINE_TEST_EMULATED
    constexpr int kWritesEach = 40;
#else
    constexpr int kWritesEach = 150;
#endif
    testsupport::runWithWatchdog("writers racing resends", std::chrono::seconds(120), [&] {
        std::atomic<int> writersDone{0};
        std::vector<std::thread> writers;
        for (int w = 0; w < kWriters; ++w) {
            writers.emplace_back([&, w] {
                for (int i = 0; i < kWritesEach; ++i) {
                    ts::Collection& target = (i % 2 == 0) ? *items : *others;
                    EXPECT_TRUE(target.saveObject(std::to_string(w) + "-" + std::to_string(i), "s", Bytes{1}));
                }
                ++writersDone;
            });
        }
        std::thread connections([&] {
            while (writersDone < kWriters) s.transport->onConnectionEstablished();
        });
        for (auto& writer : writers) writer.join();
        connections.join();
    });
    s.transport->onConnectionEstablished();  // a last, complete resend
    for (const char* collection : {"app:items", "app:others"}) {
        std::vector<uint64_t> versions = sentVersions(collection);
        uint64_t previous = 0;
        for (size_t i = 0; i < versions.size(); ++i) {
            ASSERT_TRUE(versions[i] == previous + 1 || versions[i] == 1)
                << collection << ": version " << versions[i] << " after " << previous << " at " << i;
            previous = versions[i];
        }
        EXPECT_EQ(kWriters * kWritesEach / 2, static_cast<int>(previous)) << collection;
    }
}

// Transports hold back what other threads send while they report a
// connection, so the resend goes out on the reporting thread, once a change
// another thread is handing over has gone: else that change could reach the
// server ahead of older ones of its object that the last connection lost.
TEST_F(LocalWriteTest, ConnectionReportedDuringAHandoverWaitsForItAndResendsOnTheReportingThread) {
    std::atomic<pid_t> reporter{0};
    std::atomic<bool> handing{false}, reported{false}, reportedDuringHandover{false};
    std::atomic<int> sentByReporter{0};
    s.transport->setOnSend([&](const ts::SyncProtocol::Delta&) {
        if (::gettid() == reporter) {
            ++sentByReporter;
            return;
        }
        handing = true;
        // Until the report has returned (wrong) or waits for this handover.
        waitUntil([&] { return reported || (reporter != 0 && testsupport::isThreadAsleep(reporter)); });
        reportedDuringHandover = reported.load();
    });
    testsupport::runWithWatchdog("a connection reported during a handover", std::chrono::seconds(60), [&] {
        std::thread writer([&] { EXPECT_TRUE(items->saveObject("a", "s", Bytes{1})); });
        ASSERT_TRUE(waitUntil([&] { return handing.load(); }));
        reporter = ::gettid();
        s.transport->onConnectionEstablished();
        reported = true;
        writer.join();
    });
    EXPECT_FALSE(reportedDuringHandover);
    EXPECT_EQ(1, sentByReporter.load());
}

}  // namespace
