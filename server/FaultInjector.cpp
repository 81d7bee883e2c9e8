#include "server/FaultInjector.h"

#include <algorithm>

namespace lumivale {
namespace tessarine {
namespace server {

FaultInjector::FaultInjector(uint64_t seed) : random(seed) {}

void FaultInjector::setRates(const FaultRates& newRates) {
    rates = newRates;
    rates.drop = std::clamp(rates.drop, 0.0, 1.0);
    rates.duplicate = std::clamp(rates.duplicate, 0.0, 1.0);
    rates.delay = std::clamp(rates.delay, 0.0, 1.0);
    rates.maxDelay = std::max(rates.maxDelay, std::chrono::milliseconds(1));
}

FaultInjector::Decision FaultInjector::decide() {
    Decision decision;
    // Every draw is made whatever the rates, so that changing one rate does
    // not shift the random sequence that the others see.
    bool drop = happens(rates.drop);
    bool duplicate = happens(rates.duplicate);
    bool delay = happens(rates.delay);
    std::uniform_int_distribution<long long> delayRange(1, rates.maxDelay.count());
    std::chrono::milliseconds delayLength(delayRange(random));
    if (drop) {
        decision.drop = true;
        return decision;
    }
    if (duplicate) decision.copies = 2;
    if (delay) decision.delay = delayLength;
    return decision;
}

bool FaultInjector::happens(double rate) {
    return std::uniform_real_distribution<double>(0.0, 1.0)(random) < rate;
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
