#include "NatsCluster.h"

#include <fstream>
#include <mutex>
#include <set>
#include <sstream>
#include <stdexcept>
#include <vector>

#include "server/LoopbackPort.h"
#include "tessarine/mqtt/MqttConnection.h"

namespace testsupport {

namespace {

namespace mqtt = lumivale::tessarine::mqtt;
using lumivale::tessarine::server::freeLoopbackPort;

// Two levels: not one of the server's request topics ("/+").
const char* const kProbeTopic = "/tessarine_test/nats_cluster_probe";
constexpr size_t kLogTailBytes = 4000;

// One MQTT client per running node, each publishing its node's number on
// the probe topic (the next one once the last is acknowledged) and
// recording from which nodes it has received.
class Probe {
public:
    explicit Probe(const std::vector<std::pair<size_t, int>>& nodePorts) {
        for (const auto& [node, port] : nodePorts) {
            mqtt::ConnectionOptions options;
            options.port = port;
            options.maxReconnectDelaySeconds = 1;
            auto client = std::make_unique<Client>();
            client->node = node;
            Client* self = client.get();
            client->connection = std::make_unique<mqtt::MqttConnection>(
                options, "cluster probe " + std::to_string(node),
                mqtt::MqttConnection::Handlers{
                    nullptr,
                    [this, self](const std::string&, std::vector<unsigned char> payload, bool) {
                        std::lock_guard<std::mutex> lock(mutex);
                        self->heardFrom.insert(std::string(payload.begin(), payload.end()));
                    },
                    [this, self](int) {
                        std::lock_guard<std::mutex> lock(mutex);
                        self->inFlight = false;
                    },
                    [this, self] {
                        std::lock_guard<std::mutex> lock(mutex);
                        self->inFlight = false;
                    }});
            client->connection->subscribe(kProbeTopic);
            clients.push_back(std::move(client));
        }
        for (auto& client : clients) client->connection->start();
    }

    // Publishes where nothing is in flight; true once every client has
    // heard from every other.
    bool poll() {
        for (auto& client : clients) {
            if (!client->connection->isConnected() || !markInFlight(*client)) continue;
            std::string from = std::to_string(client->node);
            if (client->connection->publish(kProbeTopic, std::vector<unsigned char>(from.begin(), from.end())) == 0) {
                std::lock_guard<std::mutex> lock(mutex);
                client->inFlight = false;
            }
        }
        std::lock_guard<std::mutex> lock(mutex);
        for (auto& client : clients) {
            for (auto& other : clients) {
                if (other != client && client->heardFrom.count(std::to_string(other->node)) == 0) return false;
            }
        }
        return true;
    }

private:
    struct Client;

    // Marked before publishing (the acknowledgement may come first); false
    // when a probe is in flight already.
    bool markInFlight(Client& client) {
        std::lock_guard<std::mutex> lock(mutex);
        if (client.inFlight) return false;
        client.inFlight = true;
        return true;
    }

    struct Client {
        size_t node = 0;
        bool inFlight = false;
        std::set<std::string> heardFrom;
        std::unique_ptr<mqtt::MqttConnection> connection;
    };

    std::mutex mutex;  // guards the clients' state; handlers take it, never across a call out
    std::vector<std::unique_ptr<Client>> clients;
};

}  // namespace

NatsCluster::NatsCluster(const TempDir& dir) {
    for (Node& node : nodes) {
        node.clientPort = freeLoopbackPort();
        node.routePort = freeLoopbackPort();
        node.mqttPort = freeLoopbackPort();
    }
    for (size_t i = 0; i < kNodes; ++i) {
        std::string name = "nats-node" + std::to_string(i);
        nodes[i].config = dir.file(name + ".conf");
        nodes[i].log = dir.file(name + ".log");
        std::ofstream out(nodes[i].config);
        out << "server_name: " << name << "\n"
            << "listen: 127.0.0.1:" << nodes[i].clientPort << "\n"
            << "log_file: \"" << nodes[i].log << "\"\n"
            << "jetstream {\n  store_dir: \"" << dir.file(name) << "\"\n"
            << "  max_memory_store: 64MB\n  max_file_store: 1GB\n}\n"
            << "cluster {\n  name: tessarine-test\n  listen: 127.0.0.1:" << nodes[i].routePort << "\n  routes: [";
        const char* separator = " ";
        for (size_t j = 0; j < kNodes; ++j) {
            if (j == i) continue;
            out << separator << "nats-route://127.0.0.1:" << nodes[j].routePort;
            separator = ", ";
        }
        out << " ]\n}\n"
            << "mqtt {\n  listen: 127.0.0.1:" << nodes[i].mqttPort << "\n  stream_replicas: " << kNodes << "\n}\n";
    }
}

void NatsCluster::launch(size_t node) {
    nodes.at(node).process =
        std::make_unique<ChildProcess>("nats-server", std::vector<std::string>{"-c", nodes[node].config});
}

void NatsCluster::start() {
    for (size_t i = 0; i < kNodes; ++i) {
        if (!running(i)) launch(i);
    }
    waitReady();
}

void NatsCluster::start(size_t node) {
    if (running(node)) throw std::logic_error("NATS node " + std::to_string(node) + " is running");
    launch(node);
    waitReady();
}

void NatsCluster::kill(size_t node) { nodes.at(node).process.reset(); }

void NatsCluster::waitReady() {
    std::vector<std::pair<size_t, int>> live;  // (node, MQTT port)
    for (size_t i = 0; i < kNodes; ++i) {
        if (running(i)) live.emplace_back(i, nodes[i].mqttPort);
    }
    Probe probe(live);
    bool exited = false;
    bool ready = waitUntil(
        [&] {
            for (const auto& entry : live) exited = exited || nodes[entry.first].process->hasExited();
            return exited || probe.poll();
        },
        kReadyDeadline);
    if (!ready || exited) {
        std::string logs;
        for (const auto& entry : live) logs += "\nnode " + std::to_string(entry.first) + ":\n" + logTail(entry.first);
        throw std::runtime_error(exited ? "a NATS node exited" + logs
                                        : "the NATS cluster did not become ready for MQTT" + logs);
    }
}

std::string NatsCluster::logTail(size_t node) const {
    std::ifstream in(nodes.at(node).log);
    std::stringstream text;
    text << in.rdbuf();
    std::string all = text.str();
    return all.size() > kLogTailBytes ? all.substr(all.size() - kLogTailBytes) : all;
}

}  // namespace testsupport
