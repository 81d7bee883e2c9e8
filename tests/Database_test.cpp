#include <gtest/gtest.h>

#include <atomic>
#include <stdexcept>
#include <thread>
#include <vector>

#include <unistd.h>

#include "TestSupport.h"
#include "sqlite/Database.h"
#include "sqlite/SQLiteException.h"
#include "sqlite/StatementCache.h"

using lumivale::sqlite::kOpenReadWriteCreate;
using lumivale::sqlite::Database;
using lumivale::sqlite::SQLiteException;
using lumivale::sqlite::Statement;

namespace {

constexpr auto kImmediate = Database::TransactionType::Immediate;

class DatabaseTest : public ::testing::Test {
protected:
    void SetUp() override {
        db = std::make_shared<Database>(dir.file("db.sqlite"), kOpenReadWriteCreate);
        db->exec("PRAGMA journal_mode=WAL");
        db->exec("CREATE TABLE t (k TEXT PRIMARY KEY, v BLOB)");
    }

    void insert(const std::string& key) {
        Statement s = db->prepare("INSERT INTO t (k) VALUES (?)");
        s.bind(1, key);
        s.step();
    }

    long long count() {
        Statement s = db->prepare("SELECT COUNT(*) FROM t");
        s.step();
        return s(0).getInt64();
    }

    bool has(const std::string& key) {
        Statement s = db->prepare("SELECT 1 FROM t WHERE k = ?");
        s.bind(1, key);
        return s.step();
    }

    // Starts another thread that inserts key, and returns once that thread
    // has finished or has fallen asleep after starting: then it can only be
    // waiting for the connection's lock.
    std::thread insertFromOtherThread(const std::string& key, std::atomic<bool>& finished) {
        std::atomic<pid_t> threadId{0};
        std::thread other([&, key] {
            threadId = ::gettid();
            insert(key);
            finished = true;
        });
        EXPECT_TRUE(testsupport::waitUntil(
            [&] { return finished || (threadId != 0 && testsupport::isThreadAsleep(threadId)); }));
        return other;
    }

    testsupport::TempDir dir;
    std::shared_ptr<Database> db;
};

TEST_F(DatabaseTest, NestedTransactionsCommitTogetherAFailureUndoesItsOwnAndTheExceptionLeavesUnchanged) {
    db->runInTransaction([&] {
        insert("outer");
        db->runInTransaction([&] { insert("inner-kept"); }, kImmediate);
        EXPECT_THROW(db->runInTransaction([&] {
            insert("inner-lost");
            db->runInTransaction([&] { insert("innermost-lost"); }, kImmediate);
            throw std::runtime_error("inner");
        }, kImmediate), std::runtime_error);
        insert("after");
    }, kImmediate);
    EXPECT_TRUE(has("outer"));
    EXPECT_TRUE(has("inner-kept"));
    EXPECT_FALSE(has("inner-lost"));
    EXPECT_FALSE(has("innermost-lost"));
    EXPECT_TRUE(has("after"));

    try {
        db->runInTransaction([&] {
            db->runInTransaction([&] { insert("nested-in-failed"); }, kImmediate);
            throw std::logic_error("boom");
        }, kImmediate);
        FAIL() << "exception swallowed";
    } catch (const std::logic_error& e) {
        EXPECT_STREQ("boom", e.what());  // the same exception, rethrown
    }
    EXPECT_FALSE(has("nested-in-failed"));
    EXPECT_EQ(3, count());
}

// The other thread's insert must neither be rolled back with the transaction
// nor be visible (committed) while the transaction is still open.
TEST_F(DatabaseTest, OtherThreadStatementWaitsForTransactionAndSurvivesItsRollback) {
    std::atomic<bool> otherDone{false};
    std::thread other;
    EXPECT_THROW(db->runInTransaction([&] {
        insert("mine");
        other = insertFromOtherThread("theirs", otherDone);
        EXPECT_FALSE(otherDone.load());
        EXPECT_FALSE(has("theirs"));
        throw std::runtime_error("rollback");
    }, kImmediate), std::runtime_error);
    other.join();
    EXPECT_TRUE(has("theirs"));
    EXPECT_FALSE(has("mine"));
    EXPECT_EQ(1, count());
}

// A scoped lock must let its own thread's calls through (a plain mutex would
// deadlock here) and keep another thread's statement out until it ends,
// without making a transaction of the calls it covers.
TEST_F(DatabaseTest, ScopedLockLetsOwnCallsThroughAndHoldsOthersOff) {
    std::atomic<bool> otherDone{false};
    std::thread other;
    {
        Database::ScopedLock lock(*db);
        insert("mine");
        other = insertFromOtherThread("theirs", otherDone);
        EXPECT_FALSE(otherDone.load());
        EXPECT_FALSE(has("theirs"));
    }
    other.join();
    EXPECT_TRUE(has("theirs"));
    EXPECT_TRUE(has("mine"));
}

TEST_F(DatabaseTest, StatementBindingsBlobsAndEndOfRows) {
    Statement insertBlob = db->prepare("INSERT INTO t (k, v) VALUES (?, ?)");
    insertBlob.bind(1, std::string("empty"));
    insertBlob.bindBlob(2, nullptr, 0);
    EXPECT_FALSE(insertBlob.step());
    insertBlob.reset();
    const unsigned char bytes[] = {1, 0, 2};
    insertBlob.bind(1, std::string("bytes"));
    insertBlob.bindBlob(2, bytes, 3);
    insertBlob.step();
    insertBlob.reset();
    insertBlob.bind(1, std::string("nul\0inside", 10));
    insertBlob.bindBlob(2, bytes, 1);
    insertBlob.step();
    EXPECT_EQ(3, count());

    Statement read = db->prepare("SELECT v, typeof(v) FROM t WHERE k = ?");
    read.bind(1, std::string("empty"));
    ASSERT_TRUE(read.step());
    EXPECT_EQ(0u, read(0).getBlobDirectBuffer().second);
    EXPECT_EQ("blob", read(1).getText());  // an empty blob, not NULL
    read.reset();
    read.bind(1, std::string("bytes"));
    ASSERT_TRUE(read.step());
    auto blob = read(0).getBlobDirectBuffer();
    EXPECT_EQ(std::vector<unsigned char>(bytes, bytes + 3), std::vector<unsigned char>(blob.first, blob.first + blob.second));

    Statement keys = db->prepare("SELECT k FROM t WHERE k LIKE 'nul%'");
    ASSERT_TRUE(keys.step());
    EXPECT_EQ(std::string("nul\0inside", 10), keys(0).getText());
    EXPECT_FALSE(keys.step());
    EXPECT_FALSE(keys.step());  // stays at the end instead of starting over
    keys.reset();
    EXPECT_TRUE(keys.step());

    Statement numbers = db->prepare("SELECT ?, ?, NULL");
    numbers.bind(1, 7);
    numbers.bind(2, 9000000000LL);
    ASSERT_TRUE(numbers.step());
    EXPECT_EQ(7, numbers(0).getInt());
    EXPECT_EQ(9000000000LL, numbers(1).getInt64());
    EXPECT_EQ("", numbers(2).getText());
    EXPECT_EQ(0u, numbers(2).getBlobDirectBuffer().second);

    EXPECT_THROW(insertBlob.bindBlob(2, nullptr, 5), SQLiteException);
}

TEST_F(DatabaseTest, MovedFromStatementIsHarmlessAndAStatementOutlivesItsDatabaseObject) {
    Statement original = db->prepare("INSERT INTO t (k) VALUES ('moved')");
    Statement target(std::move(original));
    EXPECT_THROW(original.step(), SQLiteException);
    {
        Statement destroyedEmpty(std::move(original));
    }
    target.step();
    Statement assigned = db->prepare("SELECT 1");
    assigned = db->prepare("SELECT k FROM t");
    db.reset();
    ASSERT_TRUE(assigned.step());
    EXPECT_EQ("moved", assigned(0).getText());
}

TEST_F(DatabaseTest, ErrorsCarrySqliteMessageAndStatement) {
    try {
        db->prepare("SELEC k FROM t");
        FAIL();
    } catch (const SQLiteException& e) {
        EXPECT_NE(std::string::npos, std::string(e.what()).find("syntax error")) << e.what();
        EXPECT_NE(std::string::npos, std::string(e.what()).find("SELEC k FROM t")) << e.what();
    }
    insert("dup");
    try {
        insert("dup");
        FAIL();
    } catch (const SQLiteException& e) {
        EXPECT_NE(std::string::npos, std::string(e.what()).find("UNIQUE constraint failed")) << e.what();
        EXPECT_NE(std::string::npos, std::string(e.what()).find("INSERT INTO t")) << e.what();
    }
    EXPECT_THROW(db->exec("DROP TABLE missing"), SQLiteException);
    EXPECT_THROW(Database(dir.file("no/such/dir/db.sqlite"), kOpenReadWriteCreate), SQLiteException);
    // A failed statement inside a transaction rolls back the whole of it.
    EXPECT_THROW(db->runInTransaction([&] {
        insert("new");
        insert("dup");
    }, kImmediate), SQLiteException);
    EXPECT_FALSE(has("new"));
}

}  // namespace

namespace {

// Compiling a statement costs more than running it; the connection keeps idle
// statements and hands them out again, never one that is still in use.
class StatementCacheTest : public DatabaseTest {
protected:
    uint64_t compiled() { return db->compiledStatementCount(); }
};

TEST_F(StatementCacheTest, IdleStatementsAreReusedWithFreshBindingsAndTransactionsCompileOnce) {
    insert("a");
    const uint64_t afterFirst = compiled();
    insert("b");
    db->runInTransaction([&] { insert("c"); }, kImmediate);
    const uint64_t afterTransaction = compiled();
    db->runInTransaction([&] { insert("d"); }, kImmediate);
    EXPECT_EQ(afterFirst + 2, afterTransaction);  // BEGIN IMMEDIATE and COMMIT, once
    EXPECT_EQ(afterTransaction, compiled());
    EXPECT_EQ(4, count());

    Statement bound = db->prepare("SELECT ? IS NULL");
    bound.bind(1, 5);
    bound = db->prepare("SELECT 0");  // gives the first back
    Statement reused = db->prepare("SELECT ? IS NULL");
    ASSERT_TRUE(reused.step());
    EXPECT_EQ(1, reused(0).getInt());  // the earlier binding did not stay
}

TEST_F(StatementCacheTest, StatementInUseIsNeverHandedOutTwice) {
    insert("a");
    insert("b");
    const std::string sql = "SELECT k FROM t ORDER BY k";
    Statement first = db->prepare(sql);
    ASSERT_TRUE(first.step());
    const uint64_t before = compiled();
    Statement second = db->prepare(sql);  // an open cursor holds the first
    EXPECT_EQ(before + 1, compiled());
    ASSERT_TRUE(second.step());
    ASSERT_TRUE(first.step());
    EXPECT_EQ("b", first(0).getText());
    EXPECT_EQ("a", second(0).getText());
    first = db->prepare("SELECT 1");
    second = db->prepare("SELECT 1");
    Statement third = db->prepare(sql);
    Statement fourth = db->prepare(sql);
    EXPECT_EQ(before + 3, compiled());  // "SELECT 1" twice; both of sql's came back
}

TEST_F(StatementCacheTest, LeastRecentlyUsedTextsAreEvictedPastTheBound) {
    const int texts = static_cast<int>(lumivale::sqlite::StatementCache::kMaxIdleStatements) + 8;
    auto select = [](int i) { return "SELECT " + std::to_string(i); };
    for (int i = 0; i < texts; ++i) db->prepare(select(i));
    const uint64_t before = compiled();
    db->prepare(select(texts - 1));  // recent: still cached
    EXPECT_EQ(before, compiled());
    db->prepare(select(0));  // oldest: evicted and compiled again
    EXPECT_EQ(before + 1, compiled());
}

}  // namespace
