// tessarine-inspect against stores built here: what it reports, its JSON,
// the files it refuses, and a store that another process is writing.
#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

#include "ChildProcess.h"
#include "CrashJournal.h"
#include "StoreTestSupport.h"
#include "sqlite/Database.h"
#include "tools/InspectCommand.h"
#include "tools/JsonWriter.h"
#include "tools/StoreInspector.h"

using lumivale::sqlite::kOpenReadWriteCreate;

namespace {

namespace ts = lumivale::tessarine;
namespace inspect = lumivale::tessarine::inspect;
using Status = ts::SyncProtocol::DeltaStatus;
using testsupport::TempDir;

struct Outcome {
    int status;
    std::string out, err;
};

Outcome inspectWith(const std::vector<std::string>& arguments) {
    std::ostringstream out, err;
    int status = inspect::runInspect(arguments, out, err);
    return {status, out.str(), err.str()};
}

std::vector<unsigned char> bytes(const std::string& text) { return {text.begin(), text.end()}; }

// Two collections with objects in every status and a queue of three changes
// (notes 1 SENT, tasks 1 and notes 2 PENDING, in that order); the store is
// closed again. Returns the store's client id.
std::string buildStore(const std::string& path) {
    testsupport::StoreUnderTest s(path);
    auto notes = s.store->subscribeCollection("app:notes");
    auto tasks = s.store->subscribeCollection("app:tasks");
    EXPECT_TRUE(notes->saveObject("a\"\\\n\xff\xc3\xa9", "1", bytes("hello")));
    EXPECT_TRUE(tasks->saveObject("t", "1", std::vector<unsigned char>{0, 1, 0xfe}));
    EXPECT_TRUE(notes->saveObject("b", "2", std::vector<unsigned char>{}));
    auto sent = s.transport->sentDeltas();
    s.transport->onDeltaStatusUpdated({sent[0], Status::SENT});
    ts::SyncProtocol::Delta remote = sent[2];
    remote.clientId = "ANOTHERCLIENT";
    remote.primaryKey = "r";
    remote.sortKey = "3";
    remote.sequenceNumber = 9;
    s.transport->onDeltaReceived({remote});
    EXPECT_TRUE(testsupport::waitUntil([&] { return s.store->getSyncMetrics()->waitingJobs == 0; }));
    return sent[0].clientId;
}

TEST(InspectorTest, ReportsCountsQueueOrderAndObjectsOfAStoreWithoutWritingToIt) {
    TempDir dir;
    const std::string path = dir.file("store.db");
    const std::string clientId = buildStore(path);
    const std::string before = testsupport::fileContent(path);

    inspect::StoreInspector inspector(path);
    inspect::StoreSummary summary = inspector.summary();
    EXPECT_EQ(clientId, summary.clientId);
    EXPECT_EQ(1u, summary.dataVersion);
    ASSERT_EQ(2u, summary.collections.size());
    const auto& notes = summary.collections[0];
    EXPECT_EQ("app:notes", notes.name);
    EXPECT_EQ((std::vector<uint64_t>{1, 1, 1, 2, 9}),
              (std::vector<uint64_t>{notes.pending, notes.sent, notes.persisted, notes.versionIdCounter,
                                     notes.sequenceNumber.value_or(999)}));
    const auto& tasks = summary.collections[1];
    EXPECT_EQ("app:tasks", tasks.name);
    EXPECT_EQ((std::vector<uint64_t>{1, 0, 0, 1, 0}),
              (std::vector<uint64_t>{tasks.pending, tasks.sent, tasks.persisted, tasks.versionIdCounter,
                                     tasks.sequenceNumber.value_or(999)}));
    EXPECT_EQ((std::vector<uint64_t>{3, 2, 1}),
              (std::vector<uint64_t>{summary.queue.length, summary.queue.pending, summary.queue.sent}));
    EXPECT_EQ((std::vector<std::pair<std::string, uint64_t>>{{"app:notes", 1}, {"app:tasks", 1}}),
              summary.queue.oldestVersionIds);
    EXPECT_TRUE(summary.integrityOk());

    std::vector<std::string> queued;
    for (const auto& d : inspector.queue()) {
        queued.push_back(d.collectionName + "/" + std::to_string(d.versionId) + ":" + std::to_string(d.status));
    }
    EXPECT_EQ((std::vector<std::string>{"app:notes/1:2", "app:tasks/1:1", "app:notes/2:1"}), queued);

    // The JSON document, whole: key names, escaping of keys that are not
    // text (quote, backslash, newline, a stray byte, valid UTF-8), blobs as
    // text or hex.
    Outcome objects = inspectWith({"--json", path, "objects", "app:notes"});
    EXPECT_EQ(0, objects.status) << objects.err;
    EXPECT_EQ("{\n"
              "  \"path\": " + inspect::JsonWriter::quote(path) + ",\n"
              "  \"collection\": \"app:notes\",\n"
              "  \"objects\": [\n"
              "    {\n"
              "      \"primary_key\": \"a\\\"\\\\\\n\\u00ff\xc3\xa9\",\n"
              "      \"sort_key\": \"1\",\n"
              "      \"status\": \"SENT\",\n"
              "      \"blob_size\": 5,\n"
              "      \"blob_encoding\": \"text\",\n"
              "      \"blob\": \"hello\"\n"
              "    },\n"
              "    {\n"
              "      \"primary_key\": \"b\",\n"
              "      \"sort_key\": \"2\",\n"
              "      \"status\": \"PENDING\",\n"
              "      \"blob_size\": 0,\n"
              "      \"blob_encoding\": \"hex\",\n"
              "      \"blob\": \"\"\n"
              "    },\n"
              "    {\n"
              "      \"primary_key\": \"r\",\n"
              "      \"sort_key\": \"3\",\n"
              "      \"status\": \"PERSISTED\",\n"
              "      \"blob_size\": 0,\n"
              "      \"blob_encoding\": \"hex\",\n"
              "      \"blob\": \"\"\n"
              "    }\n"
              "  ]\n"
              "}\n",
              objects.out);
    Outcome json = inspectWith({path, "--json"});
    EXPECT_EQ(0, json.status) << json.err;
    for (const char* key : {"\"client_id\": \"", "\"data_version\": 1", "\"name\": \"app:tasks\"", "\"PERSISTED\": 1",
                            "\"version_id_counter\": 2", "\"sequence_number\": 9", "\"length\": 3",
                            "\"by_status\": {", "\"oldest_version_ids\": {", "\"integrity_ok\": true",
                            "\"integrity_check\": [\n    \"ok\"\n  ]"}) {
        EXPECT_NE(std::string::npos, json.out.find(key)) << key << " in\n" << json.out;
    }
    Outcome queue = inspectWith({path, "queue"});
    EXPECT_EQ(0, queue.status);
    EXPECT_NE(std::string::npos, queue.out.find("3. app:notes version 2  SAVE b  sort key 2  PENDING  0 bytes"))
        << queue.out;
    EXPECT_NE(std::string::npos, queue.out.find("2. app:tasks version 1  SAVE t  sort key 1  PENDING  3 bytes, hex 0001fe"))
        << queue.out;
    EXPECT_EQ(0, inspectWith({path}).status);
    EXPECT_EQ(before, testsupport::fileContent(path));  // never written
}

TEST(InspectorTest, FilesThatCannotBeInspectedGetAClearMessageAndANonZeroExit) {
    TempDir dir;
    const std::string store = dir.file("store.db");
    buildStore(store);
    std::ofstream(dir.file("text.db")) << "this is not a database file, just some text that is long enough";
    lumivale::sqlite::Database(dir.file("other.db"), kOpenReadWriteCreate).exec("CREATE TABLE unrelated (x)");
    struct Case {
        std::vector<std::string> arguments;
        int status;
        std::string message;
    };
    // Another connection that keeps the store to itself (exclusive locking
    // mode, holding its write lock) for the locked case.
    auto holder = std::make_unique<lumivale::sqlite::Database>(store, kOpenReadWriteCreate);
    holder->exec("PRAGMA locking_mode=EXCLUSIVE");
    holder->exec("BEGIN EXCLUSIVE");
    holder->exec("CREATE TABLE held (x)");
    for (const Case& c : std::vector<Case>{
             {{dir.file("missing.db")}, 1, "no such file: " + dir.file("missing.db")},
             {{dir.file("text.db")}, 1, "not a Tessarine store: the file is not an SQLite database"},
             {{"--json", dir.file("other.db")}, 1, "not a Tessarine store: it has no library_metadata and delta_queue tables"},
             {{store}, 1, "the store is locked by another process (waited 2000 ms): database is locked"},
             {{}, 2, "usage: tessarine-inspect"},
             {{store, "objects"}, 2, "usage: tessarine-inspect"},
         }) {
        Outcome run = inspectWith(c.arguments);
        EXPECT_EQ(c.status, run.status) << c.message;
        EXPECT_NE(std::string::npos, run.err.find(c.message)) << run.err;
        EXPECT_EQ("", run.out);
    }
    holder.reset();  // rolls back and lets go
    Outcome unknown = inspectWith({store, "objects", "app:none"});
    EXPECT_EQ(1, unknown.status);
    EXPECT_EQ("tessarine-inspect: the store has no collection app:none\n", unknown.err);
    EXPECT_EQ("this is not a database file, just some text that is long enough", testsupport::fileContent(dir.file("text.db")));

    // The installed program exits with the same status.
    testsupport::ChildProcess program(TESSARINE_INSPECT, {dir.file("missing.db")}, TESSARINE_TEST_EMULATOR);
    int status = program.wait();
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 1) << testsupport::describeWaitStatus(status);
}

// The writer keeps writing while the inspector reads, and every report is
// one consistent, sound view: nothing persisted, so every queued change is
// PENDING and each collection's queue starts at version id 1.
TEST(InspectorTest, StoreHeldOpenByAWritingProcessIsReadConsistentlyWithoutStoppingIt) {
    TempDir dir;
    const std::string path = dir.file("store.db");
    const std::string journalPath = dir.file("journal");
    testsupport::ChildProcess writer(TESSARINE_CRASH_WRITER, {path, journalPath, "7", "1"}, TESSARINE_TEST_EMULATOR);
    auto acknowledged = [&] { return testsupport::fileLines(journalPath).size(); };  // "ready" and ids
    ASSERT_TRUE(testsupport::waitUntil([&] { return acknowledged() > 20; })) << "the writer did not start";
    for (int round = 0; round < 3; ++round) {
        inspect::StoreSummary summary = inspect::StoreInspector(path).summary();
        EXPECT_TRUE(summary.integrityOk());
        EXPECT_LT(0u, summary.queue.length);
        EXPECT_EQ(summary.queue.length, summary.queue.pending);
        for (const auto& [collection, oldest] : summary.queue.oldestVersionIds) EXPECT_EQ(1u, oldest) << collection;
        uint64_t pendingObjects = 0;
        for (const auto& c : summary.collections) {
            if (c.name != "crash:remote") pendingObjects += c.pending;
            EXPECT_EQ(0u, c.sent);
        }
        EXPECT_LT(0u, pendingObjects);
    }
    size_t seen = acknowledged();
    EXPECT_TRUE(testsupport::waitUntil([&] { return acknowledged() > seen + 5; })) << "the writer was held up";
    writer.kill(SIGKILL);
    writer.wait();
}

}  // namespace
