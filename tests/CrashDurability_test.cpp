// Kills a writing store process (crash_writer) with SIGKILL at random moments,
// many times on one database file, and checks after each kill, in a fresh
// store on the same file, that nothing the store acknowledged was lost,
// damaged, reordered or duplicated.
#include <gtest/gtest.h>

#include <chrono>
#include <map>
#include <random>
#include <thread>

#include "ChildProcess.h"
#include "CrashJournal.h"
#include "StoreTestSupport.h"

namespace {

namespace ts = lumivale::tessarine;
using Delta = ts::SyncProtocol::Delta;
using testsupport::StoredObject;

#if defined(TESSARINE_TEST_SANITIZED) || defined(TESSARINE_TEST_EMULATED)
constexpr int kCycles = 30;  // every process runs several times slower
#else
constexpr int kCycles = 60;
#endif
const char* const kCollections[] = {"crash:notes", "crash:tasks", "crash:remote"};

// Whether two changes agree in what a resend carries over from the queue;
// the version id is compared apart, client id and sequence number are the
// resend's own.
bool sameChange(const Delta& a, const Delta& b) {
    return a.collectionName == b.collectionName && a.primaryKey == b.primaryKey && a.type == b.type &&
           a.sortKey == b.sortKey && a.blob == b.blob;
}

class CrashDurabilityTest : public ::testing::Test {
protected:
    // A change the store committed: it is queued until confirmed, and its
    // object shows it; version ids of a collection only grow.
    void commit(const Delta& change) {
        ASSERT_GT(change.versionId, highest[change.collectionName]) << "a version id was used twice";
        highest[change.collectionName] = change.versionId;
        queue.push_back(change);
        auto key = std::make_pair(change.collectionName, change.primaryKey);
        if (change.type == ts::SyncProtocol::DeltaType::SAVE) objects[key] = {change.sortKey, change.blob, 0};
        if (change.type == ts::SyncProtocol::DeltaType::DELETE) objects.erase(key);
    }

    // Reopens the file after a kill and checks it against what the writer
    // journaled, then writes once more and sometimes confirms the queue.
    void verifyAfterKill(unsigned seed, const std::vector<std::string>& journal, int cycle) {
        testsupport::StoreUnderTest s(path);
        ASSERT_TRUE(s.store) << "the file cannot be opened after the kill";
        s.store->setCollectionIndexerFunction(testsupport::journalIndexer);
        std::map<std::string, std::unique_ptr<ts::Collection>> handles;
        for (const char* name : kCollections) ASSERT_TRUE(handles[name] = s.store->subscribeCollection(name));
        const std::string clientId = s.transport->sentSubscriptions().at(0).clientId;
        s.transport->onConnectionEstablished();
        std::vector<Delta> resent = s.transport->sentDeltas();

        testsupport::WritePlan plan(seed);
        for (size_t i = 1; i < journal.size(); ++i) {
            Delta write = plan.next();
            write.versionId = std::stoull(journal[i]);
            ASSERT_NO_FATAL_FAILURE(commit(write));
        }
        const size_t acknowledged = queue.size();
        ASSERT_TRUE(resent.size() == acknowledged || (journal.size() > 0 && resent.size() == acknowledged + 1))
            << "resent " << resent.size() << " changes for " << acknowledged << " acknowledged ones";
        for (size_t i = 0; i < resent.size(); ++i) {
            EXPECT_EQ(clientId, resent[i].clientId);
            EXPECT_EQ(0u, resent[i].sequenceNumber);
            if (i == acknowledged) {
                // The write in flight was committed before the kill, only its
                // answer was lost: it must be whole and carry a fresh id.
                Delta inFlight = plan.next();
                inFlight.versionId = resent[i].versionId;
                ASSERT_TRUE(sameChange(inFlight, resent[i])) << "the write in flight was resent damaged";
                ASSERT_NO_FATAL_FAILURE(commit(inFlight));
            } else {
                ASSERT_TRUE(sameChange(queue[i], resent[i]) && queue[i].versionId == resent[i].versionId)
                    << "queued change " << i << " differs or is out of order";
            }
        }
        checkObjects(handles);
        checkRemoteBatch(*s.transport, *handles["crash:remote"]);

        ASSERT_TRUE(handles["crash:notes"]->saveObject("k0", "parent", {static_cast<unsigned char>(cycle)}));
        Delta next = s.transport->sentDeltas().back();
        ASSERT_NO_FATAL_FAILURE(commit(next));
        // Every third cycle the server confirms everything, so that the
        // queue is sometimes carried across several kills and sometimes
        // starts empty.
        if (cycle % 3 != 2) return;
        std::vector<Delta> echoes = queue;
        for (Delta& echo : echoes) {
            echo.clientId = clientId;
            echo.sequenceNumber = 1;
        }
        s.heard.clear();
        s.transport->onDeltaReceived(echoes);
        ASSERT_TRUE(testsupport::waitUntil([&] { return s.heard.size() == echoes.size(); }));
        queue.clear();
        s.transport->clearSent();
        s.transport->onConnectionEstablished();
        EXPECT_TRUE(s.transport->sentDeltas().empty()) << "a confirmed change is still queued";
        checkObjects(handles);
    }

    // Objects show PENDING (1) while a change of theirs is queued, PERSISTED
    // (3) otherwise, and keep their index rows.
    void checkObjects(std::map<std::string, std::unique_ptr<ts::Collection>>& handles) {
        std::map<std::pair<std::string, std::string>, StoredObject> expected = objects, stored;
        for (auto& [key, object] : expected) object.status = 3;
        for (const Delta& change : queue) {
            auto found = expected.find({change.collectionName, change.primaryKey});
            if (found != expected.end()) found->second.status = 1;
        }
        for (const char* name : testsupport::kJournalCollections) {
            ts::Collection& collection = *handles[name];
            for (auto& [key, object] : testsupport::storedObjects(collection.query("", -1, ts::CollectionStorage::SortDirection::ASCENDING))) {
                stored[{name, key}] = object;
                auto indexed = testsupport::rows(collection.queryWithIndex(
                    "SELECT primary_key FROM {0} WHERE field_name = 'len' AND field_value = ? AND primary_key = ?",
                    {std::to_string(object.blob.size()), key}, -1));
                EXPECT_EQ(1u, indexed.size()) << "the index rows of " << name << "/" << key << " were lost";
            }
        }
        EXPECT_EQ(expected, stored);
    }

    // A remote batch is applied whole or not at all, together with its
    // sequence number, which the store subscribes from again.
    void checkRemoteBatch(testsupport::FakeTransport& transport, ts::Collection& remote) {
        uint64_t sequenceNumber = 0;
        for (const auto& request : transport.sentSubscriptions()) {
            if (request.collectionName == "crash:remote") sequenceNumber = request.sequenceNumber;
        }
        EXPECT_GE(sequenceNumber, remoteSequenceNumber);
        remoteSequenceNumber = sequenceNumber;
        auto stored = testsupport::storedObjects(remote.query("", -1, ts::CollectionStorage::SortDirection::ASCENDING));
        ASSERT_EQ(sequenceNumber == 0 ? 0 : testsupport::kRemoteObjects, stored.size());
        for (const auto& [key, object] : stored) {
            EXPECT_EQ((StoredObject{std::to_string(sequenceNumber), testsupport::remoteBlob(sequenceNumber), 3}), object)
                << key << " is not from the batch of the stored sequence number " << sequenceNumber;
        }
    }

    testsupport::TempDir dir;
    const std::string path = dir.file("store.db");
    std::vector<Delta> queue;
    std::map<std::pair<std::string, std::string>, StoredObject> objects;
    std::map<std::string, uint64_t> highest;
    uint64_t remoteSequenceNumber = 0;
};

TEST_F(CrashDurabilityTest, AcknowledgedWritesSurviveSigkillAndQueueIsResentOnceInOrder) {
    testsupport::LogCapture log;
    std::mt19937 random(20261122);
    size_t acknowledgedWrites = 0;
    for (int cycle = 0; cycle < kCycles; ++cycle) {
        SCOPED_TRACE("cycle " + std::to_string(cycle));
        const std::string journalPath = dir.file("journal-" + std::to_string(cycle));
        const unsigned seed = random();
        {
            testsupport::ChildProcess writer(TESSARINE_CRASH_WRITER,
                                             {path, journalPath, std::to_string(seed), std::to_string((cycle + 1) * 1000000ULL)},
                                             TESSARINE_TEST_EMULATOR);
            // Most kills come while the writer runs its loops; some while it
            // is still opening the store.
            if (random() % 8 != 0) {
                ASSERT_TRUE(testsupport::waitUntil([&] { return !testsupport::fileLines(journalPath).empty(); }))
                    << "the writer did not start";
            }
            // The random moment of the kill, not a wait for the writer.
            std::this_thread::sleep_for(std::chrono::milliseconds(random() % 200));
            writer.kill(SIGKILL);
            int status = writer.wait();
            ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL)
                << "the writer ended by itself: " << testsupport::describeWaitStatus(status);
        }
        std::vector<std::string> journal = testsupport::fileLines(journalPath);
        acknowledgedWrites += journal.empty() ? 0 : journal.size() - 1;
        verifyAfterKill(seed, journal, cycle);
        if (HasFatalFailure()) return;
    }
    for (const testsupport::LogLine& line : log.lines()) EXPECT_LT(line.priority, 6) << line.message;
    // The kills must have hit a store at work, not only one starting up.
    EXPECT_GT(acknowledgedWrites, static_cast<size_t>(kCycles));
}

}  // namespace
