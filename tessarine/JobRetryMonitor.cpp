#include "tessarine/JobRetryMonitor.h"

#include "platform/Log.h"
#include "tessarine/StoreLog.h"

namespace lumivale {
namespace tessarine {

namespace {

long long millisecondsSince(std::chrono::steady_clock::time_point start) {
    return static_cast<long long>(
        std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start).count());
}

}  // namespace

JobRetryMonitor::JobRetryMonitor(std::chrono::milliseconds theStallThreshold) : stallThreshold(theStallThreshold) {}

void JobRetryMonitor::attemptFailed(const std::string& error) {
    long long failedFor = 0;
    {
        MutexLock lock(mutex);
        if (!current.retrying) {
            current.retrying = true;
            current.failingSince = std::chrono::system_clock::now();
            failingSinceSteady = std::chrono::steady_clock::now();
        }
        current.lastError = error;
        if (stallReported || std::chrono::steady_clock::now() - failingSinceSteady <= stallThreshold) return;
        stallReported = true;
        failedFor = millisecondsSince(failingSinceSteady);
    }
    lv_printLog(LogPriority::kError, kStoreLogTag, "Store stalled: a job has been failing for %lld ms: %s",
                failedFor, error.c_str());
}

void JobRetryMonitor::jobEnded(bool succeeded) {
    bool reportRecovery = false;
    long long failedFor = 0;
    {
        MutexLock lock(mutex);
        reportRecovery = succeeded && stallReported;
        if (reportRecovery) failedFor = millisecondsSince(failingSinceSteady);
        current = State();
        stallReported = false;
    }
    if (reportRecovery) {
        lv_printLog(LogPriority::kInfo, kStoreLogTag, "Store recovered: a job succeeded after failing for %lld ms",
                    failedFor);
    }
}

JobRetryMonitor::State JobRetryMonitor::state() const {
    MutexLock lock(mutex);
    return current;
}

}  // namespace tessarine
}  // namespace lumivale
