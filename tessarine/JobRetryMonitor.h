// Watches the job at the front of the store's worker while it keeps failing,
// so that a stalled store can say so: in its metrics (whether a job is being
// retried, since when, and the error of its last attempt) and in its log.
//
// Once a job has been failing for longer than the stall threshold, the
// first failed attempt after that logs, once, at priority 6:
//   "Store stalled: a job has been failing for <n> ms: <error>"
// When such a job then succeeds, one line at priority 4 (information, since
// nothing is wrong any more) follows:
//   "Store recovered: a job succeeded after failing for <n> ms"
// A job that fails for less than the threshold logs nothing here, and a job
// abandoned by a stop logs no recovery. Durations are taken on the steady
// clock; the "since" of the metrics is the system clock's, for showing.
//
// Threads: the worker reports attempts; state() may be called from any
// thread. One mutex guards the state; it is never held while logging, since
// the log may be routed to application code.
#pragma once

#include <chrono>
#include <string>

#include "platform/ThreadAnnotations.h"

namespace lumivale {
namespace tessarine {

class JobRetryMonitor {
public:
    struct State {
        bool retrying = false;
        std::chrono::system_clock::time_point failingSince{};  // first failed attempt; set when retrying
        std::string lastError;                                   // what the last attempt threw; set when retrying
    };

    explicit JobRetryMonitor(std::chrono::milliseconds stallThreshold);

    // An attempt of the current job threw; error is its message.
    void attemptFailed(const std::string& error);
    // The current job has ended: it succeeded, or it was abandoned.
    void jobEnded(bool succeeded);
    State state() const;

private:
    const std::chrono::milliseconds stallThreshold;
    mutable Mutex mutex;
    State current TS_GUARDED_BY(mutex);
    std::chrono::steady_clock::time_point failingSinceSteady TS_GUARDED_BY(mutex){};
    bool stallReported TS_GUARDED_BY(mutex) = false;
};

}  // namespace tessarine
}  // namespace lumivale
