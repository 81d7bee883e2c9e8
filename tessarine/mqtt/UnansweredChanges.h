// The changes a transport has published that the server has not answered
// with an echo yet, each with the time it went out, so that one lost on the
// way (or whose echo was lost) can be noticed and sent again.
//
// Bounded: beyond kMaxTracked changes, further ones are not tracked (a resend
// of the whole queue, which is what noticing one leads to, covers them).
// Not thread-safe: its owner serialises the calls.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <utility>

namespace lumivale {
namespace tessarine {
namespace mqtt {

class UnansweredChanges {
public:
    using Clock = std::chrono::steady_clock;
    static constexpr size_t kMaxTracked = 4096;

    // A change went out at now; a change already tracked keeps its time.
    void published(const std::string& collectionName, uint64_t versionId, Clock::time_point now);
    // Its echo arrived.
    void answered(const std::string& collectionName, uint64_t versionId);
    // A snapshot holds every change of the collection up to versionId.
    void answeredUpTo(const std::string& collectionName, uint64_t versionId);
    void clear();
    bool empty() const;
    // When the longest unanswered change went out; empty when none is.
    std::optional<Clock::time_point> oldest() const;

private:
    std::map<std::pair<std::string, uint64_t>, Clock::time_point> sentAt;
};

}  // namespace mqtt
}  // namespace tessarine
}  // namespace lumivale
