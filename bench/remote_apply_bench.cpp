// Remote apply: one delivery of 1000 other-client save deltas through the
// transport's onDeltaReceived, until the application's callback has them,
// per delta; against the same statements in one transaction on raw SQLite.
#include "BenchSupport.h"
#include "FloorWrites.h"

namespace bench {
namespace {

constexpr int kDeltasPerDelivery = 1000;
constexpr int kDeliveriesPerRepetition = 10;
const std::string kOtherClient = "0123456789ABCDEF0123456789ABCDEF";

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

// Deltas first..first+count-1 of the other client, each a new object.
std::vector<SyncProtocol::Delta> delivery(uint64_t first) {
    std::vector<SyncProtocol::Delta> deltas(kDeltasPerDelivery);
    for (int k = 0; k < kDeltasPerDelivery; ++k) {
        uint64_t i = first + static_cast<uint64_t>(k);
        SyncProtocol::Delta& delta = deltas[static_cast<size_t>(k)];
        delta.clientId = kOtherClient;
        delta.collectionName = kCollection;
        delta.versionId = i + 1;
        delta.primaryKey = primaryKey(i);
        delta.sortKey = sortKey(i);
        delta.blob = blob(i);
        delta.sequenceNumber = i + 1;
    }
    return deltas;
}

void ours(benchmark::State& state) {
    Environment& env = lazily(environment);
    OpenStore& store = *env.ours;
    const CpuMeter cpu;
    for (auto _ : state) {
        state.PauseTiming();
        std::vector<SyncProtocol::Delta> deltas = delivery(env.nextOurs);
        env.nextOurs += kDeltasPerDelivery;
        uint64_t target = store.callbacks->seen() + kDeltasPerDelivery;
        state.ResumeTiming();
        store.transport->onDeltaReceived(deltas);
        if (!store.callbacks->waitFor(target)) {
            state.SkipWithError("the callback never saw the delivery");
            break;
        }
    }
    report(state, kDeltasPerDelivery, cpu);
}

void floorSide(benchmark::State& state, bool prepareEachUse) {
    Environment& env = lazily(environment);
    FloorWrites& floor = prepareEachUse ? env.floorPrepare : env.floor;
    uint64_t& next = prepareEachUse ? env.nextFloorPrepare : env.nextFloor;
    const CpuMeter cpu;
    for (auto _ : state) {
        state.PauseTiming();
        std::vector<SyncProtocol::Delta> deltas = delivery(next);
        next += kDeltasPerDelivery;
        state.ResumeTiming();
        floor.applyRemote(deltas);
    }
    report(state, kDeltasPerDelivery, cpu);
}

const bool registered = [] {
    add("remote_apply/ours", ours)->Iterations(kDeliveriesPerRepetition);
    add("remote_apply/floor", [](benchmark::State& s) { floorSide(s, false); })
        ->Iterations(kDeliveriesPerRepetition);
    add("remote_apply/floor_prepare", [](benchmark::State& s) { floorSide(s, true); })
        ->Iterations(kDeliveriesPerRepetition);
    return true;
}();

}  // namespace
}  // namespace bench

int main(int argc, char** argv) { return bench::runMain(argc, argv); }
