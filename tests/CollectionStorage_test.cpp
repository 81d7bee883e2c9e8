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
#include "tessarine/CollectionObjectStorage.h"
#include "tessarine/CollectionStorage.h"
#include "tessarine/VersionIdGenerator.h"

using lumivale::sqlite::kOpenReadWriteCreate;
using lumivale::sqlite::Database;
using namespace lumivale::tessarine;
using Status = CollectionStorage::ObjectStatus;
using Direction = CollectionStorage::SortDirection;
using Fields = std::unordered_multimap<std::string, std::string>;
using Row = std::tuple<std::string, std::string, std::string, int>;  // primary key, sort key, blob, status
using Keys = std::vector<std::string>;

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

class CollectionStorageTest : public ::testing::Test {
protected:
    void SetUp() override { storage->ensureTableExistsForCollection(kCollection); }

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

    // The first column of each row of sql, its one parameter (if any) bound to argument.
    Keys select(const std::string& sql, const std::string& argument = "") {
        auto statement = db->prepare(sql);
        if (!argument.empty()) statement.bind(1, argument);
        Keys rows;
        while (statement.step()) rows.push_back(statement(0).getText());
        return rows;
    }

    Keys indexRows(const std::string& primaryKey) {
        return select("SELECT field_name || '=' || field_value FROM \"collection_index_app:items\" "
                      "WHERE primary_key = ? ORDER BY 1", primaryKey);
    }

    testsupport::TempDir dir;
    std::shared_ptr<Database> db = std::make_shared<Database>(dir.file("store.db"), kOpenReadWriteCreate);
    std::shared_ptr<CallbackManager> callbacks = std::make_shared<CallbackManager>();
    std::shared_ptr<CollectionStorage> storage = std::make_shared<CollectionStorage>(
        db, callbacks, std::make_shared<CollectionIndexStorage>(db), std::make_shared<CollectionObjectStorage>(db),
        std::make_shared<VersionIdGenerator>(db));
};

TEST_F(CollectionStorageTest, EnsureTablesIsIdempotentKeepsCounterAndIsAtomic) {
    // A table under the name of x:y's second index makes creating that index fail.
    db->exec("CREATE TABLE \"collection_index_x:y_coll_idx_fname_fvalue\" (a)");
    const Keys schema = select("SELECT name FROM sqlite_master ORDER BY name");
    EXPECT_EQ(1u, storage->incrementAndGetVersionId(kCollection));
    storage->ensureTableExistsForCollection(kCollection);
    EXPECT_EQ(2u, storage->incrementAndGetVersionId(kCollection));
    EXPECT_THROW(storage->ensureTableExistsForCollection("x:y"), lumivale::sqlite::SQLiteException);
    EXPECT_EQ(schema, select("SELECT name FROM sqlite_master ORDER BY name"));  // nor object nor index table
    EXPECT_EQ((Keys{"app:items"}), select("SELECT collection_name FROM collection_version_ids"));
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
    for (const auto& [from, limit, ascending, expected] : std::vector<std::tuple<std::string, int, bool, Keys>>{
             {"d", -1, true, {"pd", "pf"}}, {"d", -1, false, {"pd", "pb"}}, {"", 2, true, {"pb", "pd"}},
             {"", 0, true, {}}, {"a", -1, false, {}}}) {
        EXPECT_EQ(expected, keys(storage->query(kCollection, from, limit, ascending))) << from << limit << ascending;
    }
}

TEST_F(CollectionStorageTest, IndexRowsFollowEverySaveAndDeleteAndAThrowingIndexerFailsTheSave) {
    std::vector<std::string> seen;
    callbacks->setCollectionIndexerFunction([&](const std::string& collection, const std::string& primaryKey,
                                                const std::string& sortKey, const std::vector<unsigned char>& blob) {
        seen.push_back(collection + "|" + primaryKey + "|" + sortKey + "|" + std::string(blob.begin(), blob.end()));
        return Fields{{"tag", "x"}, {"tag", "x"}, {"owner", primaryKey}};
    });
    save("p1", "s1", std::string("a\0b", 3));
    save("p2", "s2");
    EXPECT_EQ((Keys{"app:items|p1|s1|" + std::string("a\0b", 3), "app:items|p2|s2|"}), seen);
    EXPECT_EQ((Keys{"owner=p1", "tag=x", "tag=x"}), indexRows("p1"));  // duplicates kept

    indexBy([](const std::string&) { return Fields{{"tag", "y"}}; });
    save("p1", "s1");
    storage->deleteObject(kCollection, "p2");
    storage->deleteObject(kCollection, "missing");
    EXPECT_EQ((Keys{"p1"}), keys(storage->query(kCollection, "", -1, true)));
    EXPECT_TRUE(indexRows("p2").empty());
    EXPECT_EQ((Keys{"tag=y"}), indexRows("p1"));  // replaced, not added to, and not deleted with p2
    callbacks->setCollectionIndexerFunction(nullptr);
    save("p1", "s1", "kept");  // no indexer: the old rows still go
    EXPECT_TRUE(indexRows("p1").empty());

    // A throwing indexer reaches the caller, whose transaction undoes the save.
    indexBy([](const std::string&) -> Fields { throw std::runtime_error("indexer failed"); });
    EXPECT_THROW(db->runInTransaction([&] { save("p1", "s1", "lost"); }, Database::TransactionType::Immediate),
                 std::runtime_error);
    EXPECT_EQ("kept", std::get<2>(readAll(storage->getObject(kCollection, "p1")).at(0)));
}

TEST_F(CollectionStorageTest, IndexedQueriesFillEveryPlaceholderBindArgumentsThenLimitAndSortByFieldText) {
    indexBy([](const std::string& primaryKey) {
        Fields fields{{"kind", "k"}};
        if (primaryKey != "none") fields.emplace("rank", primaryKey.substr(1));
        return fields;
    });
    for (const char* key : {"r9", "r10", "none", "r2"}) save(key, "s");
    const std::string kindAndRank = "SELECT primary_key FROM {0} WHERE field_name = ? AND field_value = ? "
                                    "INTERSECT SELECT primary_key FROM {0} WHERE field_name = ? AND field_value = ?";
    EXPECT_EQ((Keys{"r10"}), keys(storage->queryWithIndex(kCollection, kindAndRank, {"kind", "k", "rank", "10"}, -1)));
    const std::string everything = "SELECT primary_key FROM {0}";
    EXPECT_EQ(4u, keys(storage->queryWithIndex(kCollection, everything, {}, -1)).size());
    EXPECT_EQ(2u, keys(storage->queryWithIndex(kCollection, everything, {}, 2)).size());
    EXPECT_TRUE(keys(storage->queryWithIndex(kCollection, everything, {}, 0)).empty());
    const std::string literalTable = "SELECT primary_key FROM \"collection_index_app:items\" WHERE field_value = ?";
    EXPECT_EQ((Keys{"r9"}), keys(storage->queryWithIndex(kCollection, literalTable, {"9"}, 5)));  // no {0}

    // Text order, and objects without the field first ascending.
    const std::string byKind = "SELECT primary_key FROM {0} WHERE field_name = ? AND field_value = ?";
    auto sorted = [&](Direction direction, int limit) {
        return keys(storage->queryWithIndexSorted(kCollection, byKind, {"kind", "k"}, "rank", direction, limit));
    };
    EXPECT_EQ((Keys{"none", "r10", "r2", "r9"}), sorted(Direction::ASCENDING, -1));
    EXPECT_EQ((Keys{"r9", "r2", "r10", "none"}), sorted(Direction::DESCENDING, -1));
    EXPECT_EQ((Keys{"r9", "r2"}), sorted(static_cast<Direction>(7), 2));
    // No arguments: the sort field is parameter 1 and the limit parameter 2.
    EXPECT_EQ((Keys{"none", "r10"}),
              keys(storage->queryWithIndexSorted(kCollection, everything, {}, "rank", Direction::ASCENDING, 2)));
}

}  // namespace
