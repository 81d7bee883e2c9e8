// The server tier's throughput end to end: changes saved in a store (one
// store, MqttTransport) and sent through a mosquitto broker until the server
// has logged (committed) them all, 1000 per iteration, spread over
// kCollections collections, with
//   - server_tier/sqlite: one tessarine-server instance on its SQLite file
//     (the default);
//   - server_tier/ours/N: N instances sharing one PostgreSQL database
//     (fsync on, as SQLite's synchronous=FULL), the collections spread over
//     them by their leases.
// Broker, database and instances all run on this machine, so the figures
// say what the scale-out costs on one host; the instances here live in this
// process, each with its own broker and database connections and threads,
// as they would in processes of their own. The harnesses are the tests' own
// (tests/MqttBroker.h, tests/PostgresServer.h).
#include <unistd.h>

#include <map>

#include "BenchSupport.h"
#include "MqttBroker.h"
#include "PostgresServer.h"
#include "TestSupport.h"
#include "server/NetworkSyncServer.h"
#include "server/PgConnection.h"
#include "tessarine/mqtt/MqttTransport.h"

namespace bench {
namespace {

namespace ts = lumivale::tessarine;
constexpr int kChangesPerBatch = 1000;
constexpr int kIterations = 5;
constexpr int kCollections = 6;
constexpr uint64_t kKeys = 512;
const std::chrono::seconds kSetupDeadline(60);

std::string collectionName(int i) { return "tier:c" + std::to_string(i); }

ts::mqtt::MqttTransport::Options brokerOptions(int port) {
    ts::mqtt::MqttTransport::Options options;
    options.port = port;
    options.maxReconnectDelaySeconds = 1;
    return options;
}

// Broker, store and the servers under test, with what they have logged.
class Tier {
public:
    // instances == 0: one instance on SQLite.
    explicit Tier(int instances) : postgres(true) {
        broker.start();
        ts::server::NetworkSyncServer::Options options{brokerOptions(broker.port), dir.file("server.db")};
        if (instances > 0) {
            postgres.start();
            options.postgres = postgres.conninfo();
            reader = std::make_unique<ts::server::PgConnection>(postgres.conninfo());
        }
        for (int i = 0; i < std::max(instances, 1); ++i) {
            options.instanceId = "instance-" + std::to_string(i);
            servers.push_back(std::make_unique<ts::server::NetworkSyncServer>(options));
            servers.back()->start();
        }
        store = ts::Tessarine::open(dir.file("store.db"), std::make_shared<ts::mqtt::MqttTransport>(
                                                              brokerOptions(broker.port)),
                                    std::make_shared<StdThreadCreator>());
        store->start();
        for (int i = 0; i < kCollections; ++i) collections.push_back(store->subscribeCollection(collectionName(i)));
        settle(instances);
    }
    ~Tier() {
        collections.clear();
        store.reset();
    }

    // Changes logged over all collections.
    uint64_t logged() {
        uint64_t total = 0;
        if (!reader) {
            for (int i = 0; i < kCollections; ++i) total += servers[0]->rules().sequenceNumber(collectionName(i));
            return total;
        }
        ts::server::PgResult result = reader->exec("SELECT COALESCE(SUM(last), 0) FROM tessarine_sequences");
        return static_cast<uint64_t>(result.integer(0, 0));
    }

    // Saves the next batch and waits until all of it is logged.
    bool runBatch() {
        uint64_t target = logged() + kChangesPerBatch;
        for (int i = 0; i < kChangesPerBatch; ++i) save(i % kCollections);
        return testsupport::waitUntil([&] { return logged() >= target; }, kSetupDeadline);
    }

private:
    void save(int collection) {
        ++next;
        collections[collection]->saveObject(primaryKey(next % kKeys), sortKey(next % kKeys), blob(next));
    }

    // Until the collections are spread over the instances (PostgreSQL) and
    // each has logged a change of the store.
    void settle(int instances) {
        bool spread = !reader || testsupport::waitUntil([&] {
            ts::server::PgResult result = reader->exec(
                "SELECT COUNT(DISTINCT holder), COUNT(*) FROM tessarine_leases WHERE expires_at > now()");
            return result.integer(0, 0) == std::min(instances, kCollections) && result.integer(0, 1) == kCollections;
        }, kSetupDeadline);
        if (!spread) throw std::runtime_error("the collections did not spread over the instances");
        for (int i = 0; i < kCollections; ++i) save(i);
        if (!testsupport::waitUntil([&] { return logged() == kCollections; }, kSetupDeadline)) {
            throw std::runtime_error("the servers did not take the store's first changes");
        }
    }

    testsupport::TempDir dir;
    testsupport::MqttBroker broker{dir};
    testsupport::PostgresServer postgres;
    std::unique_ptr<ts::server::PgConnection> reader;
    std::vector<std::unique_ptr<ts::server::NetworkSyncServer>> servers;
    std::unique_ptr<ts::Tessarine> store;
    std::vector<std::unique_ptr<ts::Collection>> collections;
    uint64_t next = 0;
};

std::map<int, std::unique_ptr<Tier>> tiers;

void throughput(benchmark::State& state, int instances) {
    std::unique_ptr<Tier>& tier = tiers[instances];
    if (!tier) {
        tier = std::make_unique<Tier>(instances);
        atTeardown([&tier] { tier.reset(); });
    }
    const CpuMeter cpu;
    for (auto _ : state) {
        if (!tier->runBatch()) {
            state.SkipWithError("the servers did not log every change");
            break;
        }
    }
    report(state, kChangesPerBatch, cpu);
    state.counters["changes_per_s"] =
        benchmark::Counter(static_cast<double>(kChangesPerBatch) * state.iterations(), benchmark::Counter::kIsRate);
}

const bool registered = [] {
    add("server_tier/sqlite", [](benchmark::State& s) { throughput(s, 0); })->Iterations(kIterations);
    for (int instances : {1, 2, 3}) {
        add("server_tier/ours/" + std::to_string(instances),
            [instances](benchmark::State& s) { throughput(s, instances); })
            ->Iterations(kIterations);
    }
    return true;
}();

}  // namespace
}  // namespace bench

int main(int argc, char** argv) { return bench::runMain(argc, argv); }
