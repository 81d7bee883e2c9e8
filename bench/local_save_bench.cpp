// Local save: Collection::saveObject of a new object (200-byte blob, two
// index fields), per save, against the same statements on raw SQLite. Each
// side has its own database, grown by the same number of saves.
#include "BenchSupport.h"
#include "FloorWrites.h"

namespace bench {
namespace {

constexpr int kSavesPerRepetition = 3000;

struct Environment {
    ScratchDir dir;
    bool filesMade = makeSideFiles(dir, 0, 0);
    std::unique_ptr<OpenStore> ours = std::make_unique<OpenStore>(dir.file("ours.db"));
    RawDatabase floorDatabase{dir.file("floor.db")};
    RawDatabase floorPrepareDatabase{dir.file("floor_prepare.db")};
    FloorWrites floor{floorDatabase, *ours->transport, false};
    FloorWrites floorPrepare{floorPrepareDatabase, *ours->transport, true};
    uint64_t nextOurs = 0, nextFloor = 0, nextFloorPrepare = 0;
};

std::unique_ptr<Environment> environment;

void ours(benchmark::State& state) {
    Environment& env = lazily(environment);
    const CpuMeter cpu;
    for (auto _ : state) {
        uint64_t i = env.nextOurs++;
        if (!env.ours->collection->saveObject(primaryKey(i), sortKey(i), blob(i))) {
            state.SkipWithError("saveObject failed");
            break;
        }
    }
    report(state, 1, cpu);
}

void floorSide(benchmark::State& state, bool prepareEachUse) {
    Environment& env = lazily(environment);
    FloorWrites& floor = prepareEachUse ? env.floorPrepare : env.floor;
    uint64_t& next = prepareEachUse ? env.nextFloorPrepare : env.nextFloor;
    const CpuMeter cpu;
    for (auto _ : state) {
        uint64_t i = next++;
        floor.save(primaryKey(i), sortKey(i), blob(i));
    }
    report(state, 1, cpu);
}

const bool registered = [] {
    add("local_save/ours", ours)->Iterations(kSavesPerRepetition);
    add("local_save/floor", [](benchmark::State& s) { floorSide(s, false); })->Iterations(kSavesPerRepetition);
    add("local_save/floor_prepare", [](benchmark::State& s) { floorSide(s, true); })
        ->Iterations(kSavesPerRepetition);
    return true;
}();

}  // namespace
}  // namespace bench

int main(int argc, char** argv) { return bench::runMain(argc, argv); }
