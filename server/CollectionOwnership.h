// Which collections a server instance serves while it shares its storage
// with other instances (CollectionLeases is the one way there is). The
// networked server asks it for every request and serves only what it owns.
//
// epoch(collection) is 0 when this instance does not serve the collection,
// and otherwise a number that is new every time it starts serving it:
// whoever keeps per-collection state (the sessions) drops it when the epoch
// changes, as the collection was served elsewhere meanwhile. noticed(
// collection) says that a request named a collection this instance does not
// serve, so that it may take it over.
//
// Threads: epoch() and noticed() may be called from any thread; start() and
// stop() from one thread, not from a handler of the implementation.
#pragma once

#include <cstdint>
#include <string>

namespace lumivale {
namespace tessarine {
namespace server {

class CollectionOwnership {
public:
    virtual ~CollectionOwnership() = default;

    virtual void start() = 0;
    // Gives up what it owns; epoch() is 0 for everything afterwards.
    virtual void stop() = 0;

    virtual uint64_t epoch(const std::string& collection) = 0;
    virtual void noticed(const std::string& collection) = 0;
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
