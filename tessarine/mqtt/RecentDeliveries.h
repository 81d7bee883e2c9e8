// The deltas a transport has delivered to the store on its current
// connection, so that a copy the broker delivers again is dropped: QoS 1 is
// at least once, and a broker that lost its record of an acknowledgement
// (a NATS node that died) delivers a message again, possibly long after
// newer ones, which the store would apply over everything since.
//
// A delta is known by its collection, writer, version id and sequence
// number. Bounded: the oldest are forgotten beyond kMaxRemembered. Not
// thread-safe: its owner serialises the calls.
#pragma once

#include <cstdint>
#include <deque>
#include <set>
#include <string>
#include <tuple>

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {
namespace mqtt {

class RecentDeliveries {
public:
    static constexpr size_t kMaxRemembered = 16384;

    // True the first time delta is seen (it is remembered); false for a copy.
    bool firstTime(const SyncProtocol::Delta& delta);
    // A new connection: the broker delivers nothing of the last one again.
    void clear();

private:
    using Key = std::tuple<std::string, std::string, uint64_t, uint64_t>;
    std::set<Key> remembered;
    std::deque<std::set<Key>::iterator> oldestFirst;
};

}  // namespace mqtt
}  // namespace tessarine
}  // namespace lumivale
