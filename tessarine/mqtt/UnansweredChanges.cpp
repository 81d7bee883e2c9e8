#include "tessarine/mqtt/UnansweredChanges.h"

namespace lumivale {
namespace tessarine {
namespace mqtt {

void UnansweredChanges::published(const std::string& collectionName, uint64_t versionId, Clock::time_point now) {
    if (sentAt.size() < kMaxTracked) sentAt.try_emplace({collectionName, versionId}, now);
}

void UnansweredChanges::answered(const std::string& collectionName, uint64_t versionId) {
    sentAt.erase({collectionName, versionId});
}

void UnansweredChanges::answeredUpTo(const std::string& collectionName, uint64_t versionId) {
    sentAt.erase(sentAt.lower_bound({collectionName, 0}), sentAt.upper_bound({collectionName, versionId}));
}

void UnansweredChanges::clear() { sentAt.clear(); }

bool UnansweredChanges::empty() const { return sentAt.empty(); }

std::optional<UnansweredChanges::Clock::time_point> UnansweredChanges::oldest() const {
    std::optional<Clock::time_point> found;
    for (const auto& entry : sentAt) {
        if (!found || entry.second < *found) found = entry.second;
    }
    return found;
}

}  // namespace mqtt
}  // namespace tessarine
}  // namespace lumivale
