#include "tessarine/SnapshotConsumer.h"

#include <exception>
#include <vector>

#include "platform/Log.h"
#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/StoreLog.h"

namespace lumivale {
namespace tessarine {

SnapshotConsumer::SnapshotConsumer(std::shared_ptr<DeltaQueueStorage> theDeltaQueueStorage,
                                   std::shared_ptr<SyncProtocol> theSyncProtocol,
                                   std::shared_ptr<SubscriptionManager> theSubscriptionManager)
    : deltaQueueStorage(std::move(theDeltaQueueStorage)),
      syncProtocol(std::move(theSyncProtocol)),
      subscriptionManager(std::move(theSubscriptionManager)) {
    snapshotReceivedCallbackId = this->syncProtocol->addSnapshotReceivedCallback(
        [this](const SyncProtocol::Snapshot& snapshot) { onSnapshotReceived(snapshot); });
}

SnapshotConsumer::~SnapshotConsumer() { syncProtocol->removeSnapshotReceivedCallback(snapshotReceivedCallbackId); }

void SnapshotConsumer::onSnapshotReceived(const SyncProtocol::Snapshot& snapshot) {
    try {
        const std::string collectionName = snapshot.collectionName;
        updatePendingDeltasInSnapshot(collectionName, snapshot.versionId);
        std::vector<SyncProtocol::Delta> deltas;
        deltas.reserve(snapshot.objects.size());
        for (const SyncProtocol::TessarineObject& object : snapshot.objects) {
            SyncProtocol::Delta delta;
            delta.clientId = snapshotClientId;
            delta.collectionName = collectionName;
            delta.versionId = 0;
            delta.primaryKey = object.primaryKey;
            delta.sortKey = object.sortKey;
            delta.type = SyncProtocol::DeltaType::SAVE;
            delta.blob = object.blob;
            delta.sequenceNumber = snapshot.sequenceNumber;
            deltas.push_back(std::move(delta));
        }
        syncProtocol->triggerDeltaReceivedCallbacks(deltas);
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error while processing snapshot: %s", e.what());
        throw;
    }
}

void SnapshotConsumer::updatePendingDeltasInSnapshot(const std::string& collectionName, uint64_t versionId) {
    for (const SyncProtocol::Delta& delta : deltaQueueStorage->getDeltaRangeByVersionId(collectionName, 0, versionId)) {
        SyncProtocol::DeltaStatusUpdate update;
        update.delta = delta;
        update.status = SyncProtocol::DeltaStatus::PERSISTED;
        syncProtocol->triggerDeltaStatusUpdatedCallbacks(update);
    }
}

}  // namespace tessarine
}  // namespace lumivale
