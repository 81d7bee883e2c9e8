// Kills a writing store process with SIGKILL at random moments, many times on
// one database file, and checks after each kill, in a fresh store on the
// same file, that nothing the store acknowledged was lost or duplicated.
#include <gtest/gtest.h>

#include <chrono>
#include <map>
#include <random>
#include <thread>

#include "ChildProcess.h"
#include "CrashJournal.h"
#include "StoreTestSupport.h"

#ifndef TESSARINE_CRASH_WRITER
#error "TESSARINE_CRASH_WRITER must name the crash writer program"
#endif

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define TESSARINE_TEST_SANITIZED 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define TESSARINE_TEST_SANITIZED 1
#endif
#endif

namespace {

namespace ts = lumivale::tessarine;
using Direction = ts::CollectionStorage::SortDirection;
using testsupport::Journal;
using testsupport::JournalWrite;
using testsupport::StoredObject;

#if defined(TESSARINE_TEST_SANITIZED) || defined(TESSARINE_TEST_EMULATED)
constexpr int kCycles = 30;  // every process runs several times slower
#else
constexpr int kCycles = 60;
#endif

// A local change that the store must still hold in its queue, as the store
// resends it (no client id, no sequence number).
using QueuedChange = ts::SyncProtocol::Delta;

QueuedChange changeOf(const JournalWrite& write, uint64_t versionId) {
    return {"", write.collection, versionId, write.primaryKey, write.sortKey,
            write.isSave ? ts::SyncProtocol::DeltaType::SAVE : ts::SyncProtocol::DeltaType::DELETE,
            write.isSave ? testsupport::journalBlob(write.blobSeed, write.blobSize) : std::vector<unsigned char>(), 0};
}

bool sameChange(const QueuedChange& expected, const ts::SyncProtocol::Delta& sent) {
    return expected.collectionName == sent.collectionName && expected.primaryKey == sent.primaryKey &&
           expected.type == sent.type && expected.sortKey == sent.sortKey && expected.blob == sent.blob;
}

// What the file must hold: every committed local change still queued, in
// order, and the objects those changes produced.
class ExpectedStore {
public:
    void commit(const QueuedChange& change) {
        highestVersionId[change.collectionName] = change.versionId;
        queue.push_back(change);
        auto key = std::make_pair(change.collectionName, change.primaryKey);
        if (change.type == ts::SyncProtocol::DeltaType::SAVE) {
            objects[key] = {change.sortKey, change.blob, 0};
        } else {
            objects.erase(key);
        }
    }

    uint64_t highest(const std::string& collection) const {
        auto found = highestVersionId.find(collection);
        return found == highestVersionId.end() ? 0 : found->second;
    }

    // The objects of a collection as the store must show them: PENDING
    // while a change of the object is queued, PERSISTED otherwise.
    std::map<std::string, StoredObject> objectsOf(const std::string& collection) const {
        std::map<std::string, StoredObject> result;
        for (const auto& [key, object] : objects) {
            if (key.first != collection) continue;
            StoredObject shown = object;
            shown.status = 3;
            for (const QueuedChange& change : queue) {
                if (change.collectionName == collection && change.primaryKey == key.second) shown.status = 1;
            }
            result[key.second] = shown;
        }
        return result;
    }

    std::vector<QueuedChange> queue;
    uint64_t remoteSequenceNumber = 0;

private:
    std::map<std::pair<std::string, std::string>, StoredObject> objects;
    std::map<std::string, uint64_t> highestVersionId;
};

std::map<std::string, StoredObject> readObjects(ts::Collection& collection) {
    return testsupport::storedObjects(collection.query("", -1, Direction::ASCENDING));
}

class CrashDurabilityTest : public ::testing::Test {
protected:
    // Reopens the file after a kill and checks it against the journal; the
    // writes the store committed become part of `expected`.
    void verifyAfterKill(const Journal& journal, int cycle) {
        testsupport::StoreUnderTest s(path);
        ASSERT_TRUE(s.store) << "the file cannot be opened after the kill";
        s.store->setCollectionIndexerFunction(testsupport::journalIndexer);
        std::map<std::string, std::unique_ptr<ts::Collection>> handles;
        for (const char* name : {"crash:notes", "crash:tasks", "crash:remote"}) handles[name] = s.store->subscribeCollection(name);
        for (auto& handle : handles) ASSERT_TRUE(handle.second);
        const std::string clientId = s.transport->sentSubscriptions().at(0).clientId;

        s.transport->onConnectionEstablished();
        checkResendAndCommit(journal, s.transport->sentDeltas(), clientId);
        if (HasFatalFailure()) return;
        for (const char* name : testsupport::kJournalCollections) checkObjects(*handles[name], name);
        checkRemoteBatch(*s.transport, *handles["crash:remote"]);

        // The next local write continues the version ids of the collection.
        ASSERT_TRUE(handles["crash:notes"]->saveObject("k0", "parent", testsupport::journalBlob(cycle, 10)));
        uint64_t next = s.transport->sentDeltas().back().versionId;
        EXPECT_GT(next, expected.highest("crash:notes")) << "a version id was used twice";
        JournalWrite parentWrite{"crash:notes", "k0", true, "parent", static_cast<uint32_t>(cycle), 10, {}, false};
        expected.commit(changeOf(parentWrite, next));

        // Every third cycle the server confirms everything, so that the
        // queue is sometimes carried across several kills and sometimes
        // starts empty.
        if (cycle % 3 == 2) confirmQueue(s, clientId, handles);
    }

    void checkResendAndCommit(const Journal& journal, const std::vector<ts::SyncProtocol::Delta>& resent,
                              const std::string& clientId) {
        const JournalWrite* inFlight = nullptr;
        for (size_t i = 0; i < journal.writes.size(); ++i) {
            const JournalWrite& write = journal.writes[i];
            ASSERT_FALSE(write.failed) << "the writer's store refused write " << i;
            if (!write.acknowledgedVersionId) {
                ASSERT_EQ(journal.writes.size() - 1, i) << "only the write cut by the kill may lack its answer";
                inFlight = &write;
                break;
            }
            ASSERT_GT(*write.acknowledgedVersionId, expected.highest(write.collection)) << "version id reused";
            expected.commit(changeOf(write, *write.acknowledgedVersionId));
        }
        const size_t acknowledged = expected.queue.size();
        ASSERT_TRUE(resent.size() == acknowledged || (inFlight && resent.size() == acknowledged + 1))
            << "resent " << resent.size() << " changes for " << acknowledged << " acknowledged ones";
        for (size_t i = 0; i < resent.size(); ++i) {
            EXPECT_EQ(clientId, resent[i].clientId);
            EXPECT_EQ(0u, resent[i].sequenceNumber);
        }
        for (size_t i = 0; i < acknowledged; ++i) {
            ASSERT_TRUE(sameChange(expected.queue[i], resent[i])) << "queued change " << i << " differs or is out of order";
            ASSERT_EQ(expected.queue[i].versionId, resent[i].versionId) << "queued change " << i;
        }
        if (resent.size() == acknowledged + 1) {
            // The write in flight was committed before the kill, only its
            // answer was lost: it must be whole and carry a fresh id.
            QueuedChange committed = changeOf(*inFlight, resent.back().versionId);
            ASSERT_TRUE(sameChange(committed, resent.back())) << "the write in flight was resent damaged";
            ASSERT_GT(committed.versionId, expected.highest(committed.collectionName));
            expected.commit(committed);
        }
    }

    void checkObjects(ts::Collection& collection, const std::string& name) {
        auto stored = readObjects(collection);
        EXPECT_EQ(expected.objectsOf(name), stored) << "in " << name;
        for (const auto& [key, object] : stored) {
            auto found = testsupport::rows(collection.queryWithIndex(
                "SELECT primary_key FROM {0} WHERE field_name = 'len' AND field_value = ?",
                {std::to_string(object.blob.size())}, -1));
            bool indexed = false;
            for (const std::string& row : found) indexed = indexed || row.rfind(key + "=", 0) == 0;
            EXPECT_TRUE(indexed) << "the index rows of " << name << "/" << key << " were lost";
        }
    }

    // A remote batch is applied whole or not at all, together with its
    // sequence number.
    void checkRemoteBatch(testsupport::FakeTransport& transport, ts::Collection& remote) {
        uint64_t sequenceNumber = 0;
        for (const auto& request : transport.sentSubscriptions()) {
            if (request.collectionName == "crash:remote") sequenceNumber = request.sequenceNumber;
        }
        EXPECT_GE(sequenceNumber, expected.remoteSequenceNumber);
        auto stored = readObjects(remote);
        if (sequenceNumber == 0) {
            EXPECT_TRUE(stored.empty());
            return;
        }
        ASSERT_EQ(static_cast<size_t>(testsupport::kRemoteObjects), stored.size());
        for (const auto& [key, object] : stored) {
            EXPECT_EQ((StoredObject{std::to_string(sequenceNumber), testsupport::remoteBlob(sequenceNumber), 3}),
                      object)
                << key << " is not from the batch of the stored sequence number " << sequenceNumber;
        }
        expected.remoteSequenceNumber = sequenceNumber;
    }

    // Delivers the server's copy of every queued change and waits until it
    // has been applied; the queue is then empty.
    void confirmQueue(testsupport::StoreUnderTest& s, const std::string& clientId,
                      std::map<std::string, std::unique_ptr<ts::Collection>>& handles) {
        std::vector<ts::SyncProtocol::Delta> echoes;
        for (const QueuedChange& change : expected.queue) {
            ts::SyncProtocol::Delta echo = change;
            echo.clientId = clientId;
            echo.sequenceNumber = 1;
            echoes.push_back(echo);
        }
        s.heard.clear();
        s.transport->onDeltaReceived(echoes);
        ASSERT_TRUE(testsupport::waitUntil([&] { return s.heard.size() == echoes.size(); }));
        expected.queue.clear();
        s.transport->clearSent();
        s.transport->onConnectionEstablished();
        EXPECT_TRUE(s.transport->sentDeltas().empty()) << "a confirmed change is still queued";
        for (const char* name : testsupport::kJournalCollections) checkObjects(*handles[name], name);
    }

    testsupport::TempDir dir;
    const std::string path = dir.file("store.db");
    ExpectedStore expected;
};

TEST_F(CrashDurabilityTest, AcknowledgedWritesSurviveSigkillAndQueueIsResentOnceInOrder) {
    testsupport::LogCapture log;
    std::mt19937 random(20261122);
    int killedBeforeReady = 0;
    size_t acknowledgedWrites = 0;
    for (int cycle = 0; cycle < kCycles; ++cycle) {
        SCOPED_TRACE("cycle " + std::to_string(cycle));
        const std::string journalPath = dir.file("journal-" + std::to_string(cycle));
        {
            testsupport::ChildProcess writer(
                TESSARINE_CRASH_WRITER,
                {path, journalPath, std::to_string(random()), std::to_string((cycle + 1) * 1000000ULL)},
                TESSARINE_TEST_EMULATOR);
            // Most kills come while the writer runs its loops; some while it
            // is still opening the store.
            if (random() % 8 != 0) {
                ASSERT_TRUE(testsupport::waitUntil([&] { return testsupport::readJournal(journalPath).ready; }))
                    << "the writer did not start";
            }
            // The random moment of the kill, not a wait for the writer.
            std::this_thread::sleep_for(std::chrono::milliseconds(random() % 200));
            writer.kill(SIGKILL);
            int status = writer.wait();
            ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL)
                << "the writer ended by itself: " << testsupport::describeWaitStatus(status);
        }
        Journal journal = testsupport::readJournal(journalPath);
        if (!journal.ready) ++killedBeforeReady;
        for (const JournalWrite& write : journal.writes) acknowledgedWrites += write.acknowledgedVersionId ? 1 : 0;
        verifyAfterKill(journal, cycle);
        if (HasFatalFailure()) return;
    }
    for (const testsupport::LogLine& line : log.lines()) EXPECT_LT(line.priority, 6) << line.message;
    // The kills must have hit a store at work, not only one starting up.
    EXPECT_GT(acknowledgedWrites, static_cast<size_t>(kCycles));
    RecordProperty("acknowledged_writes", static_cast<int>(acknowledgedWrites));
    RecordProperty("killed_before_ready", killedBeforeReady);
}

}  // namespace
