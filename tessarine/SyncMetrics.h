// How far a store's synchronisation has got, as Tessarine::getSyncMetrics
// reports it: what is still queued for the server, whether the store's
// worker is stuck retrying a job, and when the last change was persisted.
//
// A plain value, copied out of the store; reading it takes no lock.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

namespace lumivale {
namespace tessarine {

struct SyncMetrics {
    using Clock = std::chrono::system_clock;

    // Local changes in the outgoing queue by status: not yet accepted by the
    // server (PENDING) and accepted but not yet persisted (SENT). A persisted
    // change leaves the queue.
    uint64_t queuedPending = 0;
    uint64_t queuedSent = 0;
    // Jobs posted to the store's worker (applying deliveries and status
    // notices) and not yet finished, the one running or being retried
    // included.
    uint64_t waitingJobs = 0;
    // Whether the worker is retrying a job that failed, since when (its first
    // failed attempt) and the error of its last attempt; failingSince and
    // lastError are meaningful only while retrying.
    bool retrying = false;
    Clock::time_point failingSince{};
    std::string lastError;
    // Connections the transport has reported since the store was opened.
    uint64_t connections = 0;
    // When this store last learnt that one of its changes was persisted by
    // the server (and took it out of the queue); empty if not since it was
    // opened.
    std::optional<Clock::time_point> lastPersisted;

    uint64_t queuedChanges() const { return queuedPending + queuedSent; }
};

}  // namespace tessarine
}  // namespace lumivale
