// Scale: local save and range query in collections of 1 000, 100 000 and
// 1 000 000 objects, to show that their cost stays flat as a collection grows.
// A save here replaces a randomly picked existing object with a new blob, so
// that the collection keeps its size; the range query reads 100 rows from a
// random sort key. Both against the same statements on raw SQLite, on a copy
// of the same filled file.
#include <map>

#include "BenchSupport.h"
#include "FloorWrites.h"

namespace bench {
namespace {

constexpr int kSavesPerRepetition = 2000;
constexpr int kRangeRows = 100;
const std::vector<int64_t> kSizes = {1000, 100000, 1000000};

using lumivale::tessarine::CollectionStorage;

struct Environment {
    explicit Environment(uint64_t theObjects) : objects(theObjects) {}
    uint64_t objects;
    ScratchDir dir;
    bool filesMade = makeSideFiles(dir, objects, 0);
    std::unique_ptr<OpenStore> ours = std::make_unique<OpenStore>(dir.file("ours.db"));
    RawDatabase floorDatabase{dir.file("floor.db")};
    FloorWrites floor{floorDatabase, *ours->transport, false};
    // Each side replaces the same objects in the same order.
    uint64_t oursGeneration = 0;
    uint64_t floorGeneration = 0;
};

std::map<uint64_t, std::unique_ptr<Environment>> environments;

Environment& environment(const benchmark::State& state) {
    uint64_t objects = static_cast<uint64_t>(state.range(0));
    std::unique_ptr<Environment>& slot = environments[objects];
    if (!slot) {
        slot = std::make_unique<Environment>(objects);
        atTeardown([&slot] { slot.reset(); });
    }
    return *slot;
}

void saveOurs(benchmark::State& state) {
    Environment& env = environment(state);
    const CpuMeter cpu;
    for (auto _ : state) {
        uint64_t generation = ++env.oursGeneration;
        uint64_t i = mix(generation) % env.objects;
        if (!env.ours->collection->saveObject(primaryKey(i), sortKey(i), blob(i, generation))) {
            state.SkipWithError("saveObject failed");
            break;
        }
    }
    report(state, 1, cpu);
}

void saveFloor(benchmark::State& state) {
    Environment& env = environment(state);
    const CpuMeter cpu;
    for (auto _ : state) {
        uint64_t generation = ++env.floorGeneration;
        uint64_t i = mix(generation) % env.objects;
        env.floor.save(primaryKey(i), sortKey(i), blob(i, generation));
    }
    report(state, 1, cpu);
}

void queryOurs(benchmark::State& state) {
    Environment& env = environment(state);
    uint64_t rows = 0, k = 0;
    const CpuMeter cpu;
    for (auto _ : state) {
        auto cursor = env.ours->collection->query(sortKey(mix(k++) % (env.objects - kRangeRows)), kRangeRows,
                                                  CollectionStorage::SortDirection::ASCENDING);
        if (!cursor) throw std::runtime_error("query failed");
        while (cursor->step()) {
            std::string key = cursor->getPrimaryKey();
            std::string sort = cursor->getSortKey();
            benchmark::DoNotOptimize(key.data());
            benchmark::DoNotOptimize(sort.data());
            benchmark::DoNotOptimize(cursor->getBlob().first);
            benchmark::DoNotOptimize(cursor->getStatus());
            ++rows;
        }
    }
    report(state, static_cast<double>(rows) / static_cast<double>(state.iterations()), cpu);
}

void queryFloor(benchmark::State& state) {
    Environment& env = environment(state);
    RawStatement statement(env.floorDatabase, sql::kQueryCollection);
    uint64_t rows = 0, k = 0;
    const CpuMeter cpu;
    for (auto _ : state) {
        statement.start().bind(1, sortKey(mix(k++) % (env.objects - kRangeRows))).bind(2, kRangeRows + 0LL);
        while (statement.step()) {
            std::string key = statement.columnText(0);
            std::string sort = statement.columnText(1);
            benchmark::DoNotOptimize(key.data());
            benchmark::DoNotOptimize(sort.data());
            benchmark::DoNotOptimize(statement.columnBlob(2).first);
            benchmark::DoNotOptimize(statement.columnInt64(3));
            ++rows;
        }
        statement.done();
    }
    report(state, static_cast<double>(rows) / static_cast<double>(state.iterations()), cpu);
}

const bool registered = [] {
    for (int64_t size : kSizes) {
        add("scale_save/ours", saveOurs)->Arg(size)->Iterations(kSavesPerRepetition);
        add("scale_save/floor", saveFloor)->Arg(size)->Iterations(kSavesPerRepetition);
        add("scale_range_query/ours", queryOurs)->Arg(size);
        add("scale_range_query/floor", queryFloor)->Arg(size);
    }
    return true;
}();

}  // namespace
}  // namespace bench

int main(int argc, char** argv) { return bench::runMain(argc, argv); }
