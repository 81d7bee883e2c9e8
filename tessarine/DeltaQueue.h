// The outgoing half of synchronisation. Queues every local delta durably and
// hands it to the transport at once, sends the whole queue again on every
// established connection, applies the delivery statuses the transport
// reports (as jobs on the worker), and answers how far an object's queued
// changes have got.
//
// Threads: addDelta runs on the writing thread inside the caller's
// transaction; onDeltaStatusUpdated only posts a job; status jobs, and the
// listeners they call after their commit, run on the worker;
// onConnectionEstablished runs on the transport's thread. Listeners are
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

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class DeltaQueueStorage;
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

    // Inserts the delta's row, then hands the delta to the transport; returns
    // what the transport returns. Opens no transaction.
    virtual int addDelta(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);
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

    // A copy of the delta stamped with this store's client id, to the transport.
    int sendDelta(const SyncProtocol::Delta& delta);
    // The least advanced status; empty for no statuses.
    std::optional<SyncProtocol::DeltaStatus> getMinStatus(const std::vector<SyncProtocol::DeltaStatus>& statuses);

    void onDeltaStatusUpdated(const SyncProtocol::DeltaStatusUpdate& update);
    void onConnectionEstablished();
    void onLifecycleStop();

private:
    // Stamps a delta the queue owns and hands it to the transport, sparing
    // the copy that sendDelta makes to leave its caller's delta alone.
    int stampAndSend(SyncProtocol::Delta& delta);
    void processDeltaStatusUpdate(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status);

    std::shared_ptr<lumivale::sqlite::Database> database;
    std::shared_ptr<Lifecycle> lifecycle;
    std::shared_ptr<DeltaQueueStorage> deltaQueueStorage;
    std::shared_ptr<SerializedJobQueue> serializedJobQueue;
    std::shared_ptr<SyncProtocol> syncProtocol;
    std::string clientId;
    std::vector<DeltaStatusUpdatedCallback> deltaStatusUpdatedCallbacks;
    std::function<void()> changePersistedListener;
    int connectionEstablishedCallbackId = 0;
    int deltaStatusUpdatedCallbackId = 0;
    int lifecycleStopCallbackId = 0;
    std::atomic<bool> stopped{false};
};

}  // namespace tessarine
}  // namespace lumivale
