// Helper program of the test suite: one store, in a process of its own,
// syncing "net:notes" through a broker with the MQTT transport.
//
//   sync_device <database> <broker port> <tag> <writes> <pause ms> <state file> [<user> <password>]
//
// Makes <writes> changes, <pause ms> apart: write i saves "<tag>-<i % 4>"
// with the blob "<tag>:<i>", every third one saves "shared" instead (so
// that the devices edit one object concurrently), and every fifth deletes
// "<tag>-<(i + 1) % 4>". Each of its own saves the store reports PERSISTED
// is appended to "<state file>.persisted" as "<primary key> <blob>". Once
// the writes are done it keeps rewriting <state file> (atomically) with the
// line "done" and then the store's objects, as testsupport::objectRows
// gives them. SIGTERM ends it cleanly.
#include <signal.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <fstream>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "SyncDevice.h"
#include "platform/Log.h"
#include "tessarine/mqtt/MqttTransport.h"

namespace {

namespace ts = lumivale::tessarine;

std::atomic<bool> stopping{false};
constexpr std::chrono::milliseconds kStatePeriod(20);
constexpr int kKeys = 4;

void writeState(const std::string& path, const std::vector<std::string>& rows) {
    std::string temporary = path + ".tmp";
    {
        std::ofstream out(temporary, std::ios::trunc);
        out << "done\n";
        for (const std::string& row : rows) out << row << "\n";
    }
    std::rename(temporary.c_str(), path.c_str());
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 7 && argc != 9) {
        std::fprintf(stderr, "usage: %s <database> <port> <tag> <writes> <pause ms> <state file> [<user> <password>]\n",
                     argv[0]);
        return 2;
    }
    const std::string tag = argv[3];
    const int writes = std::stoi(argv[4]);
    const std::chrono::milliseconds pause(std::stoi(argv[5]));
    const std::string statePath = argv[6];
    signal(SIGTERM, [](int) { stopping = true; });
    lumivale::setLogSink([&tag](int priority, const std::string&, const std::string& message) {
        if (priority >= 5) std::fprintf(stderr, "device %s: %s\n", tag.c_str(), message.c_str());
    });

    ts::mqtt::MqttTransport::Options options;
    options.port = std::stoi(argv[2]);
    options.maxReconnectDelaySeconds = 1;
    // A broker that loses changes (a NATS node dying) costs a wait this long
    // and then twice as long each time: short, so that the tests converge
    // within their deadlines.
    options.resendUnansweredAfter = std::chrono::seconds(2);
    if (argc == 9) {
        options.username = argv[7];
        options.password = argv[8];
    }
    auto transport = std::make_shared<ts::mqtt::MqttTransport>(options);
    auto threadCreator = std::make_shared<testsupport::CountingThreadCreator>();
    auto store = ts::Tessarine::open(argv[1], transport, threadCreator);
    if (!store) return 1;

    std::mutex journalMutex;
    std::ofstream journal(statePath + ".persisted", std::ios::app);
    const std::string ownPrefix = tag + ":";
    store->addDeltaReceivedCallback([&](const std::vector<ts::Delta>& deltas) {
        std::lock_guard<std::mutex> lock(journalMutex);
        for (const ts::Delta& delta : deltas) {
            std::string blob(delta.blob.begin(), delta.blob.end());
            if (delta.status == ts::SyncProtocol::DeltaStatus::PERSISTED && blob.rfind(ownPrefix, 0) == 0) {
                journal << delta.primaryKey << " " << blob << std::endl;
            }
        }
    });
    store->start();
    auto notes = store->subscribeCollection("net:notes");
    if (!notes) return 1;

    for (int i = 0; i < writes && !stopping; ++i) {
        std::string blob = ownPrefix + std::to_string(i);
        std::string key = i % 3 == 0 ? "shared" : tag + "-" + std::to_string(i % kKeys);
        notes->saveObject(key, key, std::vector<unsigned char>(blob.begin(), blob.end()));
        if (i % 5 == 4) notes->deleteObject(tag + "-" + std::to_string((i + 1) % kKeys));
        std::this_thread::sleep_for(pause);
    }
    std::optional<std::vector<std::string>> written;
    while (!stopping) {
        std::vector<std::string> rows = testsupport::objectRows(*notes);
        if (rows != written) {
            writeState(statePath, rows);
            written = rows;
        }
        std::this_thread::sleep_for(kStatePeriod);
    }
    notes.reset();
    store.reset();
    return 0;
}
