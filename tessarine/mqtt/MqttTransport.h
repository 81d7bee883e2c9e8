// A SyncProtocol over MQTT 3.1.1: connects a store to the networked sync
// server (tessarine-server) through any broker.
//
//   mqtt::MqttTransport::Options options;
//   options.host = "broker.example"; options.port = 1883;
//   auto transport = std::make_shared<mqtt::MqttTransport>(options);
//   auto store = Tessarine::open(path, transport, threadCreator);
//
// Outgoing, the three wire payloads go with QoS 1 to the topics of
// tessarine/Protocol.h. Incoming, the server's payloads for this store arrive
// on clientTopic(its client id), which the transport subscribes to as soon as
// the store first names its client id (in its first subscription or change).
//
// Connection: start() connects in the background and keeps reconnecting with
// back-off (Options). Every connection is reported by onConnectionEstablished
// (the store then subscribes again and resends its queued changes), and so is
// every new token the server publishes on TOPIC_SERVER_ONLINE while this
// transport is connected: a server that restarted or reconnected may have
// lost what was in flight, so the store resends to it. (The token the broker
// kept, which arrives on every connection, names a server that was already
// there when the connection's own resynchronisation ran.)
//
// Order: the server must see one client's changes in the order they were
// written, also when some were lost on the way (a server or broker killed):
// a change that overtook a lost one would be applied before it. So a
// resynchronisation (the store subscribing and resending its queue, above)
// runs before any other change goes out on a new connection or to a new
// server: changes the application sends meanwhile are held and published
// right after it, in order. The server, for its part, takes a client's
// changes only after that client's subscription (NetworkSyncServer). And
// each change names the one published before it in its collection since
// the resynchronisation, the first naming itself (previousVersionId on the
// wire): a broker that loses a change yet delivers later ones (a NATS node,
// acknowledging them all), or loses the subscription before them, cannot
// make the server log them out of order or take them on a session of
// before: it refuses them, and everything after, until the client
// subscribes again (see Unanswered changes).
//
// Statuses: sendDelta returns 1 when the change went (or, held, goes) to
// the broker and 0 when it did not (offline); either way the store keeps the
// change queued until the server's echo. SENT is reported when the broker acknowledges the
// publish. PERSISTED never comes from here: the store concludes it from the
// server's echo of the change, which the server sends only after its commit.
// (A broker can lose messages it acknowledged when it is killed.)
//
// Unanswered changes: a broker in trouble (a NATS node dying) may lose what
// it had acknowledged, the store's changes as well as the server's echoes
// and its new token. So the transport keeps the changes it publishes until
// their echoes arrive (UnansweredChanges); when one has stayed unanswered
// for Options::resendUnansweredAfter, it resynchronises as on a new server
// (subscriptions, then the queue) and waits twice as long before the next
// such attempt, up to kMaxResendUnansweredAfter; once every change is
// answered the wait is back to the option. A server that is merely
// slow gets a resend it answers with echoes.
//
// Copies: a delta the broker delivers again on the same connection (QoS 1
// is at least once; a NATS node that died redelivers long after) is dropped
// before it reaches the store (RecentDeliveries).
//
// Bad input: a server payload that does not parse, or is larger than
// Options::maxPayloadBytes, is logged (priority 5, tag "tessarine") and
// dropped; nothing reaches the store.
//
// Threads: every operation may be called from any thread; none blocks on the
// network and sendDelta never throws. The on... events run on the
// connection's network thread, never under a lock of the transport, except
// that a resynchronisation for unanswered changes runs on the transport's watch
// thread; resynchronisations never overlap. The destructor joins both
// threads: do not destroy the transport inside a store callback.
#pragma once

#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <utility>

#include "tessarine/SyncProtocol.h"
#include "tessarine/mqtt/MqttConnection.h"
#include "tessarine/mqtt/RecentDeliveries.h"
#include "tessarine/mqtt/UnansweredChanges.h"

namespace lumivale {
namespace tessarine {
namespace mqtt {

class MqttTransport : public SyncProtocol {
public:
    static constexpr std::chrono::milliseconds kMaxResendUnansweredAfter{std::chrono::minutes(2)};

    struct Options : ConnectionOptions {
        // How long a change may go unanswered before the transport
        // resynchronises (see Unanswered changes, above).
        std::chrono::milliseconds resendUnansweredAfter{std::chrono::seconds(10)};
    };

    // Throws std::runtime_error for options that cannot be used.
    explicit MqttTransport(const Options& options);
    ~MqttTransport() override;

    void start() override;
    void sendSubscriptionRequest(const SubscriptionRequest& request) override;
    int sendDelta(const Delta& delta) override;
    void sendSnapshotRequest(const std::string& collectionName, const std::string& clientId) override;

    // Takes the connection down until connect(), as an application does when
    // it goes to the background; the store keeps its changes queued (PENDING)
    // meanwhile. Not from inside a store callback (it joins the network thread).
    void disconnect();
    // Connects again after disconnect() (as start() does the first time).
    void connect();
    // True while connected to the broker.
    bool isConnected() const;

private:
    void listenAs(const std::string& clientId);
    // Publishes a change and remembers it for its acknowledgement; the lock is held.
    int publishChange(const Delta& delta);
    // Lets the store subscribe and resend, then publishes the held changes.
    // Takes resynchronisingMutex, then mutex.
    void resynchronise();
    // The watch thread: resynchronises when changes stay unanswered.
    void watchForUnanswered();
    // True, once, when a change has been unanswered long enough; mutex is held.
    bool resendDue(std::chrono::steady_clock::time_point now);
    // Takes the echoes among deltas, or what a snapshot holds; mutex is held.
    void noteAnswers(const std::vector<Delta>& deltas);
    void noteAnswers(const Snapshot& snapshot);
    void handleConnected();
    void handleDisconnected();
    void handleMessage(const std::string& topic, const std::vector<unsigned char>& payload, bool retained);
    void handleServerOnline(const std::vector<unsigned char>& payload, bool retained);
    void handleServerPayload(const std::vector<unsigned char>& payload);
    void handlePublished(int messageId);

    const std::chrono::milliseconds resendUnansweredAfter;
    // Held across a whole resynchronisation, before mutex.
    std::mutex resynchronisingMutex;

    std::mutex mutex;  // guards the members below; never held across an on... call
    std::set<std::string> clientIds;
    std::map<int, Delta> unacknowledged;  // by message id
    std::string serverToken;
    // False from a connection (or a new server) until the store has
    // resynchronised; meanwhile the application's changes wait in held.
    bool ready = false;
    std::vector<Delta> held;
    UnansweredChanges unanswered;
    // By (client id, collection): the version id of the last change published
    // since the last resynchronisation, which the next one names as its
    // previous (see Order, above); the first names itself.
    std::map<std::pair<std::string, std::string>, uint64_t> lastPublished;
    RecentDeliveries delivered;  // on this connection
    std::chrono::milliseconds unansweredAllowed;  // the wait before the next resend
    bool stopping = false;
    std::condition_variable stoppingWake;

    MqttConnection connection;  // its thread calls into the members above
    std::thread watch;          // last: joined by the destructor before anything goes
};

}  // namespace mqtt
}  // namespace tessarine
}  // namespace lumivale
