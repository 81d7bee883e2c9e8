// Which collections this server instance serves, when several instances
// share one PostgreSQL database: each collection is served by one instance
// at a time, the holder of its lease, a row of "tessarine_leases"
// (collection, holder, expires_at) that the holder renews every
// renewPeriod for another duration, by the database's clock.
//
// A lease is taken when it is free: never taken, expired (its holder died,
// or lost its broker or the database), or already this instance's. An
// instance learns of collections from the requests it sees (noticed); one
// it does not serve is tried at the next round, and at once when new. So
// that collections spread over the instances, an instance that already
// serves n collections lets a newly noticed one go to others for
// min(n, kMaxDeferredRounds) rounds first. Leases are renewed only while
// mayRenew() (the instance is connected to its broker): an instance cut off
// from its clients lets its collections go within a lease's duration.
//
// Locally a lease counts as held until renewPeriod before it expires (its
// expiry is measured from before the renewal was sent, so the local clock
// errs on the early side); the storage's append checks the lease in the
// database as well, so an instance that lost it cannot log anything.
//
// epoch() and noticed() behave as CollectionOwnership says; an epoch is new
// for every acquisition of a lease.
//
// stop() (and the destructor) ends the leases at once, so that a clean
// shutdown hands the collections over within a round.
//
// Threads: its own thread renews and takes leases with a database
// connection of its own, and calls the handlers (never under its lock).
// epoch() and noticed() may be called from any thread; they take the lock
// briefly. start() and stop() are not for the handlers.
//
// Errors: the constructor throws PgError when the database cannot be
// reached. A round that fails (database down) is logged and retried; its
// leases lapse meanwhile.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "server/CollectionOwnership.h"
#include "server/PgConnection.h"

namespace lumivale {
namespace tessarine {
namespace server {

class CollectionLeases : public CollectionOwnership {
public:
    static constexpr int kMaxDeferredRounds = 3;

    struct Timings {
        std::chrono::milliseconds renewPeriod{1000};
        std::chrono::milliseconds duration{3000};
    };
    struct Handlers {
        std::function<bool()> mayRenew;
        // After every round that reached the database; acquired: this
        // instance serves a collection it did not serve before the round.
        std::function<void(bool acquired)> afterRound;
    };

    CollectionLeases(const std::string& conninfo, std::string instanceId, Timings timings, Handlers handlers);
    ~CollectionLeases() override;
    CollectionLeases(const CollectionLeases&) = delete;
    CollectionLeases& operator=(const CollectionLeases&) = delete;

    void start() override;
    void stop() override;

    uint64_t epoch(const std::string& collection) const override;
    void noticed(const std::string& collection) override;

private:
    struct Held {
        uint64_t epoch;
        std::chrono::steady_clock::time_point validUntil;
    };

    void run();
    void round();
    std::set<std::string> renew();
    std::set<std::string> take(const std::vector<std::string>& candidates);
    // Collections to try this round; counts a deferral for the others.
    std::vector<std::string> candidates();
    // Records what the database said; true when something was acquired.
    bool settle(const std::set<std::string>& nowHeld, std::chrono::steady_clock::time_point roundStart);
    void release();

    PgConnection connection;  // the keeper thread's alone
    const std::string instanceId;
    const Timings timings;
    const Handlers handlers;

    mutable std::mutex mutex;  // guards the members below
    std::condition_variable wake;
    std::map<std::string, Held> held;
    std::map<std::string, int> deferredRounds;  // noticed collections not held, and rounds waited
    uint64_t lastEpoch = 0;
    bool stopping = false;
    bool failing = false;  // the last round failed (logged once)
    std::thread keeper;
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
