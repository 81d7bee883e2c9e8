#include <gtest/gtest.h>

#include "StoreTestSupport.h"
#include "server/LoopbackTransport.h"
#include "server/SyncServer.h"

namespace {

using lumivale::tessarine::Tessarine;
using testsupport::LogCapture;
using testsupport::StoreUnderTest;
using testsupport::TempDir;

TEST(TessarineTest, StartAndInvalidNamesAndIdentityAcrossReopen) {
    TempDir dir;
    StoreUnderTest first(dir.file("one.db"));
    EXPECT_EQ(0, first.transport->starts.load());
    EXPECT_EQ(1, first.threadCreator->created.load());
    first.store->start();
    EXPECT_EQ(1, first.transport->starts.load());

    LogCapture log;
    EXPECT_FALSE(first.store->subscribeCollection("not valid"));
    EXPECT_EQ(1u, log.linesStartingWith("Error subscribing to a collection: Invalid collection name.").size());
    EXPECT_TRUE(first.transport->sentEvents().empty());

    ASSERT_TRUE(first.store->subscribeCollection("app:items"));
    std::string id = first.transport->sentSubscriptions().at(0).clientId;
    StoreUnderTest second(dir.file("two.db"));
    second.store->subscribeCollection("app:items");
    EXPECT_NE(id, second.transport->sentSubscriptions().at(0).clientId);
    first.store.reset();
    StoreUnderTest reopened(dir.file("one.db"));
    reopened.store->subscribeCollection("app:items");
    EXPECT_EQ(id, reopened.transport->sentSubscriptions().at(0).clientId);
}

TEST(TessarineTest, HandleOutlivesStoreAndTransportOutlivesBoth) {
    TempDir dir;
    StoreUnderTest s(dir.file("store.db"));
    auto items = s.store->subscribeCollection("app:items");
    s.store.reset();

    // The handle keeps the components, the connection and the worker alive.
    EXPECT_TRUE(items->saveObject("local", "s", std::vector<unsigned char>{1}));
    const auto remote = testsupport::remoteDelta("app:items", "remote", 1);
    s.transport->onDeltaReceived({remote});
    ASSERT_TRUE(testsupport::waitUntil([&] { return s.heard.size() == 2; }));
    EXPECT_EQ(2u, testsupport::rows(items->query("", -1, lumivale::tessarine::CollectionStorage::SortDirection::ASCENDING))
                      .size());

    items.reset();
    s.transport->clearSent();
    LogCapture log;
    s.transport->onConnectionEstablished();
    s.transport->onDeltaReceived({remote});
    s.transport->onDeltaStatusUpdated({remote, lumivale::tessarine::SyncProtocol::DeltaStatus::SENT});
    s.transport->onSnapshotReceived({});
    s.transport->onSubscriptionResponseReceived({});
    EXPECT_TRUE(s.transport->sentEvents().empty());
    EXPECT_TRUE(log.linesStartingWith("SubscriptionManager::onConnectionEstablished").empty());
    EXPECT_EQ(2u, s.heard.size());

    // The next store on the same transport is the only one it reaches: it
    // resubscribes, then resends what is queued.
    s.store = Tessarine::open(dir.file("store.db"), s.transport, s.threadCreator);
    ASSERT_TRUE(s.store);
    s.transport->onConnectionEstablished();
    EXPECT_EQ((std::vector<std::string>{"subscribe app:items", "delta app:items/1"}), s.transport->sentEvents());
}

// The metrics follow the queue through the whole round trip: it grows while
// offline and empties once the server has persisted every change, again
// after a reconnection.
TEST(TessarineTest, SyncMetricsCountQueuedChangesOfflineAndFallToZeroOncePersisted) {
    TempDir dir;
    auto server = std::make_shared<lumivale::tessarine::server::SyncServer>();
    auto transport = std::make_shared<lumivale::tessarine::server::LoopbackTransport>(server, 1);
    auto store = Tessarine::open(dir.file("metrics.db"), transport, std::make_shared<testsupport::CountingThreadCreator>());
    ASSERT_TRUE(store);
    auto notes = store->subscribeCollection("app:notes");
    for (const char* key : {"a", "b", "c"}) ASSERT_TRUE(notes->saveObject(key, key, std::vector<unsigned char>{1}));
    auto offline = store->getSyncMetrics();  // not started: never connected
    ASSERT_TRUE(offline);
    EXPECT_EQ(3u, offline->queuedPending);
    EXPECT_EQ(0u, offline->connections);
    EXPECT_FALSE(offline->lastPersisted);

    auto persisted = [&](uint64_t connections) {
        return testsupport::waitUntil([&] {
            auto m = store->getSyncMetrics();
            return m->queuedChanges() == 0 && m->lastPersisted && m->connections == connections && m->waitingJobs == 0;
        });
    };
    store->start();
    ASSERT_TRUE(persisted(1));
    auto first = *store->getSyncMetrics()->lastPersisted;
    EXPECT_FALSE(store->getSyncMetrics()->retrying);

    transport->disconnect();
    ASSERT_TRUE(notes->saveObject("d", "d", std::vector<unsigned char>{2}));
    EXPECT_EQ(1u, store->getSyncMetrics()->queuedChanges());
    transport->connect();
    ASSERT_TRUE(persisted(2));
    EXPECT_LE(first, *store->getSyncMetrics()->lastPersisted);
    EXPECT_EQ(4u, server->objects("app:notes").size());
}

}  // namespace
