// Turns a snapshot received from the server into the events the store
// already handles: a PERSISTED status update for each of this client's
// queued changes that the snapshot contains, then one delivery of SAVE
// deltas (client "snapshot_store", version id 0, the snapshot's sequence
// number), one per object, in the snapshot's order. A snapshot saves; it
// never deletes local objects.
//
// Runs on the transport's thread inside its snapshot delivery. Registers
// with the transport on construction and removes the registration on
// destruction. Errors: a std::exception is logged as "Error while processing
// snapshot: %s" and thrown on to the transport's caller.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {

class DeltaQueueStorage;
class SubscriptionManager;

class SnapshotConsumer {
public:
    SnapshotConsumer(std::shared_ptr<DeltaQueueStorage> deltaQueueStorage, std::shared_ptr<SyncProtocol> syncProtocol,
                     std::shared_ptr<SubscriptionManager> subscriptionManager);
    ~SnapshotConsumer();
    SnapshotConsumer(const SnapshotConsumer&) = delete;
    SnapshotConsumer& operator=(const SnapshotConsumer&) = delete;

    void onSnapshotReceived(const SyncProtocol::Snapshot& snapshot);
    // Reports PERSISTED for the collection's queued deltas with version ids
    // 0 to versionId, oldest first.
    void updatePendingDeltasInSnapshot(const std::string& collectionName, uint64_t versionId);

private:
    std::shared_ptr<DeltaQueueStorage> deltaQueueStorage;
    std::shared_ptr<SyncProtocol> syncProtocol;
    std::shared_ptr<SubscriptionManager> subscriptionManager;
    std::string snapshotClientId = "snapshot_store";
    int snapshotReceivedCallbackId = 0;
};

}  // namespace tessarine
}  // namespace lumivale
