#include <gtest/gtest.h>

#include <memory>
#include <random>
#include <string>
#include <vector>

#include "SyncDevice.h"
#include "TestSupport.h"
#include "server/LoopbackTransport.h"
#include "server/SyncServer.h"

namespace {

namespace ts = lumivale::tessarine;
using ts::server::FaultRates;
using ts::server::LoopbackTransport;
using ts::server::SyncServer;
using testsupport::SyncDevice;

const std::vector<std::string> kCollections = {"app:notes", "app:tags"};

bool converged(std::vector<std::unique_ptr<SyncDevice>>& devices, const SyncServer& server) {
    for (const std::string& name : kCollections) {
        std::vector<std::string> expected = testsupport::serverRows(server, name);
        for (auto& device : devices) {
            if (testsupport::objectRows(device->collection(name)) != expected) return false;
        }
    }
    return true;
}

// Three stores edit the same few objects of two collections while the links
// between them and the server lose, repeat and hold back messages, and go
// down and come back; one store is closed with changes still queued and
// reopened on its file. Once the links are healthy again and every store has
// reconnected, every store holds exactly the server's objects, each
// PERSISTED: no change is lost, applied twice out of order, or left queued.
TEST(ConvergenceTest, StoresConvergeThroughTheServerUnderDroppedDuplicatedAndDelayedMessages) {
    testsupport::TempDir dir;
    auto server = std::make_shared<SyncServer>();
    const FaultRates faults{0.02, 0.05, 0.05, std::chrono::milliseconds(2)};
    std::vector<std::unique_ptr<SyncDevice>> devices;
    for (uint64_t i = 0; i < 3; ++i) {
        devices.push_back(std::make_unique<SyncDevice>(server, dir.file("device" + std::to_string(i) + ".db"), 100 + i));
        for (const std::string& name : kCollections) devices.back()->collection(name);
    }
    auto injectFaults = [&](SyncDevice& device, const FaultRates& rates) {
        device.transport->setFaults(LoopbackTransport::Direction::TO_SERVER, rates);
        device.transport->setFaults(LoopbackTransport::Direction::TO_CLIENT, rates);
    };
    for (auto& device : devices) injectFaults(*device, faults);

    LoopbackTransport::FaultCounts total;
    auto countFaults = [&](SyncDevice& device) {
        auto counts = device.transport->faultCounts();
        total.dropped += counts.dropped;
        total.duplicated += counts.duplicated;
        total.delayed += counts.delayed;
    };

    std::mt19937 random(2024);
    auto pick = [&](int n) { return static_cast<int>(random() % static_cast<unsigned>(n)); };
    for (int round = 0; round < 30; ++round) {
        for (size_t d = 0; d < devices.size(); ++d) {
            SyncDevice& device = *devices[d];
            if (!device.transport->isConnected()) device.transport->connect();
            for (int op = 0; op < 4; ++op) {
                ts::Collection& collection = device.collection(kCollections[pick(2)]);
                std::string key = "k" + std::to_string(pick(5));
                if (pick(4) == 0) {
                    EXPECT_TRUE(collection.deleteObject(key));
                } else {
                    std::vector<unsigned char> blob{static_cast<unsigned char>(round), static_cast<unsigned char>(d),
                                                    static_cast<unsigned char>(op)};
                    EXPECT_TRUE(collection.saveObject(key, "s" + std::to_string(pick(3)), blob));
                }
            }
        }
        if (round == 15) {
            // Offline edits, then the store is closed with them queued and
            // reopened on its file over a new link.
            SyncDevice& device = *devices[0];
            device.transport->disconnect();
            EXPECT_TRUE(device.collection("app:notes").saveObject("k0", "s9", std::vector<unsigned char>{0xEE}));
            EXPECT_TRUE(device.collection("app:tags").deleteObject("k1"));
            countFaults(device);
            device.close();
            device.open(200);
            injectFaults(device, faults);
        }
    }

    for (auto& device : devices) {
        countFaults(*device);
        injectFaults(*device, FaultRates{});
        device->transport->disconnect();
        device->transport->connect();
    }
    EXPECT_TRUE(testsupport::waitUntil([&] { return converged(devices, *server); }));
    for (const std::string& name : kCollections) {
        for (auto& device : devices) {
            EXPECT_EQ(testsupport::serverRows(*server, name), testsupport::objectRows(device->collection(name)))
                << name << " on " << device->path;
        }
    }
    EXPECT_FALSE(server->objects("app:notes").empty());
    // The faults did happen.
    EXPECT_GT(total.dropped, 0u);
    EXPECT_GT(total.duplicated, 0u);
    EXPECT_GT(total.delayed, 0u);
}

}  // namespace
