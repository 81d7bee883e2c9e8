// The store's components wired together as the store instance wires them,
// on a database file in a fresh temporary directory, with a FakeTransport.
// Tests reach every component directly.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "FakeTransport.h"
#include "TestSupport.h"
#include "sqlite/Database.h"
#include "tessarine/CallbackManager.h"
#include "tessarine/CollectionIndexStorage.h"
#include "tessarine/CollectionObjectStorage.h"
#include "tessarine/CollectionStorage.h"
#include "tessarine/Cursor.h"
#include "tessarine/DeltaHandler.h"
#include "tessarine/DeltaQueue.h"
#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/LibraryMetadata.h"
#include "tessarine/Lifecycle.h"
#include "tessarine/SerializedJobQueue.h"
#include "tessarine/SnapshotConsumer.h"
#include "tessarine/SubscriptionManager.h"
#include "tessarine/SubscriptionStorage.h"
#include "tessarine/Tessarine.h"
#include "tessarine/VersionIdGenerator.h"
#include "tessarine/VersionVectorStorage.h"

namespace testsupport {

namespace ts = lumivale::tessarine;

class PipelineFixture : public ::testing::Test {
protected:
    using Delta = ts::SyncProtocol::Delta;
    using Status = ts::SyncProtocol::DeltaStatus;

    // Builds every component; a test that needs a special storage sets db
    // and deltaQueueStorage before calling it.
    void build() {
        if (!db) db = ts::Tessarine::createSqliteDatabase(path, {});
        versionVectorStorage = std::make_shared<ts::VersionVectorStorage>(db);
        subscriptionStorage = std::make_shared<ts::SubscriptionStorage>(db);
        if (!deltaQueueStorage) deltaQueueStorage = std::make_shared<ts::DeltaQueueStorage>(db);
        metadata = std::make_shared<ts::LibraryMetadata>(std::make_shared<ts::LibraryMetadataStorage>(db));
        clientId = metadata->getClientUuid();
        subscriptionManager = std::make_shared<ts::SubscriptionManager>(db, transport, subscriptionStorage, metadata);
        versionIdGenerator = std::make_shared<ts::VersionIdGenerator>(db);
        callbackManager = std::make_shared<ts::CallbackManager>();
        collectionStorage = std::make_shared<ts::CollectionStorage>(
            db, callbackManager, std::make_shared<ts::CollectionIndexStorage>(db),
            std::make_shared<ts::CollectionObjectStorage>(db), versionIdGenerator);
        lifecycle = std::make_shared<ts::Lifecycle>();
        jobQueue = std::make_shared<ts::SerializedJobQueue>(
            threadCreator, ts::ExponentialBackoff<std::chrono::milliseconds>{std::chrono::milliseconds(1),
                                                                             std::chrono::milliseconds(20), 2,
                                                                             std::chrono::milliseconds(1)});
        deltaQueue = std::make_shared<ts::DeltaQueue>(db, lifecycle, deltaQueueStorage, jobQueue, transport, clientId);
        deltaHandler = std::make_shared<ts::DeltaHandler>(db, callbackManager, collectionStorage, deltaQueue, lifecycle,
                                                          transport, jobQueue, subscriptionManager,
                                                          versionVectorStorage, clientId);
        snapshotConsumer = std::make_shared<ts::SnapshotConsumer>(deltaQueueStorage, transport, subscriptionManager);
        callbackManager->addDeltaReceivedCallback([this](const std::vector<ts::Delta>& deltas) {
            std::lock_guard<std::mutex> lock(receivedMutex);
            for (const auto& d : deltas) received.push_back(d);
        });
    }

    // Releases the components in the store's destruction order.
    void tearDownComponents() {
        snapshotConsumer.reset();
        lifecycle.reset();
        deltaQueue.reset();
        deltaHandler.reset();
        jobQueue.reset();
        callbackManager.reset();
        collectionStorage.reset();
        versionIdGenerator.reset();
        subscriptionManager.reset();
        metadata.reset();
        versionVectorStorage.reset();
        subscriptionStorage.reset();
        deltaQueueStorage.reset();
        db.reset();
    }

    void TearDown() override { tearDownComponents(); }

    // A local write as a collection handle makes it.
    Delta localSave(const std::string& collection, const std::string& key, std::vector<unsigned char> blob = {7}) {
        collectionStorage->ensureTableExistsForCollection(collection);
        Delta delta;
        delta.collectionName = collection;
        delta.versionId = collectionStorage->incrementAndGetVersionId(collection);
        delta.type = ts::SyncProtocol::DeltaType::SAVE;
        delta.primaryKey = key;
        delta.sortKey = "s-" + key;
        delta.blob = std::move(blob);
        deltaHandler->addLocalDelta(delta);
        return delta;
    }

    Delta remoteSave(const std::string& collection, const std::string& key, uint64_t sequenceNumber,
                     std::vector<unsigned char> blob = {9}) {
        Delta delta;
        delta.clientId = "OTHERCLIENT";
        delta.collectionName = collection;
        delta.versionId = sequenceNumber;
        delta.type = ts::SyncProtocol::DeltaType::SAVE;
        delta.primaryKey = key;
        delta.sortKey = "r-" + key;
        delta.blob = std::move(blob);
        delta.sequenceNumber = sequenceNumber;
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

    std::vector<ts::Delta> receivedDeltas() {
        std::lock_guard<std::mutex> lock(receivedMutex);
        return received;
    }

    TempDir dir;
    std::string path = dir.file("store.db");
    std::shared_ptr<FakeTransport> transport = std::make_shared<FakeTransport>();
    std::shared_ptr<CountingThreadCreator> threadCreator = std::make_shared<CountingThreadCreator>();
    std::shared_ptr<lumivale::sqlite::Database> db;
    std::shared_ptr<ts::VersionVectorStorage> versionVectorStorage;
    std::shared_ptr<ts::SubscriptionStorage> subscriptionStorage;
    std::shared_ptr<ts::DeltaQueueStorage> deltaQueueStorage;
    std::shared_ptr<ts::LibraryMetadata> metadata;
    std::string clientId;
    std::shared_ptr<ts::SubscriptionManager> subscriptionManager;
    std::shared_ptr<ts::VersionIdGenerator> versionIdGenerator;
    std::shared_ptr<ts::CallbackManager> callbackManager;
    std::shared_ptr<ts::CollectionStorage> collectionStorage;
    std::shared_ptr<ts::Lifecycle> lifecycle;
    std::shared_ptr<ts::SerializedJobQueue> jobQueue;
    std::shared_ptr<ts::DeltaQueue> deltaQueue;
    std::shared_ptr<ts::DeltaHandler> deltaHandler;
    std::shared_ptr<ts::SnapshotConsumer> snapshotConsumer;
    std::mutex receivedMutex;
    std::vector<ts::Delta> received;
};

}  // namespace testsupport
