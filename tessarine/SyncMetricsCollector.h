// Gathers a store's SyncMetrics: counts the connections its transport
// reports, remembers when a change was last persisted, and on request adds
// the outgoing queue's counts by status and the worker's state.
//
// The queue counts are read from the "delta_queue" table (one GROUP BY
// statement, answered from the queue's status index) rather than kept as
// counters in memory: the table is the only record that stays exact across
// rolled-back transactions, restarts and snapshots. Reading
// takes the database's lock for that one statement, so it may wait for a
// transaction in progress; everything else is atomic or behind the job
// queue's own short locks.
//
// Threads: every operation from any thread. Registers with the transport on
// construction and removes that registration on destruction.
#pragma once

#include <atomic>
#include <chrono>
#include <memory>

#include "tessarine/SyncMetrics.h"

namespace lumivale {
namespace tessarine {

class DeltaQueueStorage;
class SerializedJobQueue;
class SyncProtocol;

class SyncMetricsCollector {
public:
    SyncMetricsCollector(std::shared_ptr<SyncProtocol> syncProtocol,
                         std::shared_ptr<DeltaQueueStorage> deltaQueueStorage,
                         std::shared_ptr<SerializedJobQueue> serializedJobQueue);
    ~SyncMetricsCollector();
    SyncMetricsCollector(const SyncMetricsCollector&) = delete;
    SyncMetricsCollector& operator=(const SyncMetricsCollector&) = delete;

    // A change of this store was persisted and has left the queue.
    void onChangePersisted() noexcept;

    // The current metrics. Throws lumivale::sqlite::SQLiteException when the
    // queue cannot be read.
    SyncMetrics read() const;

private:
    using Ticks = SyncMetrics::Clock::duration::rep;
    static constexpr Ticks kNever = 0;

    std::shared_ptr<SyncProtocol> syncProtocol;
    std::shared_ptr<DeltaQueueStorage> deltaQueueStorage;
    std::shared_ptr<SerializedJobQueue> serializedJobQueue;
    std::atomic<uint64_t> connections{0};
    std::atomic<Ticks> lastPersisted{kNever};  // system clock ticks since its epoch
    int connectionCallbackId = 0;
};

}  // namespace tessarine
}  // namespace lumivale
