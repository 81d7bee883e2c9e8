// The outgoing half of synchronisation. Queues every local delta durably,
// hands it to the transport once its transaction has committed (through a
// DeltaSender, which keeps the order and resends the whole queue on every
// established connection), applies the delivery statuses the transport
// reports (as jobs on the worker), and answers how far an object's queued
// changes have got.
//
// Threads: addDelta runs on the writing thread inside the caller's
// transaction, addCommitted after its commit, sendCommitted outside every
// lock; onDeltaStatusUpdated only posts a job; status jobs, and the
// listeners they call after their commit, run on the worker;
// onConnectionEstablished runs on the transport's thread, which hands the
// resend over itself before it returns (DeltaSender says why). Listeners are
// added while the store is built, before any event can arrive: the list has
// no lock. After the lifecycle stops, status and connection events are
// ignored; the other operations still work.
//
// Registers with the lifecycle and the transport on construction and removes
// those registrations, after stopping the job queue, on destruction. Must not
// be destroyed on the worker or inside a transport delivery.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tessarine/DeltaSender.h"
#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class Lifecycle;
class SerializedJobQueue;

class DeltaQueue {
public:
    // The state of one object's queued local changes: the least advanced
    // status among them, or PERSISTED when nothing is queued.
    enum class PendingStatus : int32_t { PENDING = 1, SENT = 2, PERSISTED = 3 };

    // Result of updateDeltaStatus.
    static constexpr int QUEUE_UNCHANGED = 1;
    static constexpr int QUEUE_CHANGED = 2;

    using DeltaStatusUpdatedCallback = std::function<void(const SyncProtocol::Delta&, SyncProtocol::DeltaStatus)>;

    DeltaQueue(std::shared_ptr<lumivale::sqlite::Database> database, std::shared_ptr<Lifecycle> lifecycle,
               std::shared_ptr<DeltaQueueStorage> deltaQueueStorage,
               std::shared_ptr<SerializedJobQueue> serializedJobQueue, std::shared_ptr<SyncProtocol> syncProtocol,
               std::string clientId);
    virtual ~DeltaQueue();
    DeltaQueue(const DeltaQueue&) = delete;
    DeltaQueue& operator=(const DeltaQueue&) = delete;

    // Inserts the delta's row and returns its queue id. Opens no transaction
    // and hands nothing to the transport: the caller passes the delta to
    // addCommitted once its transaction has committed.
    virtual int64_t addDelta(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);
    // The delta of queue row queueId has committed; callers add in commit
    // order. Never throws.
    void addCommitted(int64_t queueId, SyncProtocol::Delta delta) noexcept;
    // Hands what has committed to the transport on this thread, unless
    // another thread is doing so already. Call it holding no lock of the
    // store: the transport may write through the store. Never throws.
    void sendCommitted() noexcept;
    virtual PendingStatus getPendingStatus(const std::string& collectionName, const std::string& primaryKey);
    // Applies a status to the delta's row (PERSISTED removes it). Returns
    // QUEUE_CHANGED, or QUEUE_UNCHANGED when there is no row or the status is
    // the stored one. Calls no listener.
    virtual int updateDeltaStatus(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);
    virtual void addDeltaStatusUpdatedCallback(const DeltaStatusUpdatedCallback& callback);
    // Called whenever a row leaves the queue as PERSISTED, inside the
    // transaction that removes it (the metrics take its time from it). Set
    // while the store is built, like the listeners; it must not throw.
    void setChangePersistedListener(std::function<void()> listener);

    // The least advanced status; empty for no statuses.
    std::optional<SyncProtocol::DeltaStatus> getMinStatus(const std::vector<SyncProtocol::DeltaStatus>& statuses);

    void onDeltaStatusUpdated(const SyncProtocol::DeltaStatusUpdate& update);
    void onConnectionEstablished();
    void onLifecycleStop();

private:
    void processDeltaStatusUpdate(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);

    std::shared_ptr<lumivale::sqlite::Database> database;
    std::shared_ptr<Lifecycle> lifecycle;
    std::shared_ptr<DeltaQueueStorage> deltaQueueStorage;
    std::shared_ptr<SerializedJobQueue> serializedJobQueue;
    std::shared_ptr<SyncProtocol> syncProtocol;
    DeltaSender sender;
    std::vector<DeltaStatusUpdatedCallback> deltaStatusUpdatedCallbacks;
    std::function<void()> changePersistedListener;
    int connectionEstablishedCallbackId = 0;
    int deltaStatusUpdatedCallbackId = 0;
    int lifecycleStopCallbackId = 0;
    std::atomic<bool> stopped{false};
};

}  // namespace tessarine
}  // namespace lumivale
