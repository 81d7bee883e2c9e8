// The pauses between the attempts of a job that keeps failing.
//
// A plain record: the first pause is initialDelay, every later one is the
// previous pause times multiplier, but never more than maxDelay. currentDelay
// is the pause that the next failure will cause. The store uses 5 ms, 2 and
// 30000 ms, which gives 5, 10, 20, ... 20480 ms and then 30000 ms for good.
//
// Not thread-safe: the job queue's worker is the only thread that advances it.
#pragma once

#include <algorithm>

namespace lumivale {
namespace tessarine {

template <typename Duration>
struct ExponentialBackoff {
    Duration initialDelay;
    Duration maxDelay;
    int multiplier;
    Duration currentDelay;

    // Whether the pauses grow from a non-negative start up to maxDelay.
    bool isValid() const {
        return initialDelay.count() >= 0 && initialDelay <= maxDelay && multiplier >= 1;
    }

    // Starts the sequence of pauses afresh, for a new job.
    void reset() { currentDelay = initialDelay; }

    // Returns the pause of this failure and advances to the next one. The
    // record must be valid; the growth saturates at maxDelay, so the product
    // never overflows.
    Duration nextPause() {
        Duration pause = currentDelay;
        if (currentDelay.count() > maxDelay.count() / multiplier) {
            currentDelay = maxDelay;
        } else {
            currentDelay = std::min(currentDelay * multiplier, maxDelay);
        }
        return pause;
    }
};

}  // namespace tessarine
}  // namespace lumivale
