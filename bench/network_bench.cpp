// Networked sync, with a mosquitto broker on loopback that this program
// starts (scripts/setup.sh installs it):
//   - network_latency: saveObject on one store until the change callback of
//     another store has the change, through broker and server (ours: the
//     MqttTransport and NetworkSyncServer with its SQLite file), against the
//     same through the in-process reference server and LoopbackTransport
//     (floor), per change;
//   - server_throughput: changes accepted by the server, 1000 per iteration
//     from one client: published through the broker until the server's log
//     holds them all (ours), handed straight to the same rules over the same
//     SQLite storage (floor), and over the in-memory storage (memory), per change.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>

#include "BenchSupport.h"
#include "server/LoopbackPort.h"
#include "server/LoopbackTransport.h"
#include "server/MemoryLogStorage.h"
#include "server/NetworkSyncServer.h"
#include "server/SqliteLogStorage.h"
#include "tessarine/Protocol.h"
#include "tessarine/mqtt/MqttTransport.h"

extern char** environ;

namespace bench {
namespace {

namespace ts = lumivale::tessarine;
constexpr int kChangesPerBatch = 1000;
constexpr int kLatencyIterations = 200;
constexpr int kThroughputIterations = 5;
const std::string kWriter = "0123456789ABCDEF0123456789ABCDEF";

// mosquitto on a free port of 127.0.0.1, killed and reaped at the end.
class Broker {
public:
    explicit Broker(const ScratchDir& dir) {
        port = ts::server::freeLoopbackPort();
        std::string config = dir.file("mosquitto.conf");
        std::ofstream(config) << "listener " << port << " 127.0.0.1\nallow_anonymous true\n"
                              << "set_tcp_nodelay true\nlog_type error\n" << (geteuid() == 0 ? "user root\n" : "");
        std::string program = "mosquitto", flag = "-c";
        char* argv[] = {program.data(), flag.data(), config.data(), nullptr};
        if (posix_spawnp(&pid, argv[0], nullptr, nullptr, argv, environ) != 0) throw std::runtime_error("no mosquitto");
        for (int attempt = 0; attempt < 2000 && !ts::server::acceptsLoopbackConnections(port); ++attempt) usleep(5000);
    }
    ~Broker() {
        kill(pid, SIGTERM);
        waitpid(pid, nullptr, 0);
    }
    int port = 0;
    pid_t pid = -1;
};

// A store on any transport whose callback counts what it sees.
struct Store {
    Store(const std::string& path, std::shared_ptr<SyncProtocol> theTransport) : transport(std::move(theTransport)) {
        store = ts::Tessarine::open(path, transport, std::make_shared<StdThreadCreator>());
        store->addDeltaReceivedCallback([this](const std::vector<ts::Delta>& deltas) { callbacks.add(deltas.size()); });
        store->start();
        collection = store->subscribeCollection(kCollection);
    }
    ~Store() {
        collection.reset();
        store.reset();
    }
    std::shared_ptr<SyncProtocol> transport;
    CallbackCounter callbacks;
    std::unique_ptr<ts::Tessarine> store;
    std::unique_ptr<ts::Collection> collection;
};

ts::mqtt::MqttTransport::Options brokerOptions(int port) {
    ts::mqtt::MqttTransport::Options options;
    options.port = port;
    return options;
}

struct NetworkEnvironment {
    ScratchDir dir;
    Broker broker{dir};
    ts::server::NetworkSyncServer server{{brokerOptions(broker.port), dir.file("server.db")}};
    bool started = (server.start(), true);
    Store writer{dir.file("writer.db"), std::make_shared<ts::mqtt::MqttTransport>(brokerOptions(broker.port))};
    Store reader{dir.file("reader.db"), std::make_shared<ts::mqtt::MqttTransport>(brokerOptions(broker.port))};
    uint64_t next = 0;
};

struct LoopbackEnvironment {
    ScratchDir dir;
    std::shared_ptr<ts::server::SyncServer> server = std::make_shared<ts::server::SyncServer>();
    Store writer{dir.file("writer.db"), std::make_shared<ts::server::LoopbackTransport>(server)};
    Store reader{dir.file("reader.db"), std::make_shared<ts::server::LoopbackTransport>(server)};
    uint64_t next = 0;
};

std::unique_ptr<NetworkEnvironment> network;
std::unique_ptr<LoopbackEnvironment> loopback;

template <typename Environment>
void latency(benchmark::State& state, Environment& env) {
    const CpuMeter cpu;
    // The stores connect and subscribe first: one change through to begin with.
    uint64_t target = env.reader.callbacks.seen() + 1;
    env.writer.collection->saveObject(primaryKey(env.next), sortKey(env.next), blob(env.next));
    ++env.next;
    if (!env.reader.callbacks.waitFor(target)) state.SkipWithError("the first change never arrived");
    for (auto _ : state) {
        target = env.reader.callbacks.seen() + 1;
        env.writer.collection->saveObject(primaryKey(env.next), sortKey(env.next), blob(env.next));
        ++env.next;
        if (!env.reader.callbacks.waitFor(target)) {
            state.SkipWithError("the change never reached the other store");
            break;
        }
    }
    report(state, 1, cpu);
}

// Change record payloads of the writer, versions first+1 .. first+count.
std::vector<std::vector<unsigned char>> changes(uint64_t first) {
    std::vector<std::vector<unsigned char>> payloads;
    for (uint64_t i = first; i < first + kChangesPerBatch; ++i) {
        SyncProtocol::Delta delta;
        delta.clientId = kWriter;
        delta.collectionName = kCollection;
        delta.versionId = i + 1;
        delta.primaryKey = primaryKey(i);
        delta.sortKey = sortKey(i);
        delta.blob = blob(i);
        payloads.push_back(ts::protocol::makePayloadForSendDelta(delta));
    }
    return payloads;
}

std::vector<unsigned char> subscription() {
    return ts::protocol::makePayloadForSubscription({"\x01", kCollection, kWriter, 0});
}

struct BrokerThroughput {
    ScratchDir dir;
    Broker broker{dir};
    ts::server::NetworkSyncServer server{{brokerOptions(broker.port), dir.file("server.db")}};
    ts::mqtt::MqttConnection client{brokerOptions(broker.port), "bench", {}};
    uint64_t next = 0;
    BrokerThroughput() {
        server.start();
        client.start();
        // The server takes a client's changes once it has subscribed; both
        // go again until the server (connecting meanwhile) has the first.
        std::vector<unsigned char> first = changes(0)[0];
        for (int attempt = 0; attempt < 1000 && server.rules().sequenceNumber(kCollection) == 0; ++attempt) {
            client.publish(ts::protocol::TOPIC_SUBSCRIBE_COLLECTION, subscription());
            client.publish(ts::protocol::TOPIC_CHANGE_RECORD, first);
            usleep(10000);
        }
        next = kChangesPerBatch;
    }
};
std::unique_ptr<BrokerThroughput> brokerThroughput;

void throughputThroughBroker(benchmark::State& state) {
    BrokerThroughput& env = lazily(brokerThroughput);
    const CpuMeter cpu;
    for (auto _ : state) {
        state.PauseTiming();
        auto payloads = changes(env.next);
        env.next += kChangesPerBatch;
        uint64_t target = env.server.rules().sequenceNumber(kCollection) + kChangesPerBatch;
        state.ResumeTiming();
        for (const auto& payload : payloads) {
            while (env.client.publish(ts::protocol::TOPIC_CHANGE_RECORD, payload) == 0) usleep(100);
        }
        while (env.server.rules().sequenceNumber(kCollection) < target) usleep(200);
    }
    report(state, kChangesPerBatch, cpu);
}

// The rules with no broker: every payload handed to receive() on this thread.
void throughputDirect(benchmark::State& state, std::unique_ptr<ts::server::LogStorage> storage) {
    ScratchDir dir;
    ts::server::SyncServer server(std::move(storage));
    auto session = server.attach([](std::vector<unsigned char>) {});
    server.receive(session, ts::protocol::TOPIC_SUBSCRIBE_COLLECTION, subscription());
    uint64_t next = 0;
    const CpuMeter cpu;
    for (auto _ : state) {
        state.PauseTiming();
        auto payloads = changes(next);
        next += kChangesPerBatch;
        state.ResumeTiming();
        for (const auto& payload : payloads) server.receive(session, ts::protocol::TOPIC_CHANGE_RECORD, payload);
    }
    report(state, kChangesPerBatch, cpu);
}

const bool registered = [] {
    add("network_latency/ours", [](benchmark::State& s) { latency(s, lazily(network)); })
        ->Iterations(kLatencyIterations);
    add("network_latency/floor", [](benchmark::State& s) { latency(s, lazily(loopback)); })
        ->Iterations(kLatencyIterations);
    add("server_throughput/ours", throughputThroughBroker)->Iterations(kThroughputIterations);
    add("server_throughput/floor", [](benchmark::State& s) {
        ScratchDir dir;
        throughputDirect(s, std::make_unique<ts::server::SqliteLogStorage>(dir.file("server.db")));
    })->Iterations(kThroughputIterations);
    add("server_throughput/memory", [](benchmark::State& s) {
        throughputDirect(s, std::make_unique<ts::server::MemoryLogStorage>());
    })->Iterations(kThroughputIterations);
    return true;
}();

}  // namespace
}  // namespace bench

int main(int argc, char** argv) { return bench::runMain(argc, argv); }
