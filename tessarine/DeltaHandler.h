// Where every change to an object becomes a delta and every delta a change.
//
// Local path (application thread): addLocalDeltaWithNextVersionId gives the
// delta its collection's next version id, queues it and writes
// the object with status PENDING in one transaction; once that has
// committed it tells the application's callbacks and hands the delta to the
// transport (through the delta queue's sender), holding no lock, so a write
// that failed never reaches the transport. Local writes are serialised by a
// lock of their own, also held while the version id is taken, so each collection's changes reach the queue and
// the transport in version-id order whatever threads write. A write from
// code that the store runs inside one of its transactions (the indexer) is
// refused: it could still be rolled back. Incoming path (transport thread, then the
// worker): a delivery becomes one job and one transaction; own deltas retire
// their queue row and have their object's status recomputed, other clients'
// deltas are applied as PERSISTED unless a local change of the object is
// still queued. Status path (worker): when the queue reports a changed row,
// the object's status is recomputed and the application told.
//
// The application's callbacks run outside every transaction: on the writing
// thread after a local write, on the worker otherwise. After the lifecycle
// stops, a local write throws "DeltaHandler already stopped" and events are
// dropped. Registers with the lifecycle, the transport and the delta queue on
// construction; destruction removes the first two after stopping the job
// queue (the worker is the only caller of the queue listener). Must not be
// destroyed on the worker or inside a transport delivery.
#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/ThreadAnnotations.h"
#include "tessarine/CallbackManager.h"
#include "tessarine/CollectionStorage.h"
#include "tessarine/Delta.h"
#include "tessarine/DeltaQueue.h"
#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class Lifecycle;
class SerializedJobQueue;
class SubscriptionManager;
class VersionVectorStorage;

class DeltaHandler {
public:
    DeltaHandler(std::shared_ptr<lumivale::sqlite::Database> database,
                 std::shared_ptr<CallbackManager> callbackManager,
                 std::shared_ptr<CollectionStorage> collectionStorage, std::shared_ptr<DeltaQueue> deltaQueue,
                 std::shared_ptr<Lifecycle> lifecycle, std::shared_ptr<SyncProtocol> syncProtocol,
                 std::shared_ptr<SerializedJobQueue> serializedJobQueue,
                 std::shared_ptr<SubscriptionManager> subscriptionManager,
                 std::shared_ptr<VersionVectorStorage> versionVectorStorage, std::string clientId);
    virtual ~DeltaHandler();
    DeltaHandler(const DeltaHandler&) = delete;
    DeltaHandler& operator=(const DeltaHandler&) = delete;

    // The local write path of a Collection. The caller has filled
    // collectionName, type, primaryKey and, for a save, sortKey and blob.
    // Takes the collection's next version id (committed on its own, so that
    // a failed write uses it up) and returns it, then queues the delta and
    // applies it. Both steps happen under one lock, so that concurrent
    // writers hand each collection's changes to the queue and the transport
    // in version-id order. Throws; nothing but the version id is kept on
    // failure, and nothing reaches the transport. A transport that does not
    // take the change does not fail the write: it stays queued.
    virtual uint64_t addLocalDeltaWithNextVersionId(SyncProtocol::Delta delta) TS_EXCLUDES(localWriteMutex);

    void onDeltaReceived(const std::vector<SyncProtocol::Delta>& deltas);
    void onDeltaStatusUpdated(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);
    void onLifecycleStop();

    // What a delivery moves forward: per collection the sequence number of
    // its last delta, per (collection, writing client) the highest version
    // id. Stored once each when the delivery's deltas have been applied,
    // inside the same transaction, instead of once per delta. The views
    // point into the delivery, which outlives the marks.
    struct DeliveryMarks {
        std::map<std::string_view, uint64_t> sequenceNumbers;
        std::map<std::pair<std::string_view, std::string_view>, uint64_t> highestVersions;
    };

    // One incoming delta, inside the caller's transaction; its sequence
    // number and version go into marks.
    void processIncomingDelta(const SyncProtocol::Delta& delta, DeliveryMarks& marks);
    void processIncomingOwnDelta(const SyncProtocol::Delta& delta);
    void processIncomingRemoteDelta(const SyncProtocol::Delta& delta, DeliveryMarks& marks);
    void storeDeliveryMarks(const DeliveryMarks& marks);
    void applyDelta(const SyncProtocol::Delta& delta, CollectionStorage::ObjectStatus status);
    void recalculateAndUpdateObjectStatus(const SyncProtocol::Delta& delta);
    CollectionStorage::ObjectStatus convToObjectStatus(DeltaQueue::PendingStatus pendingStatus);
    // Hands the deltas to every application callback; a callback's
    // std::exception is logged and the next callback still runs.
    void callDeltaCallbacks(const std::vector<SyncProtocol::Delta>& deltas, SyncProtocol::DeltaStatus status) noexcept;
    Delta convertMQTTDeltaToApiDelta(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);

private:
    // Queues and applies the delta in one transaction and returns its queue
    // id; localWriteMutex is held.
    int64_t queueAndApplyLocalDelta(const SyncProtocol::Delta& delta) TS_REQUIRES(localWriteMutex);
    void processDelivery(const std::vector<SyncProtocol::Delta>& deltas);
    // Calls each callback with deltas (none for none); a callback's
    // std::exception is logged and the next one still runs.
    static void notify(const std::vector<CallbackManager::DeltaReceivedCallback>& callbacks,
                       const std::vector<Delta>& deltas) noexcept;
    void processStatusUpdate(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);
    void postJob(std::function<void()> work);

    std::shared_ptr<lumivale::sqlite::Database> database;
    std::shared_ptr<CallbackManager> callbackManager;
    std::shared_ptr<CollectionStorage> collectionStorage;
    std::shared_ptr<DeltaQueue> deltaQueue;
    std::shared_ptr<Lifecycle> lifecycle;
    std::shared_ptr<SyncProtocol> syncProtocol;
    std::shared_ptr<SerializedJobQueue> serializedJobQueue;
    std::shared_ptr<SubscriptionManager> subscriptionManager;
    std::shared_ptr<VersionVectorStorage> versionVectorStorage;
    std::string clientId;
    int deltaReceivedCallbackId = 0;
    int lifecycleStopCallbackId = 0;
    std::atomic<bool> stopped{false};
    // Held from taking a local change's version id until it has committed
    // and waits to be sent, never while application callbacks or the
    // transport run (the indexer runs under it, inside the transaction).
    // Its place in the store's lock order: README, "How a change flows
    // through the store".
    Mutex localWriteMutex;
};

}  // namespace tessarine
}  // namespace lumivale
