// The store's components, wired by the store's own buildStoreComponents, on
// a database file in a fresh temporary directory, with a FakeTransport.
// Tests reach every component directly.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "FakeTransport.h"
#include "StoreTestSupport.h"
#include "TestSupport.h"
#include "sqlite/Database.h"
#include "tessarine/CallbackManager.h"
#include "tessarine/CollectionStorage.h"
#include "tessarine/Cursor.h"
#include "tessarine/DeltaHandler.h"
#include "tessarine/DeltaQueue.h"
#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/Lifecycle.h"
#include "tessarine/SerializedJobQueue.h"
#include "tessarine/SnapshotConsumer.h"
#include "tessarine/StoreComponents.h"
#include "tessarine/SubscriptionManager.h"
#include "tessarine/Tessarine.h"
#include "tessarine/VersionIdGenerator.h"
#include "tessarine/VersionVectorStorage.h"

namespace testsupport {

namespace ts = lumivale::tessarine;

// The components are the fixture's own members (database, deltaHandler,
// jobQueue, ...), built by the store's own wiring.
class PipelineFixture : public ::testing::Test, protected ts::StoreComponents {
protected:
    using Delta = ts::SyncProtocol::Delta;
    using Status = ts::SyncProtocol::DeltaStatus;

    // Builds every component; a test that needs a special storage sets
    // database and deltaQueueStorage before calling it. The worker retries a
    // failing job after 1 to 20 ms instead of the store's longer pauses.
    void build() {
        if (!database) database = ts::Tessarine::createSqliteDatabase(path, {});
        using std::chrono::milliseconds;
        components() = ts::buildStoreComponents(transport, threadCreator, database, deltaQueueStorage,
                                                {milliseconds(1), milliseconds(20), 2, milliseconds(1)});
        callbackManager->addDeltaReceivedCallback([this](const std::vector<ts::Delta>& deltas) { heard.add(deltas); });
    }

    // Releases the components in the store's destruction order.
    void TearDown() override { ts::StoreComponents released(std::move(components())); }

    // A local write as a collection handle makes it.
    Delta localSave(const std::string& collection, const std::string& key, std::vector<unsigned char> blob = {7}) {
        collectionStorage->ensureTableExistsForCollection(collection);
        Delta delta;
        delta.collectionName = collection;
        delta.type = ts::SyncProtocol::DeltaType::SAVE;
        delta.primaryKey = key;
        delta.sortKey = "s-" + key;
        delta.blob = std::move(blob);
        delta.versionId = deltaHandler->addLocalDeltaWithNextVersionId(delta);
        return delta;
    }

    // Status and blob of an object, or status 0 when it has no row.
    std::pair<int, std::vector<unsigned char>> object(const std::string& collection, const std::string& key) {
        auto cursor = collectionStorage->getObject(collection, key);
        if (!cursor->step()) return {0, {}};
        auto blob = cursor->getBlob();
        return {cursor->getStatus(), std::vector<unsigned char>(blob.first, blob.first + blob.second)};
    }

    // Waits until every job posted so far has run.
    void drainJobs() {
        std::atomic<bool> done{false};
        jobQueue->addJob({[&done] { done = true; }});
        ASSERT_TRUE(waitUntil([&] { return done.load(); }));
    }

    ts::StoreComponents& components() { return *this; }

    TempDir dir;
    std::string path = dir.file("store.db");
    std::shared_ptr<FakeTransport> transport = std::make_shared<FakeTransport>();
    std::shared_ptr<CountingThreadCreator> threadCreator = std::make_shared<CountingThreadCreator>();
    HeardDeltas heard;  // every change reported to the application, in order
};

}  // namespace testsupport
