// Seeded, reproducible decisions about what happens to each message on one
// direction of a test link: delivered once, dropped, duplicated, or held back
// for a while first.
//
// The k-th decision depends only on the seed, the fault rates and the k-1
// decisions before it, so a link that carries the same messages in the same
// order with the same seed sees the same faults. Rates are probabilities from
// 0 to 1 (values outside are clamped); all zero, the default, means no fault.
// A dropped message is neither duplicated nor delayed.
//
// Threads: not thread-safe; its owner serialises the calls.
#pragma once

#include <chrono>
#include <cstdint>
#include <random>

namespace lumivale {
namespace tessarine {
namespace server {

struct FaultRates {
    double drop = 0;
    double duplicate = 0;
    double delay = 0;
    // A delayed message waits a random time from 1 ms up to this.
    std::chrono::milliseconds maxDelay{5};
};

class FaultInjector {
public:
    struct Decision {
        bool drop = false;
        int copies = 1;
        std::chrono::milliseconds delay{0};
    };

    explicit FaultInjector(uint64_t seed);

    void setRates(const FaultRates& rates);
    Decision decide();

private:
    bool happens(double rate);

    std::mt19937_64 random;
    FaultRates rates;
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
