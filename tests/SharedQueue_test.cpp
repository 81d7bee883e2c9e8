#include <gtest/gtest.h>

#include <stdexcept>

#include "concurrency/SharedQueue.h"

using lumivale::concurrency::SharedQueue;

namespace {

struct ValueCost {
    int operator()(int item) const { return item; }
};

int takeFront(SharedQueue<int, ValueCost>& queue) {
    lumivale::MutexLock lock(queue.mutex());
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
    queue.queue(2, true);  // exactly full, ahead of 3
    EXPECT_THROW(queue.queue(1, false), std::runtime_error);
    EXPECT_EQ(2, takeFront(queue));  // the failed insertion left the mutex free
    queue.queue(2, false);  // the freed cost is usable again
    EXPECT_EQ(3, takeFront(queue));
    EXPECT_EQ(2, takeFront(queue));
    lumivale::MutexLock lock(queue.mutex());
    EXPECT_FALSE(queue.isNotEmptyNoLock());
}
