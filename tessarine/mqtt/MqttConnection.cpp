#include "tessarine/mqtt/MqttConnection.h"

#include <mosquitto.h>

#include <chrono>
#include <exception>
#include <stdexcept>

#include "platform/Log.h"
#include "tessarine/StoreLog.h"

namespace lumivale {
namespace tessarine {
namespace mqtt {

namespace {

constexpr int kQos = 1;
// What a SUBACK grants for a subscription the broker refused.
constexpr int kRefused = 0x80;
// A refused subscription is asked for again as soon as the refusal comes,
// this many times per connection, and then after a pause each time: a
// broker that is still electing its leaders (a NATS node that just
// restarted) refuses for seconds, a minute on a loaded machine, each
// refusal taking it tens of milliseconds; one that forbids the topic does
// so for good, and is then asked a few times a second, not in a busy loop.
// Giving up instead would leave the connection up but deaf until it drops.
constexpr int kImmediateSubscribeAttempts = 100;
constexpr std::chrono::milliseconds kRefusedSubscriptionPause{200};
// After the first refusal, one line every this many.
constexpr int kRefusalsPerLogLine = 100;

void initialiseLibrary() {
    static const int once = mosquitto_lib_init();
    (void)once;
}

void require(int rc, const std::string& what) {
    if (rc != MOSQ_ERR_SUCCESS) throw std::runtime_error(what + ": " + mosquitto_strerror(rc));
}

}  // namespace

std::string clientTopic(const std::string& clientId) {
    // Only letters, digits, '-' and '_' go as they are; every other byte as
    // %XX. Brokers differ in what else a topic level may hold (NATS drops a
    // connection that publishes a '.' or ' '), and '+', '#' and '/' would
    // make a client id a wildcard or several levels.
    static const char kHex[] = "0123456789ABCDEF";
    std::string topic = "/tessarine_client/";
    for (unsigned char c : clientId) {
        bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' || c == '_';
        if (plain) {
            topic += static_cast<char>(c);
        } else {
            topic += '%';
            topic += kHex[c >> 4];
            topic += kHex[c & 0xF];
        }
    }
    return topic;
}

MqttConnection::MqttConnection(const ConnectionOptions& options, std::string name, Handlers handlers)
    : settings(options), name(std::move(name)), handlers(std::move(handlers)) {
    initialiseLibrary();
    client = createClient();
}

struct mosquitto* MqttConnection::createClient() {
    struct mosquitto* created = mosquitto_new(nullptr, true, this);
    if (created == nullptr) throw std::runtime_error(name + ": cannot create an MQTT client");
    try {
        require(mosquitto_int_option(created, MOSQ_OPT_PROTOCOL_VERSION, MQTT_PROTOCOL_V311), "MQTT 3.1.1");
        // Small messages each waiting for an acknowledgement: without this,
        // Nagle's algorithm and delayed ACKs add tens of milliseconds to each.
        require(mosquitto_int_option(created, MOSQ_OPT_TCP_NODELAY, 1), "TCP_NODELAY");
        if (!settings.username.empty()) {
            require(mosquitto_username_pw_set(created, settings.username.c_str(),
                                              settings.password.empty() ? nullptr : settings.password.c_str()),
                    "credentials");
        }
        if (!settings.caFile.empty()) {
            require(mosquitto_tls_set(created, settings.caFile.c_str(), nullptr, nullptr, nullptr, nullptr),
                    "TLS CA file " + settings.caFile);
        }
        require(mosquitto_reconnect_delay_set(created, settings.minReconnectDelaySeconds,
                                              settings.maxReconnectDelaySeconds, true),
                "reconnect delays");
    } catch (...) {
        mosquitto_destroy(created);
        throw;
    }
    mosquitto_connect_callback_set(created, &MqttConnection::onConnect);
    mosquitto_disconnect_callback_set(created, &MqttConnection::onDisconnect);
    mosquitto_message_callback_set(created, &MqttConnection::onMessage);
    mosquitto_publish_callback_set(created, &MqttConnection::onPublish);
    mosquitto_subscribe_callback_set(created, &MqttConnection::onSubscribe);
    return created;
}

MqttConnection::~MqttConnection() {
    stop();
    if (client != nullptr) mosquitto_destroy(client);
}

void MqttConnection::start() {
    if (started) return;
    if (client == nullptr) {
        struct mosquitto* created = createClient();
        std::unique_lock<std::shared_mutex> lock(clientMutex);
        client = created;
    }
    {
        std::lock_guard<std::mutex> lock(stoppingMutex);
        stopping = false;
    }
    started = true;
    require(mosquitto_loop_start(client), name + ": cannot start the network thread");
    // The thread runs first: then a first attempt that fails is retried with
    // the back-off, as after a lost connection (started the other way round,
    // the thread gives up at once).
    int rc = mosquitto_connect_async(client, settings.host.c_str(), settings.port, settings.keepAliveSeconds);
    if (rc != MOSQ_ERR_SUCCESS) {
        lv_printLog(LogPriority::kInfo, kStoreLogTag, "%s: cannot connect to %s:%d yet: %s", name.c_str(),
                    settings.host.c_str(), settings.port, mosquitto_strerror(rc));
    }
}

void MqttConnection::stop() {
    if (!started) return;
    {
        // Cuts short a pause between refused subscriptions on the thread.
        std::lock_guard<std::mutex> lock(stoppingMutex);
        stopping = true;
    }
    stoppingWake.notify_all();
    // The thread is joined before the client goes, and without the lock:
    // its handlers may be publishing.
    mosquitto_disconnect(client);
    mosquitto_loop_stop(client, false);
    connected = false;
    started = false;
    std::unique_lock<std::shared_mutex> lock(clientMutex);
    mosquitto_destroy(client);
    client = nullptr;
}

void MqttConnection::subscribe(const std::string& topic) {
    {
        std::lock_guard<std::mutex> lock(topicsMutex);
        if (!topics.insert(topic).second) return;
    }
    std::shared_lock<std::shared_mutex> lock(clientMutex);
    if (connected && client != nullptr) requestSubscription(client, topic);
}

void MqttConnection::requestSubscription(struct mosquitto* mosq, const std::string& topic) {
    // Held across the call, so that the SUBACK, which may come back before
    // it returns, finds the topic.
    std::lock_guard<std::mutex> lock(subscriptionsMutex);
    int messageId = 0;
    if (mosquitto_subscribe(mosq, &messageId, topic.c_str(), kQos) == MOSQ_ERR_SUCCESS) awaited[messageId] = topic;
}

int MqttConnection::publish(const std::string& topic, const std::vector<unsigned char>& payload, bool retain) {
    std::shared_lock<std::shared_mutex> lock(clientMutex);
    if (!connected || client == nullptr) return 0;
    int messageId = 0;
    int rc = mosquitto_publish(client, &messageId, topic.c_str(), static_cast<int>(payload.size()), payload.data(),
                               kQos, retain);
    if (rc != MOSQ_ERR_SUCCESS) {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "%s: cannot publish %zu bytes on \"%s\": %s", name.c_str(),
                    payload.size(), topic.c_str(), mosquitto_strerror(rc));
        return 0;
    }
    return messageId;
}

bool MqttConnection::isConnected() const { return connected; }

bool MqttConnection::isListening() const { return listening; }

void MqttConnection::onConnect(struct mosquitto* mosq, void* self, int rc) {
    static_cast<MqttConnection*>(self)->handleConnect(mosq, rc);
}

void MqttConnection::onDisconnect(struct mosquitto*, void* self, int rc) {
    auto* connection = static_cast<MqttConnection*>(self);
    connection->connected = false;
    connection->listening = false;
    if (rc != 0) {
        lv_printLog(LogPriority::kInfo, kStoreLogTag, "%s: connection lost: %s", connection->name.c_str(),
                    mosquitto_strerror(rc));
    }
    if (connection->handlers.disconnected) connection->guard("disconnected", connection->handlers.disconnected);
}

void MqttConnection::onMessage(struct mosquitto*, void* self, const struct mosquitto_message* message) {
    static_cast<MqttConnection*>(self)->handleMessage(*message);
}

void MqttConnection::onSubscribe(struct mosquitto* mosq, void* self, int messageId, int count, const int* granted) {
    static_cast<MqttConnection*>(self)->handleSubscribed(mosq, messageId, count > 0 ? granted[0] : kRefused);
}

void MqttConnection::handleSubscribed(struct mosquitto* mosq, int messageId, int granted) {
    std::string topic;
    int attempts = 0;
    bool announce = false;
    {
        std::lock_guard<std::mutex> lock(subscriptionsMutex);
        auto found = awaited.find(messageId);
        if (found == awaited.end()) return;
        topic = std::move(found->second);
        awaited.erase(found);
        if (granted == kRefused) {
            attempts = ++refusals[topic];
            listening = false;
        } else {
            // Granted after a refusal, once the connection was announced:
            // what was published to the topic meanwhile is lost, as when
            // the connection drops, so it is announced again.
            announce = refusals.erase(topic) != 0 && announced;
        }
        // Never while a subscription stands refused: its messages are not
        // coming, and the connected handler would tell the store or the
        // server otherwise.
        announce = refusals.empty() && (announce || (awaited.empty() && !announced));
    }
    if (attempts == 0) {
        if (announce) this->announce();
        return;
    }
    if (attempts == 1) {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "%s: the broker refused the subscription to \"%s\"; asking again",
                    name.c_str(), topic.c_str());
    } else if (attempts % kRefusalsPerLogLine == 0) {
        lv_printLog(LogPriority::kWarn, kStoreLogTag,
                    "%s: the broker refused the subscription to \"%s\" %d times; asking again", name.c_str(),
                    topic.c_str(), attempts);
    }
    if (attempts >= kImmediateSubscribeAttempts && !pauseUnlessStopping(kRefusedSubscriptionPause)) return;
    requestSubscription(mosq, topic);
}

bool MqttConnection::pauseUnlessStopping(std::chrono::milliseconds pause) {
    std::unique_lock<std::mutex> lock(stoppingMutex);
    return !stoppingWake.wait_for(lock, pause, [this] { return stopping; });
}

void MqttConnection::onPublish(struct mosquitto*, void* self, int messageId) {
    auto* connection = static_cast<MqttConnection*>(self);
    if (connection->handlers.published) {
        connection->guard("published", [&] { connection->handlers.published(messageId); });
    }
}

void MqttConnection::handleConnect(struct mosquitto* mosq, int rc) {
    if (rc != 0) {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "%s: connection refused: %s", name.c_str(), mosquitto_connack_string(rc));
        return;
    }
    {
        // A new connection: the last one's answers will not come.
        std::lock_guard<std::mutex> lock(subscriptionsMutex);
        awaited.clear();
        refusals.clear();
        announced = false;
        listening = false;
    }
    // Up before the copy, so that a topic added meanwhile is either in the
    // copy or subscribed by subscribe() itself.
    connected = true;
    std::set<std::string> subscribed;
    {
        std::lock_guard<std::mutex> lock(topicsMutex);
        subscribed = topics;
    }
    for (const std::string& topic : subscribed) requestSubscription(mosq, topic);
    lv_printLog(LogPriority::kInfo, kStoreLogTag, "%s: connected to %s:%d", name.c_str(), settings.host.c_str(), settings.port);
    // The answers come on this thread, after this returns.
    if (subscribed.empty()) announce();
}

void MqttConnection::announce() {
    {
        std::lock_guard<std::mutex> lock(subscriptionsMutex);
        announced = true;
        listening = true;
    }
    if (handlers.connected) guard("connected", handlers.connected);
}

void MqttConnection::handleMessage(const struct mosquitto_message& message) {
    size_t size = static_cast<size_t>(message.payloadlen);
    if (size > settings.maxPayloadBytes) {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "%s: dropped a payload of %zu bytes on \"%s\": larger than %zu bytes",
                    name.c_str(), size, message.topic, settings.maxPayloadBytes);
        return;
    }
    if (!handlers.message) return;
    const auto* bytes = static_cast<const unsigned char*>(message.payload);
    std::string topic = message.topic;
    guard("message", [&] { handlers.message(topic, std::vector<unsigned char>(bytes, bytes + size), message.retain); });
}

void MqttConnection::guard(const char* what, const std::function<void()>& body) {
    try {
        body();
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "%s: the %s handler failed: %s", name.c_str(), what, e.what());
    } catch (...) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "%s: the %s handler failed", name.c_str(), what);
    }
}

}  // namespace mqtt
}  // namespace tessarine
}  // namespace lumivale
