// One client connection to an MQTT broker (MQTT 3.1.1, libmosquitto), shared
// by the store's MqttTransport and the networked sync server: connects in the
// background, reconnects by itself with exponential back-off, subscribes its
// topics again on every connection, and publishes with QoS 1.
//
// Handlers (all optional) run on the connection's network thread, one at a
// time, never under a lock of this class:
//   - connected: a connection is up and the broker has granted every
//     subscription, so that what is published from here on reaches this
//     client; and again when a subscription the broker refused is granted
//     after all (what was published to it meanwhile is lost, as when a
//     connection drops);
//   - message: a message arrived on a subscribed topic (retained: the broker
//     kept it from before this connection's subscription);
//   - published: the broker acknowledged the publish with that message id;
//   - disconnected: the connection went down (or an attempt failed).
// An exception a handler throws is logged and goes no further. A
// subscription the broker refuses (a NATS node whose JetStream is not ready
// yet) is asked for again until it is granted or the connection drops: at
// once at first, then after a short pause on the network thread, which
// stop() cuts short (the first refusal and every hundredth are logged). A
// refused connection (bad credentials, say) is logged under the
// connection's name ("<name>: connection refused: <reason>") and tried
// again after the back-off.
//
// Threads: every operation may be called from any thread, handlers
// included, except that start() and stop() must not run at the same time.
// The destructor disconnects and joins the network thread, after which no
// handler runs; it must not run on that thread.
//
// Errors: the constructor throws std::runtime_error when the options cannot be
// used (a TLS CA file that cannot be read, say); nothing else throws.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <shared_mutex>
#include <string>
#include <vector>

struct mosquitto;
struct mosquitto_message;

namespace lumivale {
namespace tessarine {
namespace mqtt {

// The topic on which the server publishes a client's payloads. Any client
// id gives a valid topic of one level on every broker (bytes other than
// letters, digits, '-' and '_' are written %XX), and different ids give
// different topics.
std::string clientTopic(const std::string& clientId);

// Retained; the server publishes a new token on it on every connection to
// the broker, after it has subscribed to the three request topics. A client
// that sees a new token knows the server may have lost what was in flight
// and resends (see MqttTransport).
inline constexpr char TOPIC_SERVER_ONLINE[] = "/tessarine_server_online";

struct ConnectionOptions {
    std::string host = "127.0.0.1";
    int port = 1883;
    // Sent when username is not empty.
    std::string username;
    std::string password;
    // Not empty: TLS, with the broker's certificate checked against this CA file.
    std::string caFile;
    int keepAliveSeconds = 30;
    // Waits between connection attempts: from the minimum, doubling up to the maximum.
    unsigned minReconnectDelaySeconds = 1;
    unsigned maxReconnectDelaySeconds = 30;
    // Payloads received above this size are logged and dropped unread.
    size_t maxPayloadBytes = 16 * 1024 * 1024;
};

class MqttConnection {
public:
    struct Handlers {
        std::function<void()> connected;
        std::function<void(const std::string& topic, std::vector<unsigned char> payload, bool retained)> message;
        std::function<void(int messageId)> published;
        std::function<void()> disconnected;
    };

    // name prefixes the connection's log lines (tag "tessarine").
    MqttConnection(const ConnectionOptions& options, std::string name, Handlers handlers);
    ~MqttConnection();
    MqttConnection(const MqttConnection&) = delete;
    MqttConnection& operator=(const MqttConnection&) = delete;

    // Starts connecting in the background; nothing happens when started.
    void start();
    // Disconnects and joins the network thread (the disconnected handler
    // runs); start() connects again. Not on the network thread.
    void stop();

    // Subscribes (QoS 1) to topic now when connected, and on every connection
    // from now on.
    void subscribe(const std::string& topic);

    // Publishes with QoS 1 when connected. Returns the message id (> 0) that
    // the published handler will be given, or 0 when the connection is down
    // or the broker cannot take the message (logged); the message is then
    // not sent. Never blocks on the network.
    int publish(const std::string& topic, const std::vector<unsigned char>& payload, bool retain = false);

    bool isConnected() const;
    // Connected with every subscription granted: what the broker delivers to
    // the subscribed topics reaches the message handler. False from a
    // refusal until the subscription is granted.
    bool isListening() const;

    const ConnectionOptions& options() const { return settings; }

private:
    // A new client with the options and callbacks applied; throws for
    // options that cannot be used.
    struct mosquitto* createClient();
    static void onConnect(struct mosquitto*, void* self, int rc);
    static void onDisconnect(struct mosquitto*, void* self, int rc);
    static void onMessage(struct mosquitto*, void* self, const struct mosquitto_message* message);
    static void onPublish(struct mosquitto*, void* self, int messageId);
    static void onSubscribe(struct mosquitto*, void* self, int messageId, int count, const int* granted);
    // Subscribes and remembers the topic until the broker answers.
    void requestSubscription(struct mosquitto* mosq, const std::string& topic);
    // Asks again for a subscription the broker refused; announces the
    // connection once every subscription is answered.
    void handleSubscribed(struct mosquitto* mosq, int messageId, int granted);
    // Waits for pause unless stop() is under way; false if it is.
    bool pauseUnlessStopping(std::chrono::milliseconds pause);
    // Runs the connected handler.
    void announce();
    void handleConnect(struct mosquitto* mosq, int rc);
    void handleMessage(const struct mosquitto_message& message);
    // Runs a handler, logging what it throws.
    void guard(const char* what, const std::function<void()>& body);

    const ConnectionOptions settings;
    const std::string name;
    const Handlers handlers;
    // A client lives from start() to stop() (libmosquitto does not restart
    // a stopped network thread reliably, so each start has a fresh one).
    // Shared while in use by publish and subscribe; replaced only once its
    // thread has been joined.
    std::shared_mutex clientMutex;
    struct mosquitto* client = nullptr;
    std::atomic<bool> connected{false};
    std::atomic<bool> listening{false};
    bool started = false;

    std::mutex stoppingMutex;  // guards stopping; taken by the pause and by start() and stop() only
    std::condition_variable stoppingWake;
    bool stopping = false;

    std::mutex topicsMutex;  // guards topics; taken briefly, never across a handler
    std::set<std::string> topics;

    std::mutex subscriptionsMutex;  // guards the three below; held across mosquitto_subscribe only
    std::map<int, std::string> awaited;  // topic by the message id of its SUBSCRIBE
    std::map<std::string, int> refusals;  // on this connection, by topic
    bool announced = false;  // the connected handler ran for this connection
};

}  // namespace mqtt
}  // namespace tessarine
}  // namespace lumivale
