// A store's file that it cannot use as it is: not a database, read-only, in
// a folder that is a file, or write-locked by another connection. Each gives
// a clear error and leaves the file as it was.
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "ChildProcess.h"
#include "StoreTestSupport.h"

#ifndef TESSARINE_READONLY_PROBE
#error "TESSARINE_READONLY_PROBE must name the read-only probe program"
#endif

namespace {

namespace fs = std::filesystem;
namespace ts = lumivale::tessarine;
using Direction = ts::CollectionStorage::SortDirection;
using testsupport::LogCapture;
using testsupport::rows;
using testsupport::StoreUnderTest;
using testsupport::TempDir;

std::vector<std::string> filesIn(const fs::path& folder) {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(folder)) names.push_back(entry.path().filename().string());
    std::sort(names.begin(), names.end());
    return names;
}

// Writes two objects into a store at path and closes it again.
void makeStore(const std::string& path) {
    StoreUnderTest s(path);
    ASSERT_TRUE(s.store);
    auto items = s.store->subscribeCollection("app:items");
    ASSERT_TRUE(items->saveObject("a", "1", std::vector<unsigned char>{1, 2, 3}));
    ASSERT_TRUE(items->saveObject("b", "2", std::vector<unsigned char>{4}));
}

void expectStoreIntact(const std::string& path) {
    StoreUnderTest s(path);
    ASSERT_TRUE(s.store);
    auto items = s.store->subscribeCollection("app:items");
    ASSERT_TRUE(items);
    EXPECT_EQ((std::vector<std::string>{"a=1:1:3", "b=2:1:1"}), rows(items->query("", -1, Direction::ASCENDING)));
}

TEST(UnusableDatabaseTest, FilesThatAreNotDatabasesOrUnreachableAreLeftUntouched) {
    TempDir dir;
    LogCapture log;
    // Starts like a database file, then garbage: SQLite gets further into it
    // than into plain text before it gives up.
    std::string fake = std::string("SQLite format 3", 16) + std::string(4080, '\x5a');
    const std::string fakePath = dir.file("fake.db");
    std::ofstream(fakePath, std::ios::binary) << fake;
    // A regular file where the database's folder should be.
    const std::string notAFolder = dir.file("folder");
    std::ofstream(notAFolder) << "a file";

    EXPECT_FALSE(StoreUnderTest(fakePath).store);
    EXPECT_FALSE(StoreUnderTest(notAFolder + "/store.db").store);
    EXPECT_FALSE(StoreUnderTest(dir.file("missing/store.db")).store);
    auto errors = log.linesStartingWith("Error while creating tessarine instance: ");
    ASSERT_EQ(3u, errors.size());
    EXPECT_NE(std::string::npos, errors[0].message.find("file is not a database")) << errors[0].message;
    EXPECT_EQ(fake, testsupport::fileContent(fakePath));
    EXPECT_EQ("a file", testsupport::fileContent(notAFolder));
    EXPECT_EQ((std::vector<std::string>{"fake.db", "folder"}), filesIn(dir.path()));  // no -wal, no -shm
    // A store needs a transport.
    EXPECT_FALSE(ts::Tessarine::open(dir.file("a.db"), nullptr, std::make_shared<testsupport::CountingThreadCreator>()));
    EXPECT_EQ(4u, log.linesStartingWith("Error while creating tessarine instance: ").size());
}

// Runs the probe program on a store whose file and folder have the given
// modes, as a user to whom they apply, and returns its report.
std::vector<std::string> probeReadOnly(const std::string& folder, fs::perms folderMode, fs::perms fileMode,
                                       const TempDir& dir) {
    const std::string path = folder + "/store.db";
    fs::permissions(path, fileMode);
    fs::permissions(folder, folderMode);
    const std::string report = dir.file("report");
    std::ofstream(report).close();
    fs::permissions(report, fs::perms::owner_read | fs::perms::owner_write | fs::perms::group_read |
                                fs::perms::group_write | fs::perms::others_read | fs::perms::others_write);
    testsupport::ChildProcess probe(TESSARINE_READONLY_PROBE, {path, report}, TESSARINE_TEST_EMULATOR);
    int status = probe.wait();
    fs::permissions(folder, fs::perms::owner_all, fs::perm_options::add);
    fs::permissions(path, fs::perms::owner_read | fs::perms::owner_write, fs::perm_options::add);
    std::vector<std::string> lines = testsupport::fileLines(report);
    if (!(WIFEXITED(status) && WEXITSTATUS(status) == 0)) {
        lines.push_back("probe ended with " + testsupport::describeWaitStatus(status));
    }
    return lines;
}

TEST(UnusableDatabaseTest, ReadOnlyFileOrFolderFailsOpenAndChangesNothing) {
    TempDir dir;
    const std::string folder = dir.file("store");
    fs::create_directory(folder);
    const std::string path = folder + "/store.db";
    makeStore(path);
    ASSERT_EQ((std::vector<std::string>{"store.db"}), filesIn(folder));  // closed cleanly, log checkpointed
    const std::string before = testsupport::fileContent(path);
    const fs::perms readOnly = fs::perms::owner_read | fs::perms::group_read | fs::perms::others_read;
    const fs::perms readWrite = readOnly | fs::perms::owner_write | fs::perms::group_write | fs::perms::others_write;
    const fs::perms folderReadOnly = readOnly | fs::perms::owner_exec | fs::perms::group_exec | fs::perms::others_exec;
    const fs::perms folderWritable = fs::perms::all;

    struct Case {
        const char* what;
        fs::perms folderMode;
        fs::perms fileMode;
        const char* reason;
    };
    for (const Case& c : {Case{"read-only file", folderWritable, readOnly, "the database file cannot be written"},
                          Case{"read-only folder", folderReadOnly, readWrite, "attempt to write a readonly database"},
                          Case{"both read-only", folderReadOnly, readOnly, "the database file cannot be written"}}) {
        SCOPED_TRACE(c.what);
        auto report = probeReadOnly(folder, c.folderMode, c.fileMode, dir);
        if (!report.empty() && report[0] == "cannot drop root rights") GTEST_SKIP() << "cannot run as another user";
        ASSERT_EQ(2u, report.size()) << ::testing::PrintToString(report);
        EXPECT_EQ(0u, report[0].find("log 6 Error while creating tessarine instance: ")) << report[0];
        EXPECT_NE(std::string::npos, report[0].find(c.reason)) << report[0];
        EXPECT_EQ("open failed", report[1]);
        EXPECT_EQ(before, testsupport::fileContent(path));
        EXPECT_EQ((std::vector<std::string>{"store.db"}), filesIn(folder));
    }
    expectStoreIntact(path);
}

TEST(UnusableDatabaseTest, WriteLockHeldElsewhereFailsWritesCleanlyAndStoreCatchesUpOnRelease) {
    TempDir dir;
    const std::string path = dir.file("store.db");
    makeStore(path);
    StoreUnderTest s(path);
    auto items = s.store->subscribeCollection("app:items");
    ASSERT_TRUE(items);

    // Another connection, as another process would, takes the write lock.
    sqlite3* other = nullptr;
    ASSERT_EQ(SQLITE_OK, sqlite3_open_v2(path.c_str(), &other, SQLITE_OPEN_READWRITE, nullptr));
    ASSERT_EQ(SQLITE_OK, sqlite3_exec(other, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr));
    LogCapture log;
    EXPECT_FALSE(items->saveObject("a", "9", std::vector<unsigned char>{9}));  // waits out the busy timeout
    auto errors = log.linesStartingWith("Error while updating object: database is locked");
    EXPECT_EQ(1u, errors.size());
    // Reading still works, and nothing changed.
    EXPECT_EQ((std::vector<std::string>{"a=1:1:3", "b=2:1:1"}), rows(items->query("", -1, Direction::ASCENDING)));
    // A delivery meanwhile fails and waits for its retry.
    s.transport->onDeltaReceived({testsupport::remoteDelta("app:items", "c", 7, {5})});
    ASSERT_TRUE(testsupport::waitUntil(
        [&] { return !log.linesStartingWith("Failed to process received deltas: database is locked").empty(); }));

    ASSERT_EQ(SQLITE_OK, sqlite3_exec(other, "ROLLBACK", nullptr, nullptr, nullptr));
    sqlite3_close(other);
    ASSERT_TRUE(testsupport::waitUntil([&] { return s.heard.size() > 0; }));
    EXPECT_TRUE(items->saveObject("d", "4", std::vector<unsigned char>{6}));
    EXPECT_EQ(3u, s.transport->sentDeltas().back().versionId);  // the refused save took no id
    EXPECT_EQ((std::vector<std::string>{"a=1:1:3", "b=2:1:1", "d=4:1:1", "c=c:3:1"}),
              rows(items->query("", -1, Direction::ASCENDING)));
}

}  // namespace
