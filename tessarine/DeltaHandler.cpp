#include "tessarine/DeltaHandler.h"

#include <exception>
#include <stdexcept>

#include "platform/Assert.h"
#include "platform/Log.h"
#include "sqlite/Database.h"
#include "tessarine/CallbackManager.h"
#include "tessarine/Collection.h"
#include "tessarine/Lifecycle.h"
#include "tessarine/SerializedJobQueue.h"
#include "tessarine/StoreLog.h"
#include "tessarine/SubscriptionManager.h"
#include "tessarine/VersionVectorStorage.h"

namespace lumivale {
namespace tessarine {

namespace {
constexpr auto kImmediate = lumivale::sqlite::Database::TransactionType::Immediate;
const char* const kWriteInsideTransaction =
    "a change cannot be written from code that the store runs inside its own transaction (an indexer)";

bool isKnownDeltaType(SyncProtocol::DeltaType type) {
    return type == SyncProtocol::DeltaType::SAVE || type == SyncProtocol::DeltaType::DELETE;
}
}  // namespace

DeltaHandler::DeltaHandler(std::shared_ptr<lumivale::sqlite::Database> theDatabase,
                           std::shared_ptr<CallbackManager> theCallbackManager,
                           std::shared_ptr<CollectionStorage> theCollectionStorage,
                           std::shared_ptr<DeltaQueue> theDeltaQueue, std::shared_ptr<Lifecycle> theLifecycle,
                           std::shared_ptr<SyncProtocol> theSyncProtocol,
                           std::shared_ptr<SerializedJobQueue> theSerializedJobQueue,
                           std::shared_ptr<SubscriptionManager> theSubscriptionManager,
                           std::shared_ptr<VersionVectorStorage> theVersionVectorStorage, std::string theClientId)
    : database(std::move(theDatabase)),
      callbackManager(std::move(theCallbackManager)),
      collectionStorage(std::move(theCollectionStorage)),
      deltaQueue(std::move(theDeltaQueue)),
      lifecycle(std::move(theLifecycle)),
      syncProtocol(std::move(theSyncProtocol)),
      serializedJobQueue(std::move(theSerializedJobQueue)),
      subscriptionManager(std::move(theSubscriptionManager)),
      versionVectorStorage(std::move(theVersionVectorStorage)),
      clientId(std::move(theClientId)) {
    lifecycleStopCallbackId = this->lifecycle->addStopCallback([this] { onLifecycleStop(); });
    deltaReceivedCallbackId = this->syncProtocol->addDeltaReceivedCallback(
        [this](const std::vector<SyncProtocol::Delta>& deltas) { onDeltaReceived(deltas); });
    this->deltaQueue->addDeltaStatusUpdatedCallback(
        [this](const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status) {
            onDeltaStatusUpdated(delta, status);
        });
}

DeltaHandler::~DeltaHandler() {
    lifecycle->removeStopCallback(lifecycleStopCallbackId);
    serializedJobQueue->stopProcessingJobs();
    syncProtocol->removeDeltaReceivedCallback(deltaReceivedCallbackId);
}

uint64_t DeltaHandler::addLocalDeltaWithNextVersionId(SyncProtocol::Delta delta) {
    // Code that the store calls inside one of its transactions (an indexer)
    // cannot write: its change would become part of a transaction that can
    // still be rolled back, and this thread may already hold the local write
    // lock.
    if (database->isInTransactionOnThisThread()) throw std::runtime_error(kWriteInsideTransaction);
    const std::vector<CallbackManager::DeltaReceivedCallback> callbacks = callbackManager->getDeltaReceivedCallbacks();
    std::vector<Delta> notice;
    uint64_t versionId = 0;
    {
        MutexLock lock(localWriteMutex);
        versionId = collectionStorage->incrementAndGetVersionId(delta.collectionName);
        delta.versionId = versionId;
        const int64_t queueId = queueAndApplyLocalDelta(delta);
        if (!callbacks.empty()) notice.push_back(convertMQTTDeltaToApiDelta(delta, SyncProtocol::DeltaStatus::PENDING));
        // Still under the lock, so that changes wait to be sent in the order
        // of their version ids.
        deltaQueue->addCommitted(queueId, std::move(delta));
    }
    notify(callbacks, notice);
    deltaQueue->sendCommitted();
    return versionId;
}

int64_t DeltaHandler::queueAndApplyLocalDelta(const SyncProtocol::Delta& delta) {
    if (stopped) throw std::runtime_error("DeltaHandler already stopped");
    int64_t queueId = 0;
    database->runInTransaction([&] {
        queueId = deltaQueue->addDelta(delta, SyncProtocol::DeltaStatus::PENDING);
        applyDelta(delta, CollectionStorage::ObjectStatus::PENDING);
    }, kImmediate);
    return queueId;
}

void DeltaHandler::postJob(std::function<void()> work) {
    try {
        serializedJobQueue->addJob(SerializedJobQueue::Job{std::move(work)});
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error while adding job to queue: %s", e.what());
        lifecycle->stop();
    }
}

void DeltaHandler::onDeltaReceived(const std::vector<SyncProtocol::Delta>& deltas) {
    if (stopped) return;
    // A delta of an unknown type, or for a collection name that no store
    // can have (and that must never reach SQL text), cannot be applied; left
    // in the delivery it would fail the job on every retry and hold up
    // everything behind it.
    std::vector<SyncProtocol::Delta> applicable;
    applicable.reserve(deltas.size());
    for (const SyncProtocol::Delta& delta : deltas) {
        if (!isKnownDeltaType(delta.type)) {
            lv_printLog(LogPriority::kWarn, kStoreLogTag, "Dropping received delta of unknown type: %d",
                        static_cast<int>(delta.type));
        } else if (!Collection::isValidCollectionName(delta.collectionName)) {
            lv_printLog(LogPriority::kWarn, kStoreLogTag, "Dropping received delta for invalid collection name: %s",
                        delta.collectionName.c_str());
        } else {
            applicable.push_back(delta);
        }
    }
    // The job queue copies a job when it queues it and again when it runs
    // it; sharing the delivery makes those copies cheap.
    auto delivery = std::make_shared<const std::vector<SyncProtocol::Delta>>(std::move(applicable));
    postJob([this, delivery] { processDelivery(*delivery); });
}

void DeltaHandler::onDeltaStatusUpdated(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status) {
    if (stopped) return;
    postJob([this, delta, status] { processStatusUpdate(delta, status); });
}

void DeltaHandler::onLifecycleStop() { stopped = true; }

// Job on the worker: the whole delivery is one transaction, retried whole.
void DeltaHandler::processDelivery(const std::vector<SyncProtocol::Delta>& deltas) {
    try {
        database->runInTransaction([&] {
            DeliveryMarks marks;
            for (const SyncProtocol::Delta& delta : deltas) processIncomingDelta(delta, marks);
            storeDeliveryMarks(marks);
        }, kImmediate);
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "Failed to process received deltas: %s", e.what());
        throw;
    }
    callDeltaCallbacks(deltas, SyncProtocol::DeltaStatus::PERSISTED);
}

// Job on the worker, posted by the delta queue after it changed a row.
void DeltaHandler::processStatusUpdate(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status) {
    try {
        database->runInTransaction([&] { recalculateAndUpdateObjectStatus(delta); }, kImmediate);
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error while processing delta status update: %s", e.what());
        throw;
    }
    callDeltaCallbacks({delta}, status);
}

void DeltaHandler::processIncomingDelta(const SyncProtocol::Delta& delta, DeliveryMarks& marks) {
    marks.sequenceNumbers[delta.collectionName] = delta.sequenceNumber;
    if (delta.clientId == clientId) {
        processIncomingOwnDelta(delta);
    } else {
        processIncomingRemoteDelta(delta, marks);
    }
}

void DeltaHandler::processIncomingOwnDelta(const SyncProtocol::Delta& delta) {
    if (deltaQueue->updateDeltaStatus(delta, SyncProtocol::DeltaStatus::PERSISTED) == DeltaQueue::QUEUE_CHANGED) {
        recalculateAndUpdateObjectStatus(delta);
    }
}

void DeltaHandler::processIncomingRemoteDelta(const SyncProtocol::Delta& delta, DeliveryMarks& marks) {
    uint64_t& highest = marks.highestVersions[{delta.collectionName, delta.clientId}];
    if (delta.versionId > highest) highest = delta.versionId;
    // An outstanding local change of the object wins until it is persisted.
    if (deltaQueue->getPendingStatus(delta.collectionName, delta.primaryKey) == DeltaQueue::PendingStatus::PERSISTED) {
        applyDelta(delta, CollectionStorage::ObjectStatus::PERSISTED);
    }
}

void DeltaHandler::storeDeliveryMarks(const DeliveryMarks& marks) {
    for (const auto& [collection, sequenceNumber] : marks.sequenceNumbers) {
        subscriptionManager->updateSequenceNumber(std::string(collection), sequenceNumber);
    }
    for (const auto& [key, versionId] : marks.highestVersions) {
        versionVectorStorage->updateCollectionVersionVector(std::string(key.first), std::string(key.second), versionId);
    }
}

void DeltaHandler::applyDelta(const SyncProtocol::Delta& delta, CollectionStorage::ObjectStatus status) {
    switch (delta.type) {
        case SyncProtocol::DeltaType::SAVE:
            collectionStorage->saveObject(delta.collectionName, delta.primaryKey, delta.sortKey, delta.blob, status);
            return;
        case SyncProtocol::DeltaType::DELETE:
            collectionStorage->deleteObject(delta.collectionName, delta.primaryKey);
            return;
    }
    LV_ASSERT_FAIL("DeltaHandler", "Unknown delta type: %d", static_cast<int>(delta.type));
}

void DeltaHandler::recalculateAndUpdateObjectStatus(const SyncProtocol::Delta& delta) {
    DeltaQueue::PendingStatus pending = deltaQueue->getPendingStatus(delta.collectionName, delta.primaryKey);
    collectionStorage->updateObjectStatus(delta.collectionName, delta.primaryKey, convToObjectStatus(pending));
}

CollectionStorage::ObjectStatus DeltaHandler::convToObjectStatus(DeltaQueue::PendingStatus pendingStatus) {
    switch (pendingStatus) {
        case DeltaQueue::PendingStatus::PENDING: return CollectionStorage::ObjectStatus::PENDING;
        case DeltaQueue::PendingStatus::SENT: return CollectionStorage::ObjectStatus::SENT;
        case DeltaQueue::PendingStatus::PERSISTED: return CollectionStorage::ObjectStatus::PERSISTED;
    }
    lv_printLog(LogPriority::kWarn, kStoreLogTag, "Unknown pending status: %d", static_cast<int>(pendingStatus));
    return CollectionStorage::ObjectStatus::PERSISTED;
}

void DeltaHandler::callDeltaCallbacks(const std::vector<SyncProtocol::Delta>& deltas,
                                      SyncProtocol::DeltaStatus status) noexcept {
    if (deltas.empty()) return;
    const std::vector<CallbackManager::DeltaReceivedCallback> callbacks = callbackManager->getDeltaReceivedCallbacks();
    if (callbacks.empty()) return;
    std::vector<Delta> apiDeltas;
    apiDeltas.reserve(deltas.size());
    for (const SyncProtocol::Delta& delta : deltas) apiDeltas.push_back(convertMQTTDeltaToApiDelta(delta, status));
    notify(callbacks, apiDeltas);
}

void DeltaHandler::notify(const std::vector<CallbackManager::DeltaReceivedCallback>& callbacks,
                          const std::vector<Delta>& deltas) noexcept {
    if (deltas.empty()) return;
    for (const auto& callback : callbacks) {
        try {
            callback(deltas);
        } catch (const std::exception& e) {
            lv_printLog(LogPriority::kWarn, kStoreLogTag, "Exception in delta callback: %s", e.what());
        }
    }
}

Delta DeltaHandler::convertMQTTDeltaToApiDelta(const SyncProtocol::Delta& delta, SyncProtocol::DeltaStatus status) {
    Delta apiDelta;
    apiDelta.collectionName = delta.collectionName;
    apiDelta.primaryKey = delta.primaryKey;
    apiDelta.sortKey = delta.sortKey;
    apiDelta.blob = delta.blob;
    if (isKnownDeltaType(delta.type)) {
        apiDelta.type = delta.type;
    } else {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "Unknown delta type: %d", static_cast<int>(delta.type));
    }
    int statusNumber = static_cast<int>(status);
    if (statusNumber >= 1 && statusNumber <= 3) {
        apiDelta.status = status;
    } else {
        lv_printLog(LogPriority::kWarn, kStoreLogTag, "Unknow delta status: %d", statusNumber);
    }
    return apiDelta;
}

}  // namespace tessarine
}  // namespace lumivale
