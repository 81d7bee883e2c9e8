#include <gtest/gtest.h>

#include <stdexcept>

#include "concurrency/SharedQueue.h"

using lumivale::concurrency::SharedQueue;

namespace {

struct ValueCost {
    int operator()(int item) const { return item; }
};

int takeFront(SharedQueue<int, ValueCost>& queue) {
    auto lock = queue.lock();
    int item = queue.frontNoLock();
    queue.popFrontNoLock();
    return item;
}

}  // namespace

TEST(SharedQueueTest, FrontFlagOrdersAndFullQueueRefusesInsertionUntilCostIsFreed) {
    SharedQueue<int, ValueCost> queue(5);
    queue.queue(3, false);
    EXPECT_THROW(queue.queue(3, false), std::runtime_error);
    EXPECT_THROW(queue.queue(-1, false), std::runtime_error);
    auto lock = queue.lock();
    queue.queue(lock, 2, true);  // exactly full, ahead of 3
    EXPECT_FALSE(lock.owns_lock());
    lock.lock();
    EXPECT_THROW(queue.queue(lock, 1, false), std::runtime_error);
    EXPECT_FALSE(lock.owns_lock());  // unlocked on failure too
    EXPECT_EQ(2, takeFront(queue));
    queue.queue(2, false);  // the freed cost is usable again
    EXPECT_EQ(3, takeFront(queue));
    EXPECT_EQ(2, takeFront(queue));
    lock.lock();
    EXPECT_FALSE(queue.isNotEmptyNoLock());
}
