#include <gtest/gtest.h>

#include <fstream>

#include "TestSupport.h"
#include "sqlite/Database.h"
#include "sqlite/SQLiteException.h"
#include "tessarine/Tessarine.h"

using lumivale::sqlite::Database;
using lumivale::sqlite::SQLiteException;
using lumivale::tessarine::Tessarine;
using lumivale::tessarine::TessarineOptions;

namespace {

std::string pragma(Database& db, const std::string& name) {
    auto s = db.prepare("PRAGMA " + name);
    return s.step() ? s(0).getText() : "";
}

void touch(const std::string& path) { std::ofstream(path) << "x"; }

}  // namespace

TEST(StoreDatabaseTest, StoreTuningIsInEffect) {
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
}

TEST(StoreDatabaseTest, OpeningFailuresThrow) {
    testsupport::TempDir dir;
    EXPECT_THROW(Tessarine::createSqliteDatabase(dir.file("missing/store.db"), TessarineOptions()), SQLiteException);
    TessarineOptions bad;
    bad.journalMode = "WAL; DROP";
    EXPECT_THROW(Tessarine::createSqliteDatabase(dir.file("bad.db"), bad), SQLiteException);
}

TEST(StoreDatabaseTest, RemoveWithoutFilesReturnsTrue) {
    for (const std::string path : {"", ":memory:"}) {
        Tessarine store(Tessarine::createSqliteDatabase(path, TessarineOptions()), path);
        EXPECT_TRUE(store.remove());
        EXPECT_TRUE(store.remove());
    }
}

TEST(StoreDatabaseTest, RemoveDeletesDatabaseAndCompanionsWhileOthersHoldTheConnection) {
    testsupport::TempDir dir;
    const std::string path = dir.file("store.db");
    auto db = Tessarine::createSqliteDatabase(path, TessarineOptions());
    db->exec("CREATE TABLE t (x)");
    db->exec("INSERT INTO t VALUES (1)");
    std::shared_ptr<Database> component = db;  // as the store's components do
    ASSERT_TRUE(Tessarine::fileExists(path + "-wal"));
    ASSERT_TRUE(Tessarine::fileExists(path + "-shm"));

    Tessarine store(std::move(db), path);
    EXPECT_TRUE(store.remove());
    EXPECT_FALSE(Tessarine::fileExists(path));
    EXPECT_FALSE(Tessarine::fileExists(path + "-wal"));
    EXPECT_FALSE(Tessarine::fileExists(path + "-shm"));
    EXPECT_TRUE(store.remove());  // nothing left to delete
}

TEST(StoreDatabaseTest, RemoveWithoutCompanionFilesDeletesOnlyTheDatabase) {
    testsupport::TempDir dir;
    const std::string path = dir.file("store.db");
    Database(path, 6).exec("CREATE TABLE t (x)");  // closed again: no -wal, no -shm
    ASSERT_TRUE(Tessarine::fileExists(path));
    ASSERT_FALSE(Tessarine::fileExists(path + "-wal"));
    Tessarine store(std::make_shared<Database>(":memory:", 6), path);
    EXPECT_TRUE(store.remove());
    EXPECT_FALSE(Tessarine::fileExists(path));
}

TEST(StoreDatabaseTest, RemoveStopsAtDatabaseThatCannotBeDeleted) {
    testsupport::TempDir dir;
    // A non-empty directory opens for reading but cannot be removed, even by root.
    const std::string path = dir.file("store.db");
    std::filesystem::create_directory(path);
    touch(path + "/keeps-it-non-empty");
    touch(path + "-shm");
    touch(path + "-wal");
    Tessarine store(std::make_shared<Database>(":memory:", 6), path);
    EXPECT_FALSE(store.remove());
    EXPECT_TRUE(Tessarine::fileExists(path + "-shm"));
    EXPECT_TRUE(Tessarine::fileExists(path + "-wal"));
    EXPECT_FALSE(Tessarine::fileExists(dir.file("never-created")));
}
