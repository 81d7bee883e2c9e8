#include "tessarine/DeltaQueue.h"

#include <exception>

#include "platform/Assert.h"
#include "platform/Log.h"
#include "sqlite/Database.h"
#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/Lifecycle.h"
#include "tessarine/SerializedJobQueue.h"
#include "tessarine/StoreLog.h"

namespace lumivale {
namespace tessarine {

namespace {

int rank(SyncProtocol::DeltaStatus status) {
    switch (status) {
        case SyncProtocol::DeltaStatus::PENDING: return 0;
        case SyncProtocol::DeltaStatus::SENT: return 1;
        case SyncProtocol::DeltaStatus::PERSISTED: return 2;
    }
    LV_ASSERT_FAIL("DeltaQueue", "Invalid delta status: %d", static_cast<int>(status));
}

}  // namespace

DeltaQueue::DeltaQueue(std::shared_ptr<lumivale::sqlite::Database> theDatabase, std::shared_ptr<Lifecycle> theLifecycle,
                       std::shared_ptr<DeltaQueueStorage> theDeltaQueueStorage,
                       std::shared_ptr<SerializedJobQueue> theSerializedJobQueue,
                       std::shared_ptr<SyncProtocol> theSyncProtocol, std::string clientId)
    : database(std::move(theDatabase)),
      lifecycle(std::move(theLifecycle)),
      deltaQueueStorage(std::move(theDeltaQueueStorage)),
      serializedJobQueue(std::move(theSerializedJobQueue)),
      syncProtocol(std::move(theSyncProtocol)),
      sender(this->syncProtocol, this->deltaQueueStorage, std::move(clientId)) {
    lifecycleStopCallbackId = this->lifecycle->addStopCallback([this] { onLifecycleStop(); });
    connectionEstablishedCallbackId =
        this->syncProtocol->addConnectionEstablishedCallback([this] { onConnectionEstablished(); });
    deltaStatusUpdatedCallbackId = this->syncProtocol->addDeltaStatusUpdatedCallback(
        [this](const SyncProtocol::DeltaStatusUpdate& update) { onDeltaStatusUpdated(update); });
}

DeltaQueue::~DeltaQueue() {
    lifecycle->removeStopCallback(lifecycleStopCallbackId);
    serializedJobQueue->stopProcessingJobs();
    syncProtocol->removeConnectionEstablishedCallback(connectionEstablishedCallbackId);
    syncProtocol->removeDeltaStatusUpdatedCallback(deltaStatusUpdatedCallbackId);
}

int64_t DeltaQueue::addDelta(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status) {
    return deltaQueueStorage->insertDelta(delta, status);
}

void DeltaQueue::addCommitted(int64_t queueId, SyncProtocol::Delta delta) noexcept {
    sender.addCommitted(queueId, std::move(delta));
}

void DeltaQueue::sendCommitted() noexcept { sender.sendWaiting(); }

std::optional<SyncProtocol::DeltaStatus> DeltaQueue::getMinStatus(
    const std::vector<SyncProtocol::DeltaStatus>& statuses) {
    if (statuses.empty()) return std::nullopt;
    SyncProtocol::DeltaStatus minimum = statuses.front();
    for (size_t i = 1; i < statuses.size(); ++i) {
        if (rank(statuses[i]) < rank(minimum)) minimum = statuses[i];
    }
    return minimum;
}

DeltaQueue::PendingStatus DeltaQueue::getPendingStatus(const std::string& collectionName,
                                                       const std::string& primaryKey) {
    std::optional<SyncProtocol::DeltaStatus> minimum =
        getMinStatus(deltaQueueStorage->getDeltaStatuses(collectionName, primaryKey));
    if (!minimum) return PendingStatus::PERSISTED;
    if (*minimum == SyncProtocol::DeltaStatus::PENDING) return PendingStatus::PENDING;
    if (*minimum == SyncProtocol::DeltaStatus::SENT) return PendingStatus::SENT;
    LV_ASSERT_FAIL("DeltaQueue", "Invalid delta type: %d", static_cast<int>(*minimum));
}

int DeltaQueue::updateDeltaStatus(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status) {
    std::optional<SyncProtocol::DeltaStatus> current = deltaQueueStorage->getDeltaStatus(delta);
    if (!current || *current == status) return QUEUE_UNCHANGED;
    if (status == SyncProtocol::DeltaStatus::PERSISTED) {
        deltaQueueStorage->removeDelta(delta);
        if (changePersistedListener) changePersistedListener();
    } else {
        deltaQueueStorage->updateDeltaStatus(delta, status);
    }
    return QUEUE_CHANGED;
}

void DeltaQueue::addDeltaStatusUpdatedCallback(const DeltaStatusUpdatedCallback& callback) {
    deltaStatusUpdatedCallbacks.push_back(callback);
}

void DeltaQueue::setChangePersistedListener(std::function<void()> listener) {
    changePersistedListener = std::move(listener);
}

void DeltaQueue::onDeltaStatusUpdated(const SyncProtocol::DeltaStatusUpdate& update) {
    if (stopped) return;
    // A status outside the three known ones must never reach the table,
    // where every later reader would take it for a broken invariant.
    int statusNumber = static_cast<int>(update.status);
    if (statusNumber < 1 || statusNumber > 3) {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "Dropping delta status update with unknown status: %d",
                    statusNumber);
        return;
    }
    SyncProtocol::Delta delta = update.delta;
    SyncProtocol::DeltaStatus status = update.status;
    try {
        serializedJobQueue->addJob(SerializedJobQueue::Job{[this, delta, status] {
            processDeltaStatusUpdate(delta, status);
        }});
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error while adding job to queue: %s", e.what());
        lifecycle->stop();
    }
}

// Runs as a job on the worker; a failure is thrown on so that the job queue
// tries again.
void DeltaQueue::processDeltaStatusUpdate(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status) {
    int result = QUEUE_UNCHANGED;
    try {
        database->runInTransaction([&] { result = updateDeltaStatus(delta, status); },
                                   lumivale::sqlite::Database::TransactionType::Immediate);
    } catch (const std::exception&) {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "Failed to process delta status update");
        throw;
    }
    if (result != QUEUE_CHANGED) return;
    for (const DeltaStatusUpdatedCallback& callback : deltaStatusUpdatedCallbacks) callback(delta, status);
}

void DeltaQueue::onConnectionEstablished() {
    if (stopped) return;
    try {
        sender.resendOnConnection();
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error in DeltaQueue::onConnectionEstablished: %s", e.what());
    }
}

void DeltaQueue::onLifecycleStop() { stopped = true; }

}  // namespace tessarine
}  // namespace lumivale
