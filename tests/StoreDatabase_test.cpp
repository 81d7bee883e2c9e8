#include <gtest/gtest.h>

#include <fstream>

#include "FakeTransport.h"
#include "TestSupport.h"
#include "sqlite/Database.h"
#include "sqlite/SQLiteException.h"
#include "tessarine/Tessarine.h"

using lumivale::sqlite::kOpenReadWriteCreate;
using lumivale::sqlite::Database;
using lumivale::sqlite::SQLiteException;
using lumivale::tessarine::Tessarine;
using lumivale::tessarine::TessarineOptions;

namespace {

std::string pragma(Database& db, const std::string& name) {
    auto s = db.prepare("PRAGMA " + name);
    return s.step() ? s(0).getText() : "";
}

// A store whose file walk uses path while its tables live in db, so that the
// walk can be tested on files that are not databases.
std::unique_ptr<Tessarine> storeOver(std::shared_ptr<Database> db, const std::string& path) {
    return std::make_unique<Tessarine>(std::make_shared<testsupport::FakeTransport>(),
                                       std::make_shared<testsupport::CountingThreadCreator>(), db, path);
}

std::unique_ptr<Tessarine> openStore(const std::string& path) {
    return Tessarine::open(path, std::make_shared<testsupport::FakeTransport>(),
                           std::make_shared<testsupport::CountingThreadCreator>());
}

}  // namespace

TEST(StoreDatabaseTest, StoreTuningIsInEffectAndOpeningFailuresThrow) {
    testsupport::TempDir dir;
    auto db = Tessarine::createSqliteDatabase(dir.file("store.db"), TessarineOptions());
    EXPECT_EQ("2", pragma(*db, "temp_store"));  // MEMORY
    EXPECT_EQ("wal", pragma(*db, "journal_mode"));
    EXPECT_EQ("1", pragma(*db, "synchronous"));  // NORMAL
    EXPECT_EQ("1000", pragma(*db, "busy_timeout"));

    TessarineOptions other;
    other.synchronous = "FULL";
    other.busyTimeout = 250;
    auto second = Tessarine::createSqliteDatabase(dir.file("other.db"), other);
    EXPECT_EQ("2", pragma(*second, "synchronous"));
    EXPECT_EQ("250", pragma(*second, "busy_timeout"));

    EXPECT_THROW(Tessarine::createSqliteDatabase(dir.file("missing/store.db"), TessarineOptions()), SQLiteException);
    other.journalMode = "WAL; DROP";
    EXPECT_THROW(Tessarine::createSqliteDatabase(dir.file("bad.db"), other), SQLiteException);
}

TEST(StoreDatabaseTest, RemoveStopsTheStoreAndDeletesDatabaseAndCompanions) {
    for (const std::string path : {"", ":memory:"}) {  // no files: nothing to delete, twice
        auto store = openStore(path);
        ASSERT_TRUE(store && store->remove() && store->remove()) << path;
    }
    testsupport::TempDir dir;
    const std::string path = dir.file("store.db");
    auto store = openStore(path);
    auto items = store->subscribeCollection("app:items");
    ASSERT_TRUE(items->saveObject("k", "s", std::vector<unsigned char>{1}));
    ASSERT_TRUE(Tessarine::fileExists(path + "-wal") && Tessarine::fileExists(path + "-shm"));
    EXPECT_TRUE(store->remove());
    for (const char* suffix : {"", "-wal", "-shm"}) EXPECT_FALSE(Tessarine::fileExists(path + suffix)) << suffix;
    testsupport::LogCapture log;
    EXPECT_FALSE(items->saveObject("k2", "s", std::vector<unsigned char>{2}));
    EXPECT_EQ(1u, log.linesStartingWith("Error while updating object: DeltaHandler already stopped").size());
    EXPECT_TRUE(store->remove());  // nothing left to delete

    // Without companion files only the database goes.
    Database(path, kOpenReadWriteCreate).exec("CREATE TABLE t (x)");  // closed again: no -wal, no -shm
    EXPECT_TRUE(storeOver(std::make_shared<Database>(":memory:", kOpenReadWriteCreate), path)->remove());
    EXPECT_FALSE(Tessarine::fileExists(path));
}

TEST(StoreDatabaseTest, RemoveStopsAtDatabaseThatCannotBeDeleted) {
    testsupport::TempDir dir;
    // A non-empty directory opens for reading but cannot be removed, even by root.
    const std::string path = dir.file("store.db");
    std::filesystem::create_directory(path);
    for (const char* file : {"/keeps-it-non-empty", "-shm", "-wal"}) std::ofstream(path + file) << "x";
    EXPECT_FALSE(storeOver(std::make_shared<Database>(":memory:", kOpenReadWriteCreate), path)->remove());
    EXPECT_TRUE(Tessarine::fileExists(path + "-shm"));
    EXPECT_TRUE(Tessarine::fileExists(path + "-wal"));
}
