// Reads in a collection of 100 000 objects, per row read: a range of 100 rows
// by sort key, a fetch by primary key, an indexed query and an indexed sorted
// query (about 100 rows each), through Collection and Cursor, against the
// same statements on raw SQLite. Reads change nothing, so both sides run on
// copies of one filled file.
#include <functional>

#include "BenchSupport.h"

namespace bench {
namespace {

constexpr uint64_t kObjects = 100000;
constexpr int kRangeRows = 100;
constexpr int kIndexLimit = 1000;

using lumivale::tessarine::CollectionStorage;
using lumivale::tessarine::Cursor;

struct Environment {
    ScratchDir dir;
    bool filesMade = makeSideFiles(dir, kObjects, 0);
    std::unique_ptr<OpenStore> ours = std::make_unique<OpenStore>(dir.file("ours.db"));
    RawDatabase floorDatabase{dir.file("floor.db")};
    RawDatabase floorPrepareDatabase{dir.file("floor_prepare.db")};
};

std::unique_ptr<Environment> environment;

// Reads every row of a cursor as an application would: keys copied, blob
// and status looked at.
size_t readRows(std::unique_ptr<Cursor> cursor) {
    if (!cursor) throw std::runtime_error("query failed");
    size_t rows = 0;
    while (cursor->step()) {
        std::string key = cursor->getPrimaryKey();
        std::string sort = cursor->getSortKey();
        auto bytes = cursor->getBlob();
        int status = cursor->getStatus();
        benchmark::DoNotOptimize(key.data());
        benchmark::DoNotOptimize(sort.data());
        benchmark::DoNotOptimize(bytes.first);
        benchmark::DoNotOptimize(status);
        ++rows;
    }
    return rows;
}

size_t readRows(RawStatement& statement) {
    size_t rows = 0;
    while (statement.step()) {
        std::string key = statement.columnText(0);
        std::string sort = statement.columnText(1);
        auto bytes = statement.columnBlob(2);
        long long status = statement.columnInt64(3);
        benchmark::DoNotOptimize(key.data());
        benchmark::DoNotOptimize(sort.data());
        benchmark::DoNotOptimize(bytes.first);
        benchmark::DoNotOptimize(status);
        ++rows;
    }
    statement.done();
    return rows;
}

// Runs one query per iteration, the k-th picking its target from k, and
// reports the time per row read.
void measure(benchmark::State& state, const std::function<size_t(uint64_t)>& query) {
    lazily(environment);  // built before the clock runs
    size_t rows = 0;
    uint64_t k = 0;
    const CpuMeter cpu;
    for (auto _ : state) rows += query(mix(k++));
    if (rows == 0) throw std::runtime_error("no rows read");
    report(state, static_cast<double>(rows) / static_cast<double>(state.iterations()), cpu);
}

lumivale::tessarine::Collection& collection() { return *lazily(environment).ours->collection; }

RawDatabase& floorDatabase(bool prepareEachUse) {
    Environment& env = lazily(environment);
    return prepareEachUse ? env.floorPrepareDatabase : env.floorDatabase;
}

std::vector<std::string> tagArguments(uint64_t pick) { return {"tag", tagOf(pick)}; }

void registerOurs() {
    add("range_query/ours", [](benchmark::State& state) {
        measure(state, [](uint64_t pick) {
            return readRows(collection().query(sortKey(pick % (kObjects - kRangeRows)), kRangeRows,
                                               CollectionStorage::SortDirection::ASCENDING));
        });
    });
    add("get_object/ours", [](benchmark::State& state) {
        measure(state, [](uint64_t pick) { return readRows(collection().getObject(primaryKey(pick % kObjects))); });
    });
    add("indexed_query/ours", [](benchmark::State& state) {
        measure(state, [](uint64_t pick) {
            return readRows(collection().queryWithIndex(sql::kIndexSubquery, tagArguments(pick), kIndexLimit));
        });
    });
    add("indexed_sorted_query/ours", [](benchmark::State& state) {
        measure(state, [](uint64_t pick) {
            return readRows(collection().queryWithIndexSorted(sql::kIndexSubquery, tagArguments(pick), "rank",
                                                              CollectionStorage::SortDirection::ASCENDING,
                                                              kIndexLimit));
        });
    });
}

void registerFloor(const std::string& side, bool prepareEachUse) {
    add("range_query/" + side, [prepareEachUse](benchmark::State& state) {
        RawStatement statement(floorDatabase(prepareEachUse), sql::kQueryCollection, prepareEachUse);
        measure(state, [&](uint64_t pick) {
            statement.start().bind(1, sortKey(pick % (kObjects - kRangeRows))).bind(2, kRangeRows + 0LL);
            return readRows(statement);
        });
    });
    add("get_object/" + side, [prepareEachUse](benchmark::State& state) {
        RawStatement statement(floorDatabase(prepareEachUse), sql::kGetObject, prepareEachUse);
        measure(state, [&](uint64_t pick) {
            statement.start().bind(1, primaryKey(pick % kObjects));
            return readRows(statement);
        });
    });
    add("indexed_query/" + side, [prepareEachUse](benchmark::State& state) {
        RawStatement statement(floorDatabase(prepareEachUse), sql::kQueryWithIndex, prepareEachUse);
        measure(state, [&](uint64_t pick) {
            auto arguments = tagArguments(pick);
            statement.start().bind(1, arguments[0]).bind(2, arguments[1]).bind(3, kIndexLimit + 0LL);
            return readRows(statement);
        });
    });
    add("indexed_sorted_query/" + side, [prepareEachUse](benchmark::State& state) {
        RawStatement statement(floorDatabase(prepareEachUse), sql::kQueryWithIndexSorted, prepareEachUse);
        measure(state, [&](uint64_t pick) {
            auto arguments = tagArguments(pick);
            statement.start()
                .bind(1, std::string("rank"))
                .bind(2, arguments[0])
                .bind(3, arguments[1])
                .bind(4, kIndexLimit + 0LL);
            return readRows(statement);
        });
    });
}

const bool registered = [] {
    registerOurs();
    registerFloor("floor", false);
    registerFloor("floor_prepare", true);
    return true;
}();

}  // namespace
}  // namespace bench

int main(int argc, char** argv) { return bench::runMain(argc, argv); }
