#include <gtest/gtest.h>

#include <algorithm>
#include <memory>
#include <stdexcept>
#include <string>
#include <tuple>
#include <vector>

#include "TestSupport.h"
#include "sqlite/Database.h"
#include "sqlite/SQLiteException.h"
#include "tessarine/CallbackManager.h"
#include "tessarine/CollectionIndexStorage.h"
#include "tessarine/CollectionIndexStorageQueries.h"
#include "tessarine/CollectionObjectStorage.h"
#include "tessarine/CollectionObjectStorageQueries.h"
#include "tessarine/CollectionStorage.h"
#include "tessarine/CollectionStorageQueries.h"
#include "tessarine/VersionIdGenerator.h"

using lumivale::sqlite::Database;
using namespace lumivale::tessarine;
using Status = CollectionStorage::ObjectStatus;
using Direction = CollectionStorage::SortDirection;
using Fields = std::unordered_multimap<std::string, std::string>;
using Row = std::tuple<std::string, std::string, std::string, int>;  // primary key, sort key, blob, status
using Keys = std::vector<std::string>;
using Pairs = std::vector<std::pair<std::string, std::string>>;

namespace {

const std::string kCollection = "app:items";

std::vector<Row> readAll(std::unique_ptr<Cursor> cursor) {
    std::vector<Row> rows;
    while (cursor->step()) {
        auto blob = cursor->getBlob();
        rows.emplace_back(cursor->getPrimaryKey(), cursor->getSortKey(),
                          std::string(reinterpret_cast<const char*>(blob.first), blob.second), cursor->getStatus());
    }
    return rows;
}

Keys keys(std::unique_ptr<Cursor> cursor) {
    Keys result;
    for (const Row& row : readAll(std::move(cursor))) result.push_back(std::get<0>(row));
    return result;
}

// Fails after creating its table, as a failing index creation would.
class FailingIndexStorage : public CollectionIndexStorage {
public:
    using CollectionIndexStorage::CollectionIndexStorage;
    void ensureTableExistsForCollection(const std::string& collectionName) override {
        CollectionIndexStorage::ensureTableExistsForCollection(collectionName);
        throw std::runtime_error("index creation failed");
    }
};

class CollectionStorageTest : public ::testing::Test {
protected:
    void SetUp() override { storage->ensureTableExistsForCollection(kCollection); }

    std::shared_ptr<CollectionStorage> makeStorage(std::shared_ptr<CollectionIndexStorage> index) {
        return std::make_shared<CollectionStorage>(db, callbacks, std::move(index),
                                                   std::make_shared<CollectionObjectStorage>(db),
                                                   std::make_shared<VersionIdGenerator>(db));
    }

    void save(const std::string& primaryKey, const std::string& sortKey, const std::string& blob = "",
              Status status = Status::PENDING) {
        storage->saveObject(kCollection, primaryKey, sortKey, reinterpret_cast<const unsigned char*>(blob.data()),
                            static_cast<unsigned int>(blob.size()), status);
    }

    void indexBy(std::function<Fields(const std::string& primaryKey)> fieldsOf) {
        callbacks->setCollectionIndexerFunction(
            [fieldsOf](const std::string&, const std::string& primaryKey, const std::string&,
                       const std::vector<unsigned char>&) { return fieldsOf(primaryKey); });
    }

    long long count(const std::string& sql, const std::string& argument = "") {
        auto statement = db->prepare(sql);
        if (!argument.empty()) statement.bind(1, argument);
        statement.step();
        return statement(0).getInt64();
    }

    Pairs indexRows(const std::string& primaryKey) {
        auto statement = db->prepare("SELECT field_name, field_value FROM \"collection_index_app:items\" "
                                     "WHERE primary_key = ? ORDER BY field_name, field_value");
        statement.bind(1, primaryKey);
        Pairs rows;
        while (statement.step()) rows.emplace_back(statement(0).getText(), statement(1).getText());
        return rows;
    }

    testsupport::TempDir dir;
    std::shared_ptr<Database> db = std::make_shared<Database>(dir.file("store.db"), 6);
    std::shared_ptr<CallbackManager> callbacks = std::make_shared<CallbackManager>();
    std::shared_ptr<CollectionStorage> storage = makeStorage(std::make_shared<CollectionIndexStorage>(db));
};

TEST_F(CollectionStorageTest, BuildersWriteExactSqlWithQuotedTableNames) {
    const std::string table = CollectionObjectStorage(db).getTableName("a:b");
    const std::string indexTable = CollectionIndexStorage(db).getTableName("a:b");
    EXPECT_EQ("SELECT primary_key, sort_key, blob, status FROM \"collection_a:b\" "
              "WHERE sort_key <= ? ORDER BY sort_key DESC LIMIT ?",
              dbqueries::QueryCollection::getSql(table, false));
    EXPECT_EQ((Keys{"CREATE INDEX IF NOT EXISTS \"collection_index_a:b_coll_idx_pk_fname_idx\" "
                    "ON \"collection_index_a:b\" (primary_key, field_name)",
                    "CREATE INDEX IF NOT EXISTS \"collection_index_a:b_coll_idx_fname_fvalue\" "
                    "ON \"collection_index_a:b\" (field_name, field_value)"}),
              dbqueries::CreateCollectionIndexTable::getIndexSqls(indexTable));
    EXPECT_EQ("SELECT obj.primary_key, obj.sort_key, obj.blob, obj.status FROM \"collection_a:b\" obj "
              "LEFT OUTER JOIN \"collection_index_a:b\" idx   ON obj.primary_key = idx.primary_key AND "
              "idx.field_name = ? WHERE obj.primary_key IN (SUB) ORDER BY idx.field_value ASC LIMIT ?",
              dbqueries::QueryCollectionWithIndexSorted::getSql(table, indexTable, "SUB", "ASC"));
}

TEST_F(CollectionStorageTest, EnsureTablesIsIdempotentKeepsCounterAndIsAtomic) {
    const std::string schemaCount = "SELECT COUNT(*) FROM sqlite_master";
    long long schemaObjects = count(schemaCount);
    EXPECT_EQ(1u, storage->incrementAndGetVersionId(kCollection));
    storage->ensureTableExistsForCollection(kCollection);
    EXPECT_EQ(schemaObjects, count(schemaCount));
    EXPECT_EQ(2u, storage->incrementAndGetVersionId(kCollection));

    auto failing = makeStorage(std::make_shared<FailingIndexStorage>(db));
    EXPECT_THROW(failing->ensureTableExistsForCollection("x:y"), std::runtime_error);
    EXPECT_EQ(schemaObjects, count(schemaCount));  // neither object nor index table
    EXPECT_EQ(0, count("SELECT COUNT(*) FROM collection_version_ids WHERE collection_name = ?", "x:y"));
}

TEST_F(CollectionStorageTest, UpsertReplacesRowEvenUnderNewSortKeyAndBlobsRoundTripWhole) {
    const std::string zeros("n\0w\0", 4);
    save("p1", "s1", "old", Status::PENDING);
    save("p1", "s9", zeros, Status::SENT);
    save("p2", "s9", "", Status::PERSISTED);  // same sort key, other object: a second row
    storage->saveObject(kCollection, "p3", "s5", nullptr, 0, Status::PENDING);
    auto rows = readAll(storage->query(kCollection, "", -1, true));
    std::sort(rows.begin() + 1, rows.end());  // equal sort keys come in the engine's order
    EXPECT_EQ((std::vector<Row>{{"p3", "s5", "", 1}, {"p1", "s9", zeros, 2}, {"p2", "s9", "", 3}}), rows);

    storage->updateObjectStatus(kCollection, "p1", Status::PERSISTED);
    storage->updateObjectStatus(kCollection, "missing", Status::SENT);  // no row, no error
    EXPECT_EQ((std::vector<Row>{{"p1", "s9", zeros, 3}}), readAll(storage->getObject(kCollection, "p1")));
    EXPECT_TRUE(readAll(storage->getObject(kCollection, "missing")).empty());
}

TEST_F(CollectionStorageTest, RangeQueryHasInclusiveBoundsInBothDirectionsAndHonoursLimit) {
    for (const char* key : {"d", "b", "f"}) save(std::string("p") + key, key);
    EXPECT_EQ((Keys{"pd", "pf"}), keys(storage->query(kCollection, "d", -1, true)));
    EXPECT_EQ((Keys{"pd", "pb"}), keys(storage->query(kCollection, "d", -1, false)));
    EXPECT_EQ((Keys{"pb", "pd"}), keys(storage->query(kCollection, "", 2, true)));
    EXPECT_TRUE(keys(storage->query(kCollection, "", 0, true)).empty());
    EXPECT_TRUE(keys(storage->query(kCollection, "a", -1, false)).empty());
}

TEST_F(CollectionStorageTest, IndexerRunsOnEverySaveAndIndexRowsFollowTheObjectThroughSaveAndDelete) {
    std::vector<std::string> seen;
    callbacks->setCollectionIndexerFunction([&](const std::string& collection, const std::string& primaryKey,
                                                const std::string& sortKey, const std::vector<unsigned char>& blob) {
        seen.push_back(collection + "|" + primaryKey + "|" + sortKey + "|" + std::string(blob.begin(), blob.end()));
        return Fields{{"tag", "x"}, {"tag", "x"}, {"owner", primaryKey}};
    });
    save("p1", "s1", std::string("a\0b", 3));
    save("p2", "s2");
    EXPECT_EQ((Keys{"app:items|p1|s1|" + std::string("a\0b", 3), "app:items|p2|s2|"}), seen);
    EXPECT_EQ((Pairs{{"owner", "p1"}, {"tag", "x"}, {"tag", "x"}}), indexRows("p1"));  // duplicates kept

    indexBy([](const std::string&) { return Fields{{"tag", "y"}}; });
    save("p1", "s1");
    EXPECT_EQ((Pairs{{"tag", "y"}}), indexRows("p1"));
    indexBy([](const std::string&) { return Fields{}; });
    save("p1", "s1");
    EXPECT_TRUE(indexRows("p1").empty());
    callbacks->setCollectionIndexerFunction(nullptr);
    save("p2", "s2");  // no indexer: the old rows still go
    EXPECT_TRUE(indexRows("p2").empty());

    indexBy([](const std::string& primaryKey) { return Fields{{"owner", primaryKey}}; });
    save("p1", "s1");
    save("p2", "s2");
    storage->deleteObject(kCollection, "p1");
    storage->deleteObject(kCollection, "missing");
    EXPECT_EQ((Keys{"p2"}), keys(storage->query(kCollection, "", -1, true)));
    EXPECT_TRUE(indexRows("p1").empty());
    EXPECT_EQ((Pairs{{"owner", "p2"}}), indexRows("p2"));

    // A throwing indexer reaches the caller, whose transaction undoes the save.
    save("p3", "s3", "kept");
    indexBy([](const std::string&) -> Fields { throw std::runtime_error("indexer failed"); });
    EXPECT_THROW(db->runInTransaction([&] { save("p3", "s3", "lost"); }, Database::TransactionType::Immediate),
                 std::runtime_error);
    EXPECT_EQ("kept", std::get<2>(readAll(storage->getObject(kCollection, "p3")).at(0)));
}

TEST_F(CollectionStorageTest, IndexedQueryReplacesEveryPlaceholderAndBindsArgumentsThenLimit) {
    indexBy([](const std::string& primaryKey) {
        return Fields{{"color", primaryKey == "p2" ? "blue" : "red"}, {"size", primaryKey == "p3" ? "S" : "L"}};
    });
    for (const char* key : {"p1", "p2", "p3"}) save(key, key);
    const std::string byColorAndSize =
        "SELECT primary_key FROM {0} WHERE field_name = ? AND field_value = ? "
        "INTERSECT SELECT primary_key FROM {0} WHERE field_name = ? AND field_value = ?";
    EXPECT_EQ((Keys{"p1"}), keys(storage->queryWithIndex(kCollection, byColorAndSize, {"color", "red", "size", "L"}, -1)));
    const std::string everything = "SELECT primary_key FROM {0}";
    EXPECT_EQ(3u, keys(storage->queryWithIndex(kCollection, everything, {}, -1)).size());
    EXPECT_EQ(2u, keys(storage->queryWithIndex(kCollection, everything, {}, 2)).size());
    EXPECT_TRUE(keys(storage->queryWithIndex(kCollection, everything, {}, 0)).empty());
    const std::string literalTable = "SELECT primary_key FROM \"collection_index_app:items\" WHERE field_value = ?";
    EXPECT_EQ((Keys{"p2"}), keys(storage->queryWithIndex(kCollection, literalTable, {"blue"}, 5)));  // no {0}
    EXPECT_THROW(storage->queryWithIndex(kCollection, "SELEC nonsense", {}, 1), lumivale::sqlite::SQLiteException);
}

TEST_F(CollectionStorageTest, SortedQueryOrdersValuesAsTextAndObjectsWithoutTheFieldFirstAscending) {
    indexBy([](const std::string& primaryKey) {
        Fields fields{{"kind", "k"}};
        if (primaryKey != "none") fields.emplace("rank", primaryKey.substr(1));
        return fields;
    });
    for (const char* key : {"r9", "r10", "none", "r2"}) save(key, "s");
    const std::string byKind = "SELECT primary_key FROM {0} WHERE field_name = ? AND field_value = ?";
    auto sorted = [&](Direction direction, int limit) {
        return keys(storage->queryWithIndexSorted(kCollection, byKind, {"kind", "k"}, "rank", direction, limit));
    };
    EXPECT_EQ((Keys{"none", "r10", "r2", "r9"}), sorted(Direction::ASCENDING, -1));
    EXPECT_EQ((Keys{"r9", "r2", "r10", "none"}), sorted(Direction::DESCENDING, -1));
    EXPECT_EQ((Keys{"r9", "r2"}), sorted(static_cast<Direction>(7), 2));
    // No arguments: the sort field is parameter 1 and the limit parameter 2.
    EXPECT_EQ((Keys{"none", "r10"}), keys(storage->queryWithIndexSorted(kCollection, "SELECT primary_key FROM {0}",
                                                                        {}, "rank", Direction::ASCENDING, 2)));
}

}  // namespace
