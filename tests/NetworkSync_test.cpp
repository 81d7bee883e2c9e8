// Sync across processes through a real broker: stores in processes of their
// own (tessarine_sync_device) and tessarine-server, or the server and a store
// embedded here where a test reads their log lines.
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <filesystem>
#include <algorithm>
#include <mutex>
#include <map>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "ChildProcess.h"
#include "DeviceProcesses.h"
#include "MqttBroker.h"
#include "NatsCluster.h"
#include "SyncDevice.h"
#include "TestSupport.h"
#include "server/NetworkSyncServer.h"
#include "server/ServerProtocol.h"
#include "sqlite/Database.h"
#include "sqlite/SQLiteException.h"
#include "tessarine/Protocol.h"
#include "tessarine/mqtt/MqttTransport.h"

namespace {

namespace ts = lumivale::tessarine;
using testsupport::ChildProcess;
using testsupport::MqttBroker;
using testsupport::NatsCluster;
using testsupport::TempDir;
using testsupport::waitUntil;

const char* const kCollection = "net:notes";
constexpr std::chrono::seconds kConvergeDeadline(30);
// A NATS node refuses connections and subscriptions for seconds at a time
// while JetStream elects leaders, more so on a loaded machine.
constexpr std::chrono::seconds kClusterDeadline(90);

// A server file read while (or after) tessarine-server writes it.
class ServerFile {
public:
    explicit ServerFile(const std::string& path) : database(path, SQLITE_OPEN_READONLY) {}

    int64_t single(const std::string& sql, const std::vector<std::string>& texts = {}) {
        auto statement = database.prepare(sql);
        for (size_t i = 0; i < texts.size(); ++i) statement.bind(static_cast<int>(i + 1), texts[i]);
        statement.step();
        return statement(0).getInt64();
    }
    // The objects as testsupport::objectRows gives a store's, all PERSISTED.
    std::vector<std::string> objectRows() {
        auto statement = database.prepare(
            "SELECT primary_key, sort_key, blob FROM objects WHERE collection = ? ORDER BY sort_key, primary_key");
        statement.bind(1, std::string(kCollection));
        std::vector<std::string> rows;
        while (statement.step()) {
            auto blob = statement(2).getBlobDirectBuffer();
            rows.push_back(statement(0).getText() + "@" + statement(1).getText() + "=" +
                           testsupport::hex(blob.first, blob.second) + "#3");
        }
        return rows;
    }

    std::vector<std::string> logRows() {
        auto statement = database.prepare(
            "SELECT sequence, version_id, primary_key, CAST(blob AS TEXT) FROM changes ORDER BY sequence");
        std::vector<std::string> rows;
        while (statement.step()) {
            rows.push_back(std::to_string(statement(0).getInt64()) + "/" + std::to_string(statement(1).getInt64()) +
                           "/" + statement(2).getText() + "=" + statement(3).getText());
        }
        return rows;
    }

private:
    lumivale::sqlite::Database database;
};

class NetworkSyncTest : public ::testing::Test {
protected:
    std::unique_ptr<ChildProcess> startServer() { return startServer(broker.port); }
    std::unique_ptr<ChildProcess> startServer(int brokerPort) {
        return std::make_unique<ChildProcess>(TESSARINE_SERVER_PROGRAM,
                                              std::vector<std::string>{"--broker-port", std::to_string(brokerPort),
                                                                       "--data", dir.file("server.db")},
                                              TESSARINE_TEST_EMULATOR);
    }
    // 0 also while the server has not made its file yet.
    int64_t changesLogged() {
        try {
            if (!std::filesystem::exists(dir.file("server.db"))) return 0;
            return ServerFile(dir.file("server.db")).single("SELECT COUNT(*) FROM changes");
        } catch (const lumivale::sqlite::SQLiteException&) {
            return 0;
        }
    }
    // Every device done writing and holding exactly the server's objects,
    // all PERSISTED.
    bool converged() { return changesLogged() != 0 && devices.allHold(ServerFile(dir.file("server.db")).objectRows()); }
    // What each device and the server hold, for failure messages.
    std::string describe() {
        std::string text = devices.describe() + "server:";
        for (const std::string& row : ServerFile(dir.file("server.db")).objectRows()) text += " " + row;
        text += "\nlog (sequence/version/key=blob):";
        for (const std::string& row : ServerFile(dir.file("server.db")).logRows()) text += " " + row;
        return text;
    }
    // The server's log has no gap, and every change a device was told
    // PERSISTED is in it exactly once.
    void expectLogComplete() {
        ServerFile file(dir.file("server.db"));
        int64_t count = file.single("SELECT COUNT(*) FROM changes WHERE collection = ?", {kCollection});
        EXPECT_EQ(count,
                  file.single("SELECT IFNULL(MAX(sequence), 0) FROM changes WHERE collection = ?", {kCollection}));
        devices.forEachPersisted([&](const std::string& tag, const std::string& line) {
            std::istringstream words(line);
            std::string key, blob;
            words >> key >> blob;
            const char* sql = "SELECT COUNT(*) FROM changes WHERE primary_key = ? AND CAST(blob AS TEXT) = ?";
            EXPECT_EQ(1, file.single(sql, {key, blob})) << tag << " was told PERSISTED: " << line;
        });
    }

    TempDir dir;
    MqttBroker broker{dir};
    testsupport::DeviceProcesses devices{dir};
};

// Two stores write offline first (every change PENDING, status 1) and the
// third while the server runs, so the server is killed while it takes both
// resent queues and live changes.
TEST_F(NetworkSyncTest, ThreeStoresConvergeThroughServerKilledMidStreamAndBrokerRestarted) {
    devices.start("a", broker.port, 40, 0);
    devices.start("b", broker.port, 40, 0);
    auto allPending = [&](const std::string& tag) {
        std::vector<std::string> rows = devices.rows(tag);
        return !rows.empty() && std::all_of(rows.begin() + 1, rows.end(), [](const std::string& row) {
            return row.substr(row.size() - 2) == "#1";
        });
    };
    ASSERT_TRUE(waitUntil([&] { return allPending("a") && allPending("b"); }));
    broker.start();
    auto server = startServer();
    devices.start("c", broker.port, 40, 25);

    ASSERT_TRUE(waitUntil([&] { return changesLogged() >= 10; }));
    server->kill(SIGKILL);
    server->wait();
    server = startServer();

    int64_t beforeBrokerCrash = changesLogged();
    ASSERT_TRUE(waitUntil([&] { return changesLogged() >= beforeBrokerCrash + 10; }));
    broker.kill();
    broker.start();

    ASSERT_TRUE(waitUntil([&] { return converged(); }, kConvergeDeadline)) << describe();
    expectLogComplete();
    devices.stop();
    server->kill(SIGTERM);
    EXPECT_EQ(0, server->wait());
}

// The same through a cluster of three NATS nodes (MQTT listeners), each
// store on a node of its own and the server on the first.
class ClusteredBrokerTest : public NetworkSyncTest {
protected:
    void startDevices(int writes, int pauseMs) {
        const char* const nodeTags[NatsCluster::kNodes] = {"a", "b", "c"};
        for (size_t node = 0; node < NatsCluster::kNodes; ++node) {
            devices.start(nodeTags[node], cluster.port(node), writes, pauseMs);
        }
    }
    // describe() and the end of each node's log.
    std::string describeCluster() {
        std::string text = describe();
        for (size_t node = 0; node < NatsCluster::kNodes; ++node) {
            text += "\nNATS node " + std::to_string(node) + ":\n" + cluster.logTail(node);
        }
        return text;
    }

    NatsCluster cluster{dir};
};

TEST_F(ClusteredBrokerTest, NodeOfServerAndStoreKilledMidStreamLosesNoPersistedChange) {
    cluster.start();
    auto server = startServer(cluster.port(0));
    startDevices(40, 25);
    ASSERT_TRUE(waitUntil([&] { return changesLogged() >= 10; }, kClusterDeadline)) << cluster.logTail(0);
    cluster.kill(0);
    cluster.start(0);
    ASSERT_TRUE(waitUntil([&] { return converged(); }, kClusterDeadline)) << describeCluster();
    expectLogComplete();
    devices.stop();
}

// NATS refuses some characters in topics and drops the connection that uses
// them; a client id is the store's to choose, so its topic must avoid them.
TEST_F(ClusteredBrokerTest, ClientTopicsCarryAnyClientIdAcrossNodes) {
    cluster.start();
    std::mutex mutex;
    std::set<std::string> received;
    auto options = [&](size_t node) {
        ts::mqtt::ConnectionOptions chosen;
        chosen.port = cluster.port(node);
        chosen.maxReconnectDelaySeconds = 1;
        return chosen;
    };
    ts::mqtt::MqttConnection listener(options(1), "listener",
                                      {nullptr,
                                       [&](const std::string& topic, std::vector<unsigned char>, bool) {
                                           std::lock_guard<std::mutex> lock(mutex);
                                           received.insert(topic);
                                       },
                                       nullptr, nullptr});
    int acknowledged = 0;  // under mutex
    ts::mqtt::MqttConnection sender(options(2), "sender",
                                    {nullptr, nullptr,
                                     [&](int) {
                                         std::lock_guard<std::mutex> lock(mutex);
                                         ++acknowledged;
                                     },
                                     nullptr});
    const std::vector<std::string> clientIds = {"plain-id_0", "dotted.id", "with space", "wild+#/*>", "per%cent", "é"};
    for (const std::string& id : clientIds) listener.subscribe(ts::mqtt::clientTopic(id));
    listener.start();
    sender.start();
    std::set<std::string> expected;
    for (const std::string& id : clientIds) expected.insert(ts::mqtt::clientTopic(id));
    // Sent again, once the last round is acknowledged, until all arrive: the
    // listener's subscriptions take effect some time after it connects.
    int sent = 0;
    ASSERT_TRUE(waitUntil([&] {
        {
            std::lock_guard<std::mutex> lock(mutex);
            if (received == expected) return true;
            if (acknowledged < sent) return false;
        }
        for (const std::string& id : clientIds) sent += sender.publish(ts::mqtt::clientTopic(id), {1}) != 0 ? 1 : 0;
        return false;
    }, kClusterDeadline)) << received.size();
    EXPECT_EQ(expected.size(), clientIds.size());
}

// A store and the server embedded in this process, so that their log lines
// can be read.
class EmbeddedSyncTest : public ::testing::Test {
protected:
    ts::mqtt::MqttTransport::Options brokerOptions(const std::string& user = "", const std::string& password = "") {
        ts::mqtt::MqttTransport::Options options;
        options.port = broker.port;
        options.maxReconnectDelaySeconds = 1;
        options.username = user;
        options.password = password;
        return options;
    }
    void startServer(const ts::mqtt::ConnectionOptions& options) {
        server = std::make_unique<ts::server::NetworkSyncServer>(
            ts::server::NetworkSyncServer::Options{options, dir.file("server.db")});
        server->start();
    }
    struct Store {
        std::shared_ptr<ts::mqtt::MqttTransport> transport;
        std::unique_ptr<ts::Tessarine> store;
        std::unique_ptr<ts::Collection> notes;
    };
    Store openStore(const ts::mqtt::MqttTransport::Options& options, const std::string& name) {
        Store opened;
        opened.transport = std::make_shared<ts::mqtt::MqttTransport>(options);
        opened.store = ts::Tessarine::open(dir.file(name + ".db"), opened.transport,
                                           std::make_shared<testsupport::CountingThreadCreator>());
        opened.store->start();
        opened.notes = opened.store->subscribeCollection(kCollection);
        return opened;
    }
    // Saves a note and waits until the server's echo made it PERSISTED.
    static bool savePersisted(Store& store, const std::string& key) {
        store.notes->saveObject(key, key, {1, 2, 3});
        return waitUntil([&] {
            std::vector<std::string> rows = testsupport::objectRows(*store.notes);
            return std::count(rows.begin(), rows.end(), key + "@" + key + "=010203#3") == 1;
        });
    }

    testsupport::LogCapture log;
    TempDir dir;
    MqttBroker broker{dir, {"device", "s3cret"}};
    std::unique_ptr<ts::server::NetworkSyncServer> server;
};

TEST_F(EmbeddedSyncTest, HostilePayloadsOnEveryTopicAreDroppedAndServingGoesOn) {
    broker.start();
    ts::mqtt::MqttTransport::Options options = brokerOptions("device", "s3cret");
    options.maxPayloadBytes = 4096;
    startServer(options);

    // The rules are SyncServerTest's; here each topic gets a payload they
    // drop, and one change is too large for the server.
    const auto save = ts::SyncProtocol::DeltaType::SAVE;
    ts::SyncProtocol::Delta change{"intruder", "not a valid name!", 1, "k", "", save, {}, 0};
    ts::SyncProtocol::Delta oversized{"intruder", kCollection, 1, "k", "", save, std::vector<unsigned char>(8192, 'x'), 0};
    const std::vector<unsigned char> garbage{0xde, 0xad, 0xbe, 0xef, 0x00, 0x17};
    const std::vector<std::pair<const char*, std::vector<unsigned char>>> droppedByRules = {
        {ts::protocol::TOPIC_CHANGE_RECORD, ts::protocol::makePayloadForSendDelta(change)},
        {ts::protocol::TOPIC_SUBSCRIBE_COLLECTION, garbage},
        {ts::protocol::TOPIC_SNAPSHOT, ts::protocol::makePayloadForSendDelta(change)},  // of the wrong kind
    };

    // The intruder waits for the server to be online, and listens to every
    // client's topic to learn a store's.
    std::mutex mutex;
    bool serverOnline = false;
    std::string storeTopic;
    ts::mqtt::MqttConnection intruder(options, "intruder",
                                      {nullptr,
                                       [&](const std::string& topic, std::vector<unsigned char>, bool) {
                                           std::lock_guard<std::mutex> lock(mutex);
                                           if (topic == ts::mqtt::TOPIC_SERVER_ONLINE) {
                                               serverOnline = true;
                                           } else {
                                               storeTopic = topic;
                                           }
                                       },
                                       nullptr, nullptr});
    intruder.subscribe(ts::mqtt::TOPIC_SERVER_ONLINE);
    intruder.subscribe(ts::mqtt::clientTopic("") + "#");
    intruder.start();
    ASSERT_TRUE(waitUntil([&] {
        std::lock_guard<std::mutex> lock(mutex);
        return serverOnline && intruder.isConnected();
    }));
    for (const auto& [topic, payload] : droppedByRules) ASSERT_GT(intruder.publish(topic, payload), 0);
    ASSERT_GT(intruder.publish(ts::protocol::TOPIC_CHANGE_RECORD, ts::protocol::makePayloadForSendDelta(oversized)), 0);

    EXPECT_TRUE(waitUntil([&] {
        return log.linesStartingWith("SyncServer: dropped a payload").size() == droppedByRules.size() &&
               log.linesStartingWith("tessarine-server: dropped a payload of").size() == 1;
    })) << log.linesStartingWith("SyncServer: dropped a payload").size();

    // A store still syncs, and takes no harm from garbage on its own topic.
    Store store = openStore(options, "store");
    ASSERT_TRUE(savePersisted(store, "first"));
    std::string topic;
    ASSERT_TRUE(waitUntil([&] {
        std::lock_guard<std::mutex> lock(mutex);
        topic = storeTopic;
        return !topic.empty();
    }));
    ASSERT_GT(intruder.publish(topic, garbage), 0);
    EXPECT_TRUE(waitUntil([&] { return !log.linesStartingWith("MqttTransport: dropped a server payload").empty(); }));
    ASSERT_TRUE(savePersisted(store, "second"));
    EXPECT_EQ(2u, server->rules().sequenceNumber(kCollection));
    EXPECT_EQ(2u, server->rules().objects(kCollection).size());
    EXPECT_EQ(0u, server->rules().sequenceNumber("not a valid name!"));
}

// A broker in trouble may lose what it had acknowledged (the server's token,
// the store's changes, their echoes) and deliver again what it had: a store
// whose change goes unanswered asks again, each time subscribing before it
// resends, even while other clients' changes keep arriving; and a delivery
// that comes again after newer ones is dropped.
TEST_F(EmbeddedSyncTest, UnansweredChangeIsResentAfterSubscribingAgainAndRepeatedDeliveriesAreDropped) {
    broker.start();
    std::mutex mutex;
    std::vector<std::string> heard;  // topics, and "change <version> after <previous>" for changes
    uint64_t forwarded = 0;
    std::vector<unsigned char> firstForward;
    // For each change: another client's change numbered one more, then again
    // the first of those.
    std::unique_ptr<ts::mqtt::MqttConnection> deafServer;
    deafServer = std::make_unique<ts::mqtt::MqttConnection>(
        brokerOptions("device", "s3cret"), "deaf server",
        ts::mqtt::MqttConnection::Handlers{
            nullptr,
            [&](const std::string& topic, std::vector<unsigned char> payload, bool) {
                std::lock_guard<std::mutex> lock(mutex);
                if (topic != ts::protocol::TOPIC_CHANGE_RECORD) {
                    heard.push_back(topic);
                    return;
                }
                ts::SyncProtocol::Delta change = ts::protocol::makeTessarineDelta(payload, 0);
                heard.push_back("change " + std::to_string(change.versionId) + " after " +
                                std::to_string(ts::protocol::previousVersionIdOf(payload)));
                ts::SyncProtocol::Delta other = change;
                other.clientId = "other";
                other.primaryKey = "other";
                other.blob = {static_cast<unsigned char>(++forwarded)};
                std::vector<unsigned char> list = ts::server::makeDeltaListPayload({other}, forwarded);
                if (firstForward.empty()) firstForward = list;
                deafServer->publish(ts::mqtt::clientTopic(change.clientId), list);
                if (forwarded > 1) deafServer->publish(ts::mqtt::clientTopic(change.clientId), firstForward);
            },
            nullptr, nullptr});
    deafServer->subscribe("/+");
    deafServer->start();
    ASSERT_TRUE(waitUntil([&] { return deafServer->isListening(); }));

    auto options = brokerOptions("device", "s3cret");
    options.resendUnansweredAfter = std::chrono::milliseconds(50);
    // Before the store: its worker reports into it until the store is gone.
    std::map<unsigned char, int> reported;  // blob of "other" -> times the store reported it
    Store store = openStore(options, "store");
    store.store->addDeltaReceivedCallback([&](const std::vector<ts::Delta>& deltas) {
        std::lock_guard<std::mutex> lock(mutex);
        for (const ts::Delta& delta : deltas) {
            if (delta.primaryKey == "other") ++reported[delta.blob.at(0)];
        }
    });
    store.notes->saveObject("k", "k", {1});
    store.notes->saveObject("j", "j", {2});
    std::vector<std::string> seen;
    ASSERT_TRUE(waitUntil([&] {
        std::lock_guard<std::mutex> lock(mutex);
        seen = heard;
        return std::count(seen.begin(), seen.end(), "change 2 after 1") >= 4;
    }));
    // At most two copies go out at the start (a write racing the first
    // connection's resend); the last ones are a resend of unanswered changes,
    // each naming the one sent before it since the subscription, the first
    // itself.
    auto last = std::find(seen.rbegin(), seen.rend(), "change 2 after 1");
    EXPECT_EQ("change 1 after 1", *(last + 1));
    EXPECT_EQ(ts::protocol::TOPIC_SUBSCRIBE_COLLECTION, *(last + 2));
    // The third forward comes after the first one's copy.
    ASSERT_TRUE(waitUntil([&] {
        std::lock_guard<std::mutex> lock(mutex);
        return reported.count(3) != 0;
    }));
    std::lock_guard<std::mutex> lock(mutex);
    EXPECT_EQ(1, reported[1]);
}

// Through a TLS-only listener with a certificate from the test's own CA,
// given as caFile, that also wants a password.
TEST_F(EmbeddedSyncTest, TlsBrokerRequiringCredentialsRefusesAStrangerAndServesAMember) {
    MqttBroker tlsBroker(dir, {"device", "s3cret", true});
    tlsBroker.start();
    auto options = [&](const std::string& password) {
        auto chosen = brokerOptions("device", password);
        chosen.port = tlsBroker.port;
        chosen.caFile = tlsBroker.caFile;
        return chosen;
    };
    startServer(options("s3cret"));

    ts::mqtt::MqttTransport stranger(options("wrong"));
    stranger.start();
    EXPECT_TRUE(waitUntil([&] { return !log.linesStartingWith("MqttTransport: connection refused").empty(); }));
    EXPECT_FALSE(stranger.isConnected());

    Store member = openStore(options("s3cret"), "member");
    EXPECT_TRUE(savePersisted(member, "note"));
}

}  // namespace
