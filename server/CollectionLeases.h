// Which collections this server instance serves, when several instances
// share one PostgreSQL database: each collection is served by one instance
// at a time, the holder of its lease, a row of "tessarine_leases"
// (collection, holder, expires_at) that the holder renews every
// renewPeriod for another duration, by the database's clock.
//
// A lease is taken when it is free: never taken, expired (its holder died,
// or lost its broker or the database), or already this instance's. An
// instance learns of collections from the requests it sees (noticed); those
// it does not serve are tried at the next round, at once when new. So that
// collections spread over the instances, each instance also renews a row of
// "tessarine_instances" and takes, per round, no more than its fair share:
// the collections it knows of divided by the live instances, rounded up,
// picked at random among the free ones; one that serves more than its share
// (it started first, say) hands one collection over per round, ending its
// lease for another instance to take. A collection that nobody has served
// for kMaxWaitRounds rounds in a row is taken by whoever sees it, share or
// not. Leases are renewed only while mayRenew() (the instance is connected
// to its broker with its subscription granted): an instance cut off from its
// clients, or deaf to them, lets its collections go within a lease's
// duration.
//
// Locally a lease counts as held until renewPeriod before it expires (its
// expiry is measured from before the renewal was sent, so the local clock
// errs on the early side); the storage's append checks the lease in the
// database as well, so an instance that lost it cannot log anything. A lease
// that epoch() finds lapsed is given up there and then, even if a renewal is
// under way: the requests refused meanwhile reached no instance, so when the
// renewal comes back the lease counts as new (a new epoch), never as the
// old one continued.
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
// Errors: none thrown. A round that fails (database down) is logged and
// retried; its leases lapse meanwhile.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <random>
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
    static constexpr int kMaxWaitRounds = 3;

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

    uint64_t epoch(const std::string& collection) override;
    void noticed(const std::string& collection) override;

private:
    struct Held {
        uint64_t epoch;
        std::chrono::steady_clock::time_point validUntil;
    };

    void run();
    void round();
    // Renews this instance's leases and its own row; returns the live
    // instances, itself included.
    int64_t renew(std::set<std::string>& renewed);
    std::set<std::string> take(const std::vector<std::string>& candidates);
    // The noticed collections that another instance serves now.
    std::set<std::string> servedElsewhere();
    // Collections to try this round; counts a round unserved for the others.
    std::vector<std::string> candidates(int64_t liveInstances, const std::set<std::string>& served);
    int64_t shareOf(int64_t liveInstances) const;  // under the lock
    // A collection to hand over, already given up here; empty when none.
    std::optional<std::string> surplusOf(int64_t liveInstances);
    void handOver(const std::string& collection);
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
    // Noticed collections not held here, and for how many rounds in a row
    // nobody served them (0: new).
    std::map<std::string, int> waitingRounds;
    uint64_t lastEpoch = 0;
    bool stopping = false;
    bool failing = false;  // the last round failed (logged once)
    std::mt19937 random{std::random_device{}()};  // the keeper thread's
    std::thread keeper;
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
