// A cluster of three nats-server nodes for the tests of networked sync, each
// with its MQTT listener (which JetStream backs): child processes on free
// ports of 127.0.0.1, with their configuration and JetStream store in the
// test's temporary directory. A node can be killed without warning and
// started again with the same configuration, ports and store, as a crashed
// node comes back. Used like MqttBroker: start(), then connect MQTT clients
// to port(node) of any node.
//
// Ready means what the stores need, not just open ports: start() and
// start(node) return once an MQTT client on every running node has received
// a QoS 1 message published on each other running node (JetStream elected
// its leaders and created the MQTT streams), or throw std::runtime_error at
// the deadline.
//
// The destructor kills every node it started (by process id) and reaps it.
// Not thread-safe: one test thread drives it.
#pragma once

#include <array>
#include <chrono>
#include <memory>
#include <string>

#include "ChildProcess.h"
#include "TestSupport.h"

namespace testsupport {

class NatsCluster {
public:
    static constexpr size_t kNodes = 3;
    // How long a node (or the whole cluster) may take to become ready.
    static constexpr std::chrono::seconds kReadyDeadline{60};

    // Writes the configurations; starts nothing.
    explicit NatsCluster(const TempDir& dir);

    // Starts every node that is not running and waits until all are ready.
    void start();
    // Starts one node that was killed and waits until it is ready and the
    // others still are.
    void start(size_t node);
    // Kills one node with SIGKILL, as a crash would, and reaps it.
    void kill(size_t node);

    // The MQTT listener's port of a node.
    int port(size_t node) const { return nodes.at(node).mqttPort; }
    bool running(size_t node) const { return nodes.at(node).process != nullptr; }
    // The tail of a node's log, for failure messages.
    std::string logTail(size_t node) const;

private:
    struct Node {
        int clientPort = 0;
        int routePort = 0;
        int mqttPort = 0;
        std::string config;
        std::string log;
        std::unique_ptr<ChildProcess> process;
    };

    void launch(size_t node);
    void waitReady();

    std::array<Node, kNodes> nodes;
};

}  // namespace testsupport
