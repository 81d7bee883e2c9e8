// The transport between a store and its server, implemented by the
// application, and the records that cross it.
//
// The application derives from SyncProtocol, implements the four pure
// operations on its own messaging connection, and reports what the
// connection delivers by calling the on... entry points. Each entry point
// hands the event to the callbacks that the store's components registered,
// in registration order.
//
// Registries: one per kind of event, five in all. Every add returns an id
// that is unique within its registry, counting from 1 and never reused; once
// INT_MAX ids have been handed out, further adds throw std::runtime_error.
// Removing an id that is not registered changes nothing. An entry point
// calls the registered callbacks one after another and passes its argument
// unchanged; a callback that throws (an empty one throws
// std::bad_function_call) ends the delivery: the later callbacks are not
// called and the exception reaches the caller of the entry point.
//
// Threads: every operation may be called from any thread. Each registry has a
// list lock, held for a whole delivery, and an id lock taken inside it. So
// two events of one kind never run their callbacks at the same time, events
// of different kinds can, and adding or removing blocks while that registry
// delivers. A callback must not add to, remove from or deliver into the
// registry that is delivering to it (the locks are not recursive); it may
// deliver into another registry, as long as no other thread delivers in the
// opposite direction. The store itself only goes from a snapshot delivery to
// the delta-status and delta-received registries.
//
// The records are plain values: default-constructible with empty strings and
// vectors, copied member by member into jobs, queues and callback arguments.
// Strings are byte strings; blobs are counted byte vectors; 64-bit numbers are
// unsigned. The enum values are stored in the database and passed to and from
// the application, so they are fixed.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "platform/ThreadAnnotations.h"

namespace lumivale {
namespace tessarine {

class SyncProtocol {
public:
    // What a delta does to one object.
    enum class DeltaType : int32_t { SAVE = 1, DELETE = 2 };

    // How far a locally written delta has travelled; ordered
    // PENDING < SENT < PERSISTED.
    enum class DeltaStatus : int32_t { PENDING = 1, SENT = 2, PERSISTED = 3 };

    // The kind of a server payload's inner buffer.
    enum class PayloadType : int32_t { DELTA_LIST = 1, SNAPSHOT = 2 };

    // One change to one object. (collectionName, versionId) identifies a
    // queued local delta. clientId is empty in a delta a Collection makes and
    // stamped by the delta queue when it goes to the transport;
    // sequenceNumber is set only on deltas that came from the server.
    struct Delta {
        std::string clientId;
        std::string collectionName;
        uint64_t versionId = 0;
        std::string primaryKey;
        std::string sortKey;
        DeltaType type = DeltaType::SAVE;
        std::vector<unsigned char> blob;
        uint64_t sequenceNumber = 0;
    };

    // A new status for a delta, found in the queue by its collection name
    // and version id.
    struct DeltaStatusUpdate {
        Delta delta;
        DeltaStatus status = DeltaStatus::PENDING;
    };

    // One object inside a snapshot.
    struct TessarineObject {
        std::string primaryKey;
        std::string sortKey;
        std::vector<unsigned char> blob;
    };

    // The full content of one collection at one point. versionId is the
    // highest version id of this client's own changes that it contains.
    struct Snapshot {
        std::string collectionName;
        std::vector<TessarineObject> objects;
        uint64_t sequenceNumber = 0;
        uint64_t versionId = 0;
    };

    // What the store asks of the server when it subscribes to a collection.
    // version is one byte: the low 8 bits of the library's data version.
    struct SubscriptionRequest {
        std::string version;
        std::string collectionName;
        std::string clientId;
        uint64_t sequenceNumber = 0;
    };

    // The server's answer to a subscription. The store reads none of its
    // fields; a transport fills in what its server says.
    struct SubscriptionResponse {
        std::string collectionName;
        uint64_t sequenceNumber = 0;
    };

    // A server payload taken out of its envelope.
    struct ServerPayload {
        PayloadType type = PayloadType::DELTA_LIST;
        std::vector<unsigned char> data;
    };

    using ConnectionEstablishedCallback = std::function<void()>;
    using SubscriptionResponseReceivedCallback = std::function<void(const SubscriptionResponse&)>;
    using DeltaReceivedCallback = std::function<void(const std::vector<Delta>&)>;
    using DeltaStatusUpdatedCallback = std::function<void(const DeltaStatusUpdate&)>;
    using SnapshotReceivedCallback = std::function<void(const Snapshot&)>;

    SyncProtocol() = default;
    SyncProtocol(const SyncProtocol&) = delete;
    SyncProtocol& operator=(const SyncProtocol&) = delete;
    // Destroys the registries without calling any callback.
    virtual ~SyncProtocol() = 0;

    // Begins connecting; from then on the implementation calls
    // onConnectionEstablished() each time a connection is up.
    virtual void start() = 0;
    // Publishes a subscription for request.collectionName.
    virtual void sendSubscriptionRequest(const SubscriptionRequest& request) = 0;
    // Publishes one local change, whose clientId is this store's. The result
    // is handed back to the store's caller unread.
    virtual int sendDelta(const Delta& delta) = 0;
    // Asks the server for a snapshot of a collection for a client; the store
    // itself never calls it.
    virtual void sendSnapshotRequest(const std::string& collectionName, const std::string& clientId) = 0;

    // For the store's own injected events: each calls the matching on...
    // operation virtually, so an override sees injected events too.
    virtual void triggerDeltaReceivedCallbacks(const std::vector<Delta>& deltas);
    virtual void triggerDeltaStatusUpdatedCallbacks(const DeltaStatusUpdate& update);

    // Entry points for the implementation: each delivers its event to the
    // callbacks of its registry.
    virtual void onConnectionEstablished();
    virtual void onSubscriptionResponseReceived(const SubscriptionResponse& response);
    virtual void onDeltaReceived(const std::vector<Delta>& deltas);
    virtual void onDeltaStatusUpdated(const DeltaStatusUpdate& update);
    virtual void onSnapshotReceived(const Snapshot& snapshot);

    int addConnectionEstablishedCallback(const ConnectionEstablishedCallback& callback);
    void removeConnectionEstablishedCallback(int id);
    int addSubscriptionResponseReceivedCallback(const SubscriptionResponseReceivedCallback& callback);
    void removeSubscriptionResponseReceivedCallback(int id);
    int addDeltaReceivedCallback(const DeltaReceivedCallback& callback);
    void removeDeltaReceivedCallback(int id);
    int addDeltaStatusUpdatedCallback(const DeltaStatusUpdatedCallback& callback);
    void removeDeltaStatusUpdatedCallback(int id);
    int addSnapshotReceivedCallback(const SnapshotReceivedCallback& callback);
    void removeSnapshotReceivedCallback(int id);

private:
    // The callbacks of one kind of event with their ids; idMutex is a leaf
    // taken under listMutex (the store's lock order is in the README). Its operations are defined in SyncProtocol.cpp,
    // the only place that uses them.
    template <typename... Args>
    class CallbackRegistry {
    public:
        using Callback = std::function<void(Args...)>;

        int add(const Callback& callback);
        void remove(int id);
        void deliver(Args... args);

    private:
        Mutex listMutex;
        Mutex idMutex TS_ACQUIRED_AFTER(listMutex);
        std::vector<std::pair<int, Callback>> entries TS_GUARDED_BY(listMutex);
        int lastId TS_GUARDED_BY(idMutex) = 0;
    };

    CallbackRegistry<> connectionEstablishedCallbacks;
    CallbackRegistry<const SubscriptionResponse&> subscriptionResponseReceivedCallbacks;
    CallbackRegistry<const std::vector<Delta>&> deltaReceivedCallbacks;
    CallbackRegistry<const DeltaStatusUpdate&> deltaStatusUpdatedCallbacks;
    CallbackRegistry<const Snapshot&> snapshotReceivedCallbacks;
};

}  // namespace tessarine
}  // namespace lumivale
