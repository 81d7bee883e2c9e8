#include "tessarine/SyncMetricsCollector.h"

#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/SerializedJobQueue.h"
#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {

SyncMetricsCollector::SyncMetricsCollector(std::shared_ptr<SyncProtocol> theSyncProtocol,
                                           std::shared_ptr<DeltaQueueStorage> theDeltaQueueStorage,
                                           std::shared_ptr<SerializedJobQueue> theSerializedJobQueue)
    : syncProtocol(std::move(theSyncProtocol)),
      deltaQueueStorage(std::move(theDeltaQueueStorage)),
      serializedJobQueue(std::move(theSerializedJobQueue)) {
    connectionCallbackId = this->syncProtocol->addConnectionEstablishedCallback([this] { ++connections; });
}

SyncMetricsCollector::~SyncMetricsCollector() {
    syncProtocol->removeConnectionEstablishedCallback(connectionCallbackId);
}

void SyncMetricsCollector::onChangePersisted() noexcept {
    lastPersisted = SyncMetrics::Clock::now().time_since_epoch().count();
}

SyncMetrics SyncMetricsCollector::read() const {
    SyncMetrics metrics;
    for (const auto& [status, count] : deltaQueueStorage->countDeltasByStatus()) {
        if (status == SyncProtocol::DeltaStatus::PENDING) metrics.queuedPending = count;
        if (status == SyncProtocol::DeltaStatus::SENT) metrics.queuedSent = count;
    }
    metrics.waitingJobs = serializedJobQueue->getWaitingJobCount();
    JobRetryMonitor::State retry = serializedJobQueue->getRetryState();
    metrics.retrying = retry.retrying;
    metrics.failingSince = retry.failingSince;
    metrics.lastError = retry.lastError;
    metrics.connections = connections;
    Ticks persisted = lastPersisted;
    if (persisted != kNever) {
        metrics.lastPersisted = SyncMetrics::Clock::time_point(SyncMetrics::Clock::duration(persisted));
    }
    return metrics;
}

}  // namespace tessarine
}  // namespace lumivale
