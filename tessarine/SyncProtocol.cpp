#include "tessarine/SyncProtocol.h"

#include <algorithm>
#include <climits>
#include <stdexcept>

namespace lumivale {
namespace tessarine {

template <typename... Args>
int SyncProtocol::CallbackRegistry<Args...>::add(const Callback& callback) {
    Callback copy = callback;
    MutexLock listLock(listMutex);
    int id;
    {
        MutexLock idLock(idMutex);
        if (lastId == INT_MAX) throw std::runtime_error("SyncProtocol callback registry has no ids left");
        id = ++lastId;
    }
    entries.emplace_back(id, std::move(copy));
    return id;
}

template <typename... Args>
void SyncProtocol::CallbackRegistry<Args...>::remove(int id) {
    MutexLock listLock(listMutex);
    entries.erase(std::remove_if(entries.begin(), entries.end(),
                                 [id](const std::pair<int, Callback>& entry) { return entry.first == id; }),
                  entries.end());
}

template <typename... Args>
void SyncProtocol::CallbackRegistry<Args...>::deliver(Args... args) {
    // The list lock stays held while the callbacks run, so that a removal
    // cannot return while a removed callback is still running.
    MutexLock listLock(listMutex);
    for (const auto& entry : entries) entry.second(args...);
}

SyncProtocol::~SyncProtocol() = default;

void SyncProtocol::triggerDeltaReceivedCallbacks(const std::vector<Delta>& deltas) { onDeltaReceived(deltas); }

void SyncProtocol::triggerDeltaStatusUpdatedCallbacks(const DeltaStatusUpdate& update) {
    onDeltaStatusUpdated(update);
}

void SyncProtocol::onConnectionEstablished() { connectionEstablishedCallbacks.deliver(); }

void SyncProtocol::onSubscriptionResponseReceived(const SubscriptionResponse& response) {
    subscriptionResponseReceivedCallbacks.deliver(response);
}

void SyncProtocol::onDeltaReceived(const std::vector<Delta>& deltas) { deltaReceivedCallbacks.deliver(deltas); }

void SyncProtocol::onDeltaStatusUpdated(const DeltaStatusUpdate& update) {
    deltaStatusUpdatedCallbacks.deliver(update);
}

void SyncProtocol::onSnapshotReceived(const Snapshot& snapshot) { snapshotReceivedCallbacks.deliver(snapshot); }

int SyncProtocol::addConnectionEstablishedCallback(const ConnectionEstablishedCallback& callback) {
    return connectionEstablishedCallbacks.add(callback);
}

void SyncProtocol::removeConnectionEstablishedCallback(int id) { connectionEstablishedCallbacks.remove(id); }

int SyncProtocol::addSubscriptionResponseReceivedCallback(const SubscriptionResponseReceivedCallback& callback) {
    return subscriptionResponseReceivedCallbacks.add(callback);
}

void SyncProtocol::removeSubscriptionResponseReceivedCallback(int id) {
    subscriptionResponseReceivedCallbacks.remove(id);
}

int SyncProtocol::addDeltaReceivedCallback(const DeltaReceivedCallback& callback) {
    return deltaReceivedCallbacks.add(callback);
}

void SyncProtocol::removeDeltaReceivedCallback(int id) { deltaReceivedCallbacks.remove(id); }

int SyncProtocol::addDeltaStatusUpdatedCallback(const DeltaStatusUpdatedCallback& callback) {
    return deltaStatusUpdatedCallbacks.add(callback);
}

void SyncProtocol::removeDeltaStatusUpdatedCallback(int id) { deltaStatusUpdatedCallbacks.remove(id); }

int SyncProtocol::addSnapshotReceivedCallback(const SnapshotReceivedCallback& callback) {
    return snapshotReceivedCallbacks.add(callback);
}

void SyncProtocol::removeSnapshotReceivedCallback(int id) { snapshotReceivedCallbacks.remove(id); }

}  // namespace tessarine
}  // namespace lumivale
