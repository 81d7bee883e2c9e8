// The server tier past one machine: tessarine-server instances sharing one
// PostgreSQL database, stores in processes of their own (tessarine_sync_device),
// a mosquitto broker or a cluster of three NATS nodes (instance i and store i
// on node i); instances, a node and the database killed mid-stream. And the few
// guarantees of the PostgreSQL storage and its leases that those scenarios
// cannot single out.
#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "ChildProcess.h"
#include "DeviceProcesses.h"
#include "MqttBroker.h"
#include "NatsCluster.h"
#include "PostgresServer.h"
#include "SyncDevice.h"
#include "TestSupport.h"
#include "server/CollectionLeases.h"
#include "server/PgConnection.h"
#include "server/PostgresLogStorage.h"
#include "server/PostgresSchema.h"

namespace {

namespace ts = lumivale::tessarine;
using testsupport::ChildProcess;
using testsupport::TempDir;
using testsupport::waitUntil;

const char* const kCollection = "net:notes";
// A NATS cluster that lost a node drops its clients and refuses their
// subscriptions, for tens of seconds on a loaded machine, while JetStream
// elects leaders again; nothing can be served meanwhile.
constexpr std::chrono::seconds kConvergeDeadline(90);
constexpr int kWrites = 60;
constexpr int kPauseMs = 25;
// Short leases, so that a takeover happens within the test's seconds.
constexpr const char* kLeaseMs = "1500";

class ServerTierTest : public ::testing::Test {
protected:
    void SetUp() override { postgres.start(); }
    // Starts the broker: one mosquitto, or the NATS cluster.
    void startBroker(bool nats) {
        if (nats) {
            cluster = std::make_unique<testsupport::NatsCluster>(dir);
            cluster->start();
        } else {
            broker = std::make_unique<testsupport::MqttBroker>(dir);
            broker->start();
        }
    }
    // The broker port for the i-th instance or store.
    int port(size_t i) const { return cluster ? cluster->port(i % testsupport::NatsCluster::kNodes) : broker->port; }
    // Instance i of names on node first + i.
    void startInstances(const std::vector<std::string>& names, size_t first = 0) {
        for (size_t i = 0; i < names.size(); ++i) {
            instances[names[i]] = std::make_unique<ChildProcess>(
                TESSARINE_SERVER_PROGRAM,
                std::vector<std::string>{"--broker-port", std::to_string(port(first + i)), "--postgres",
                                         postgres.conninfo(), "--instance", names[i], "--lease-ms", kLeaseMs},
                TESSARINE_TEST_EMULATOR);
        }
    }
    // Store i on nodes[i].
    void startDevices(const std::vector<size_t>& nodes = {0, 1, 2}) {
        for (const std::string tag : {"a", "b", "c"}) {
            devices.start(tag, port(nodes[devices.size()]), kWrites, kPauseMs);
        }
    }
    // Streams until the serving instance is killed and another one took
    // over; then all converge with a complete log.
    void killServingInstanceMidStream() {
        startInstances({"one", "two", "three"});
        startDevices();
        ASSERT_TRUE(waitUntil([&] { return changesLogged() >= 10; }));
        std::string holder = leaseHolder();
        ASSERT_EQ(1u, instances.count(holder)) << holder;
        instances[holder]->kill(SIGKILL);
        instances[holder]->wait();

        int64_t beforeTakeover = changesLogged();
        ASSERT_TRUE(waitUntil([&] { return changesLogged() >= beforeTakeover + 10; }, kConvergeDeadline));
        std::string successor = leaseHolder();
        EXPECT_NE(holder, successor);
        EXPECT_EQ(1u, instances.count(successor)) << successor;
        ASSERT_TRUE(waitUntil([&] { return converged(); }, kConvergeDeadline)) << describe();
        expectLogComplete();
        devices.stop();
    }
    // The rows of a query, columns joined by "|"; empty while the database
    // is away.
    std::vector<std::string> query(const std::string& sql) {
        try {
            if (!reader) reader = std::make_unique<ts::server::PgConnection>(postgres.conninfo());
            ts::server::PgResult result = reader->exec(sql);
            std::vector<std::string> rows;
            for (int row = 0; row < result.rows(); ++row) {
                std::string text;
                for (int column = 0; column < result.columns(); ++column) {
                    text += (column == 0 ? "" : "|") + result.text(row, column);
                }
                rows.push_back(text);
            }
            return rows;
        } catch (const ts::server::PgError&) {
            return {};
        }
    }
    int64_t changesLogged() {
        std::vector<std::string> rows = query("SELECT COUNT(*) FROM tessarine_changes");
        return rows.empty() ? 0 : std::stoll(rows[0]);
    }
    std::string leaseHolder() {
        std::vector<std::string> rows = query(std::string("SELECT holder FROM tessarine_leases WHERE collection = '") +
                                              kCollection + "' AND expires_at > now()");
        return rows.empty() ? "" : rows[0];
    }
    // The objects as testsupport::objectRows gives a store's, all PERSISTED.
    std::vector<std::string> serverRows() {
        std::vector<std::string> rows;
        for (const std::string& row :
             query("SELECT primary_key || '@' || sort_key || '=' || encode(blob, 'hex') || '#3' FROM tessarine_objects"
                   " ORDER BY sort_key COLLATE \"C\", primary_key COLLATE \"C\"")) {
            rows.push_back(row);
        }
        return rows;
    }
    bool converged() { return devices.allHold(serverRows()); }
    std::string describe() {
        std::string text = devices.describe() + "server:";
        for (const std::string& row : serverRows()) text += " " + row;
        return text + "\nlog:\n" + logDump();
    }
    // Numbers 1..n without gaps or repeats, the counter at n, and every
    // change a store was told PERSISTED logged exactly once.
    void expectLogComplete() {
        std::vector<std::string> numbers =
            query("SELECT COUNT(*) || '|' || COUNT(DISTINCT sequence) || '|' || MAX(sequence) FROM tessarine_changes");
        ASSERT_EQ(1u, numbers.size());
        std::vector<std::string> last = query("SELECT last FROM tessarine_sequences");
        ASSERT_EQ(1u, last.size());
        EXPECT_EQ(last[0] + "|" + last[0] + "|" + last[0], numbers[0]);
        // A store sends its changes oldest first, and neither a late copy of
        // an older one nor a resend of one the broker lost may be logged
        // after a newer one.
        std::map<std::string, int64_t> lastVersion;
        for (const std::string& row :
             query("SELECT client_id || '|' || version_id FROM tessarine_changes ORDER BY collection, sequence")) {
            std::string client = row.substr(0, row.rfind('|'));
            int64_t version = std::stoll(row.substr(row.rfind('|') + 1));
            if (lastVersion[client] >= version) {
                ADD_FAILURE() << client << " v" << version << " logged after v" << lastVersion[client] << ":\n"
                              << logDump();
                break;
            }
            lastVersion[client] = version;
        }
        std::map<std::string, int> logged;
        for (const std::string& row : query("SELECT primary_key || ' ' || convert_from(blob, 'UTF8') FROM tessarine_changes")) {
            ++logged[row];
        }
        devices.forEachPersisted([&](const std::string& tag, const std::string& line) {
            EXPECT_EQ(1, logged[line]) << tag << " was told PERSISTED: " << line;
        });
    }
    std::string logDump() {
        std::string text;
        for (const std::string& row : query("SELECT sequence || ' ' || client_id || ' v' || version_id || ' ' || "
                                            "primary_key || ' ' || convert_from(blob, 'UTF8') FROM tessarine_changes "
                                            "ORDER BY collection, sequence")) {
            text += row + "\n";
        }
        return text;
    }

    TempDir dir;
    testsupport::PostgresServer postgres;
    std::unique_ptr<testsupport::MqttBroker> broker;
    std::unique_ptr<testsupport::NatsCluster> cluster;
    std::unique_ptr<ts::server::PgConnection> reader;  // reconnects by itself after a restart
    std::map<std::string, std::unique_ptr<ChildProcess>> instances;
    testsupport::DeviceProcesses devices{dir};
};

TEST_F(ServerTierTest, ThreeStoresConvergeWhenTheServingInstanceIsKilledMidStream) {
    startBroker(false);
    killServingInstanceMidStream();
}

TEST_F(ServerTierTest, StoresOnANatsClusterConvergeWhenTheServingInstanceIsKilledMidStream) {
    startBroker(true);
    killServingInstanceMidStream();
}

// The stores are on the other nodes: a store on a killed node is the
// broker's and the transport's case (NetworkSync_test.cpp, and README).
TEST_F(ServerTierTest, StoresOnANatsClusterConvergeWhenTheServingInstancesNodeIsKilledMidStream) {
    startBroker(true);
    startInstances({"one"});  // on node 0, and first, so that it serves
    startDevices({1, 2, 1});
    ASSERT_TRUE(waitUntil([&] { return changesLogged() >= 5; }));
    ASSERT_EQ("one", leaseHolder());
    startInstances({"two", "three"}, 1);
    ASSERT_TRUE(waitUntil([&] { return changesLogged() >= 10; }));
    cluster->kill(0);
    // Cut off from its clients, the instance lets its lease lapse.
    ASSERT_TRUE(waitUntil([&] { return !leaseHolder().empty() && leaseHolder() != "one"; }, kConvergeDeadline));
    ASSERT_TRUE(waitUntil([&] { return converged(); }, kConvergeDeadline)) << describe();
    expectLogComplete();
    devices.stop();
}

// A store's node dies while the instance serving it lives on: the store
// reconnects to the restarted node, into sessions the instance still holds.
TEST_F(ServerTierTest, StoresOnANatsClusterConvergeWhenAStoresNodeIsKilledMidStream) {
    startBroker(true);
    startInstances({"one", "two"}, 1);
    startDevices();
    ASSERT_TRUE(waitUntil([&] { return changesLogged() >= 10; }));
    cluster->kill(0);
    cluster->start(0);
    ASSERT_TRUE(waitUntil([&] { return converged(); }, kConvergeDeadline)) << describe();
    expectLogComplete();
    devices.stop();
}

TEST_F(ServerTierTest, StoresConvergeWhenPostgresIsKilledMidStreamAndStartedAgain) {
    startBroker(false);
    startInstances({"one", "two"});
    startDevices();
    ASSERT_TRUE(waitUntil([&] { return changesLogged() >= 10; }));
    postgres.stop(SIGQUIT);  // at once, as a crash: recovery at the next start
    postgres.start();

    int64_t beforeRestart = changesLogged();
    ASSERT_TRUE(waitUntil([&] { return changesLogged() >= beforeRestart + 10; }, kConvergeDeadline));
    ASSERT_TRUE(waitUntil([&] { return converged(); }, kConvergeDeadline)) << describe();
    expectLogComplete();
    devices.stop();
    for (auto& instance : instances) {
        instance.second->kill(SIGTERM);
        EXPECT_EQ(0, instance.second->wait()) << instance.first;
    }
}

ts::SyncProtocol::Delta change(const std::string& clientId, uint64_t versionId) {
    ts::SyncProtocol::Delta delta;
    delta.clientId = clientId;
    delta.collectionName = kCollection;
    delta.versionId = versionId;
    delta.primaryKey = clientId + "-" + std::to_string(versionId);
    delta.sortKey = delta.primaryKey;
    delta.blob = {0, 1, 0xff};
    return delta;
}

class PostgresStorageTest : public ::testing::Test {
protected:
    void SetUp() override { postgres.start(); }
    testsupport::PostgresServer postgres;
};

TEST_F(PostgresStorageTest, ConcurrentWritersGetGapFreeNumbersAndAResentChangeIsLoggedOnce) {
    constexpr uint64_t kChanges = 40;
    ts::server::PostgresLogStorage first(postgres.conninfo());
    ts::server::PostgresLogStorage second(postgres.conninfo());
    int accepted[2] = {0, 0};
    auto write = [&](ts::server::PostgresLogStorage& storage, const std::string& client, int& count) {
        for (uint64_t version = 1; version <= kChanges; ++version) {
            // Both write the shared client's changes too: each once only.
            for (const std::string& id : {client, std::string("shared")}) {
                if (storage.append(change(id, version))) ++count;
            }
        }
    };
    std::thread other([&] { write(second, "second", accepted[1]); });
    write(first, "first", accepted[0]);
    other.join();

    EXPECT_EQ(3 * kChanges, static_cast<uint64_t>(accepted[0] + accepted[1]));
    std::vector<ts::SyncProtocol::Delta> log = first.changesAfter(kCollection, 0);
    ASSERT_EQ(3 * kChanges, log.size());
    for (size_t i = 0; i < log.size(); ++i) EXPECT_EQ(i + 1, log[i].sequenceNumber);
    EXPECT_EQ(3 * kChanges, second.lastSequenceNumber(kCollection));
    EXPECT_EQ(log[7].blob, first.findAccepted(log[7])->blob);
    EXPECT_EQ(kChanges, *second.highestVersionId(kCollection, "shared"));
    EXPECT_EQ(3 * kChanges, first.snapshot(kCollection, "first").objects.size());
}

TEST_F(PostgresStorageTest, OnlyTheLeaseHolderLogsAndAStoppedHolderHandsTheCollectionOver) {
    ts::server::CollectionLeases::Timings timings{std::chrono::milliseconds(100), std::chrono::milliseconds(300)};
    ts::server::PostgresLogStorage storageOfOne(postgres.conninfo(), "one");
    ts::server::PostgresLogStorage storageOfTwo(postgres.conninfo(), "two");
    ts::server::CollectionLeases one(postgres.conninfo(), "one", timings, {});
    ts::server::CollectionLeases two(postgres.conninfo(), "two", timings, {});
    EXPECT_THROW(storageOfOne.append(change("c", 1)), ts::server::PostgresLogStorage::LeaseLost);

    one.start();
    one.noticed(kCollection);
    ASSERT_TRUE(waitUntil([&] { return one.epoch(kCollection) != 0; }));
    ASSERT_TRUE(storageOfOne.append(change("c", 1)));
    two.start();
    two.noticed(kCollection);
    EXPECT_THROW(storageOfTwo.append(change("c", 2)), ts::server::PostgresLogStorage::LeaseLost);

    one.stop();
    EXPECT_EQ(0u, one.epoch(kCollection));
    ASSERT_TRUE(waitUntil([&] { return two.epoch(kCollection) != 0; }));
    EXPECT_TRUE(storageOfTwo.append(change("c", 2)));
    EXPECT_THROW(storageOfOne.append(change("c", 3)), ts::server::PostgresLogStorage::LeaseLost);
    EXPECT_EQ(2u, storageOfTwo.lastSequenceNumber(kCollection));
}

// A renewal held up past the lease's local validity (the database slow under
// load): the requests refused meanwhile reached no instance, so the lease
// renewed after them must count as new, or the sessions that saw later
// requests would skip those.
TEST_F(PostgresStorageTest, ALeaseThatLapsedDuringASlowRenewalComesBackUnderANewEpoch) {
    ts::server::CollectionLeases::Timings timings{std::chrono::milliseconds(200), std::chrono::milliseconds(600)};
    ts::server::PgConnection blocker(postgres.conninfo());
    ts::server::createPostgresSchema(blocker);
    ts::server::CollectionLeases leases(postgres.conninfo(), "one", timings, {});
    leases.start();
    leases.noticed(kCollection);
    ASSERT_TRUE(waitUntil([&] { return leases.epoch(kCollection) != 0; }));
    uint64_t before = leases.epoch(kCollection);

    blocker.exec("BEGIN");
    blocker.exec(std::string("SELECT * FROM tessarine_leases WHERE collection = '") + kCollection + "' FOR UPDATE");
    ASSERT_TRUE(waitUntil([&] { return leases.epoch(kCollection) == 0; }));
    blocker.exec("ROLLBACK");
    ASSERT_TRUE(waitUntil([&] { return leases.epoch(kCollection) != 0; }));
    EXPECT_NE(before, leases.epoch(kCollection));
}

}  // namespace
