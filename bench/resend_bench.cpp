// Resend: onConnectionEstablished with 10 000 queued deltas, until the
// transport has them all (the store first resubscribes its one collection),
// against the same statements on raw SQLite handing the same records to the
// same transport. The queue is not changed by a resend, so every iteration
// sends the whole queue again.
//
// resend/floor_read_first is the floor reading the whole queue into a vector
// first and then sending it, as the store once did; it shows what streaming
// the queue in chunks saves.
//
// sync_metrics/<side> reads Tessarine::getSyncMetrics with the same 10 000
// deltas queued, against the count by status on raw SQLite (the rest of the
// metrics is memory only).
//
// resend_memory/<side>/100000 resends a queue of 100 000 once and reports
// how far that raised the process's peak resident memory (counter
// "rss_growth_kib"); scripts/bench.sh runs each side in a process of its own.
// resend_memory/ours/1000 does the same with 1 000 queued, so that the
// growth that depends on the queue's length can be read off.
#include <map>

#include "BenchSupport.h"

namespace bench {
namespace {

constexpr uint64_t kQueued = 10000;
constexpr uint64_t kQueuedForMemory = 100000;
constexpr uint64_t kQueuedForSmallMemory = 1000;

struct Environment {
    explicit Environment(uint64_t theQueued) : queued(theQueued) {}
    uint64_t queued;
    ScratchDir dir;
    bool filesMade = makeSideFiles(dir, 0, queued);
    std::unique_ptr<OpenStore> ours = std::make_unique<OpenStore>(dir.file("ours.db"));
    RawDatabase floorDatabase{dir.file("floor.db")};
    RawDatabase floorPrepareDatabase{dir.file("floor_prepare.db")};
};

std::map<uint64_t, std::unique_ptr<Environment>> environments;

Environment& environment(uint64_t queued) {
    std::unique_ptr<Environment>& slot = environments[queued];
    if (!slot) {
        slot = std::make_unique<Environment>(queued);
        atTeardown([&slot] { slot.reset(); });
    }
    return *slot;
}

void resendOurs(OpenStore& store, uint64_t queued) {
    uint64_t before = store.transport->deltasSent;
    store.transport->onConnectionEstablished();
    if (store.transport->deltasSent - before != queued) throw std::runtime_error("not every delta was sent");
}

// What the store does on a connection, on raw statements: resubscribe every
// stored subscription (reading the library version and client id for each
// request), then send every queued delta, oldest first, stamped with the
// client id.
class FloorResend {
public:
    FloorResend(RawDatabase& database, CountingTransport& theTransport, bool prepareEachUse,
                bool theReadWholeQueueFirst = false)
        : transport(theTransport),
          readWholeQueueFirst(theReadWholeQueueFirst),
          subscriptions(database, sql::kGetSubscriptions, prepareEachUse),
          metadata(database, sql::kGetMetadata, prepareEachUse),
          allDeltas(database, sql::kGetAllDeltas, prepareEachUse) {}

    void resend() {
        subscriptions.start();
        while (subscriptions.step()) {
            SyncProtocol::SubscriptionRequest request;
            request.collectionName = subscriptions.columnText(0);
            request.sequenceNumber = static_cast<uint64_t>(subscriptions.columnInt64(1));
            request.version = std::string(1, static_cast<char>(readMetadata("version").columnInt64(0) & 0xFF));
            metadata.done();
            request.clientId = readMetadata("client_id").columnText(0);
            metadata.done();
            transport.sendSubscriptionRequest(request);
        }
        subscriptions.done();
        std::string clientId = readMetadata("client_id").columnText(0);
        metadata.done();
        allDeltas.start();
        std::vector<std::pair<SyncProtocol::Delta, SyncProtocol::DeltaStatus>> queue;
        while (allDeltas.step()) {
            SyncProtocol::Delta delta;
            delta.clientId = clientId;
            delta.collectionName = allDeltas.columnText(0);
            delta.versionId = static_cast<uint64_t>(allDeltas.columnInt64(1));
            delta.type = static_cast<SyncProtocol::DeltaType>(allDeltas.columnInt64(2));
            delta.primaryKey = allDeltas.columnText(3);
            delta.sortKey = allDeltas.columnText(4);
            auto bytes = allDeltas.columnBlob(5);
            delta.blob.assign(bytes.first, bytes.first + bytes.second);
            if (readWholeQueueFirst) {
                auto status = static_cast<SyncProtocol::DeltaStatus>(allDeltas.columnInt64(6));
                queue.emplace_back(std::move(delta), status);
            } else {
                transport.sendDelta(delta);
            }
        }
        allDeltas.done();
        for (const auto& entry : queue) transport.sendDelta(entry.first);
    }

private:
    RawStatement& readMetadata(const std::string& key) {
        metadata.start().bind(1, key);
        if (!metadata.step()) throw std::runtime_error("no " + key + " in library_metadata");
        return metadata;
    }

    CountingTransport& transport;
    bool readWholeQueueFirst;
    RawStatement subscriptions;
    RawStatement metadata;
    RawStatement allDeltas;
};

void resendFloor(FloorResend& floor, CountingTransport& transport, uint64_t queued) {
    uint64_t before = transport.deltasSent;
    floor.resend();
    if (transport.deltasSent - before != queued) throw std::runtime_error("not every delta was sent");
}

void ours(benchmark::State& state) {
    Environment& env = environment(kQueued);
    const CpuMeter cpu;
    for (auto _ : state) resendOurs(*env.ours, kQueued);
    report(state, 1, cpu);
}

void floorSide(benchmark::State& state, bool prepareEachUse, bool readWholeQueueFirst = false) {
    Environment& env = environment(kQueued);
    FloorResend floor(prepareEachUse ? env.floorPrepareDatabase : env.floorDatabase, *env.ours->transport,
                      prepareEachUse, readWholeQueueFirst);
    const CpuMeter cpu;
    for (auto _ : state) resendFloor(floor, *env.ours->transport, kQueued);
    report(state, 1, cpu);
}

void metricsOurs(benchmark::State& state) {
    Environment& env = environment(kQueued);
    const CpuMeter cpu;
    for (auto _ : state) {
        auto metrics = env.ours->store->getSyncMetrics();
        if (!metrics || metrics->queuedChanges() != kQueued) throw std::runtime_error("wrong queue count");
    }
    report(state, 1, cpu);
}

void metricsFloor(benchmark::State& state, bool prepareEachUse) {
    Environment& env = environment(kQueued);
    RawStatement count(prepareEachUse ? env.floorPrepareDatabase : env.floorDatabase,
                       "SELECT status, COUNT(*) FROM delta_queue GROUP BY status", prepareEachUse);
    const CpuMeter cpu;
    for (auto _ : state) {
        uint64_t queued = 0;
        count.start();
        while (count.step()) queued += static_cast<uint64_t>(count.columnInt64(1));
        count.done();
        if (queued != kQueued) throw std::runtime_error("wrong queue count");
    }
    report(state, 1, cpu);
}

void memory(benchmark::State& state, bool useStore, bool readWholeQueueFirst = false,
            uint64_t queued = kQueuedForMemory) {
    Environment& env = environment(queued);
    FloorResend floor(env.floorDatabase, *env.ours->transport, false, readWholeQueueFirst);
    long before = peakRssKiB();
    const CpuMeter cpu;
    for (auto _ : state) {
        if (useStore) {
            resendOurs(*env.ours, queued);
        } else {
            resendFloor(floor, *env.ours->transport, queued);
        }
    }
    state.counters["rss_growth_kib"] = static_cast<double>(peakRssKiB() - before);
    report(state, 1, cpu);
}

const bool registered = [] {
    add("resend/ours", ours)->Iterations(20);
    add("resend/floor", [](benchmark::State& s) { floorSide(s, false); })->Iterations(20);
    add("resend/floor_prepare", [](benchmark::State& s) { floorSide(s, true); })->Iterations(20);
    add("resend/floor_read_first", [](benchmark::State& s) { floorSide(s, false, true); })->Iterations(20);
    add("sync_metrics/ours", metricsOurs);
    add("sync_metrics/floor", [](benchmark::State& s) { metricsFloor(s, false); });
    add("sync_metrics/floor_prepare", [](benchmark::State& s) { metricsFloor(s, true); });
    add("resend_memory/ours/100000", [](benchmark::State& s) { memory(s, true); })->Iterations(1);
    add("resend_memory/ours/1000", [](benchmark::State& s) { memory(s, true, false, kQueuedForSmallMemory); })
        ->Iterations(1);
    add("resend_memory/floor/100000", [](benchmark::State& s) { memory(s, false); })->Iterations(1);
    add("resend_memory/floor_read_first/100000", [](benchmark::State& s) { memory(s, false, true); })
        ->Iterations(1);
    return true;
}();

}  // namespace
}  // namespace bench

int main(int argc, char** argv) { return bench::runMain(argc, argv); }
