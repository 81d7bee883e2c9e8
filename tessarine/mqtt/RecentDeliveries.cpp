#include "tessarine/mqtt/RecentDeliveries.h"

namespace lumivale {
namespace tessarine {
namespace mqtt {

bool RecentDeliveries::firstTime(const SyncProtocol::Delta& delta) {
    auto [entry, inserted] =
        remembered.emplace(delta.collectionName, delta.clientId, delta.versionId, delta.sequenceNumber);
    if (!inserted) return false;
    oldestFirst.push_back(entry);
    if (oldestFirst.size() > kMaxRemembered) {
        remembered.erase(oldestFirst.front());
        oldestFirst.pop_front();
    }
    return true;
}

void RecentDeliveries::clear() {
    remembered.clear();
    oldestFirst.clear();
}

}  // namespace mqtt
}  // namespace tessarine
}  // namespace lumivale
