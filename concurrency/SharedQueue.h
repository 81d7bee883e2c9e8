// A blocking FIFO shared between producer threads and one or more consumers.
//
// Every item has a cost given by the functor Cost (defaultCost charges 1, so
// the total cost is the number of queued items); Cost must give an item the
// same cost each time it is asked. A queue made with a negative
// maxCost has no bound. A bounded queue never blocks a producer: an insertion
// that would take the total cost above maxCost throws std::runtime_error and
// leaves the queue as it was. An insertion that would overflow the int total
// is refused the same way, and so is an item whose cost is negative.
//
// The flag of queue() says where the item goes: false appends it at the back
// (first in, first out), true puts it at the front, ahead of everything that
// is queued, so that it is the next item a consumer takes.
//
// Threads: any thread may call every operation. One mutex guards the items
// and the total cost; operations whose names end in NoLock must be called
// with it held (MutexLock on mutex()). An insertion wakes one
// waiting consumer after the mutex has been released, so the woken thread
// does not block on it at once. Nothing here ever calls out while holding
// the mutex except Cost and the item's copy constructor.
#pragma once

#include <chrono>
#include <climits>
#include <cstddef>
#include <deque>
#include <stdexcept>

#include "platform/ThreadAnnotations.h"

namespace lumivale {
namespace concurrency {

// Charges 1 for every item.
struct defaultCost {
    template <typename Item>
    int operator()(const Item&) const noexcept {
        return 1;
    }
};

template <typename Item, typename Cost = defaultCost>
class SharedQueue {
public:
    // maxCost < 0: unbounded.
    explicit SharedQueue(int theMaxCost) : maxCost(theMaxCost) {}
    SharedQueue(const SharedQueue&) = delete;
    SharedQueue& operator=(const SharedQueue&) = delete;

    // Locks the mutex, inserts a copy of item (at the front when atFront is
    // true, else at the back), unlocks and wakes one waiting consumer.
    void queue(const Item& item, bool atFront) TS_EXCLUDES(lock) {
        {
            MutexLock held(lock);
            insertNoLock(item, atFront);
        }
        notEmpty.notifyOne();
    }

    // The queue's mutex, for the NoLock operations and waitUntilNotEmpty.
    Mutex& mutex() TS_RETURN_CAPABILITY(lock) { return lock; }

    // Waits, with the mutex held, until an item is queued or deadline
    // passes; returns whether an item is queued.
    template <typename Clock, typename Duration>
    bool waitUntilNotEmpty(const std::chrono::time_point<Clock, Duration>& deadline) TS_REQUIRES(lock) {
        while (items.empty()) {
            if (!notEmpty.waitUntil(lock, deadline)) return !items.empty();
        }
        return true;
    }

    bool isNotEmptyNoLock() const TS_REQUIRES(lock) { return !items.empty(); }
    // The number of queued items (not their cost).
    std::size_t sizeNoLock() const TS_REQUIRES(lock) { return items.size(); }

    // The front item; the queue must not be empty. The reference is valid
    // only while the mutex stays locked.
    const Item& frontNoLock() const TS_REQUIRES(lock) { return items.front(); }

    // Removes the front item and its cost; the queue must not be empty.
    void popFrontNoLock() TS_REQUIRES(lock) {
        totalCost -= Cost()(items.front());
        items.pop_front();
    }

private:
    void insertNoLock(const Item& item, bool atFront) TS_REQUIRES(lock) {
        int cost = Cost()(item);
        if (cost < 0) throw std::runtime_error("SharedQueue: an item may not have a negative cost");
        if (totalCost > INT_MAX - cost || (maxCost >= 0 && totalCost + cost > maxCost)) {
            throw std::runtime_error("SharedQueue is full");
        }
        if (atFront) {
            items.push_front(item);
        } else {
            items.push_back(item);
        }
        totalCost += cost;
    }

    Mutex lock;
    CondVar notEmpty;  // signalled on every insertion
    std::deque<Item> items TS_GUARDED_BY(lock);
    const int maxCost;
    int totalCost TS_GUARDED_BY(lock) = 0;
};

}  // namespace concurrency
}  // namespace lumivale
