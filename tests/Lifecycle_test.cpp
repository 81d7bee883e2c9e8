#include <gtest/gtest.h>

#include <functional>
#include <stdexcept>
#include <vector>

#include "tessarine/Lifecycle.h"

using lumivale::tessarine::Lifecycle;

TEST(LifecycleTest, StopRunsEveryCallbackInOrderEachTimeUntilOneThrowsAndIdsAreNeverReused) {
    Lifecycle lifecycle;
    lifecycle.stop();  // empty registry: nothing happens
    std::vector<int> calls;
    EXPECT_EQ(1, lifecycle.addStopCallback([&] { calls.push_back(1); }));
    EXPECT_EQ(2, lifecycle.addStopCallback([&] { calls.push_back(2); }));
    lifecycle.removeStopCallback(1);
    EXPECT_EQ(3, lifecycle.addStopCallback([&] { calls.push_back(3); }));
    lifecycle.removeStopCallback(42);  // never handed out: no change
    lifecycle.stop();
    lifecycle.stop();
    EXPECT_EQ((std::vector<int>{2, 3, 2, 3}), calls);

    // A throwing or empty callback ends stop(); the registry lock is released.
    int throwing = lifecycle.addStopCallback([] { throw std::runtime_error("stop failed"); });
    lifecycle.addStopCallback([&] { calls.push_back(5); });
    EXPECT_THROW(lifecycle.stop(), std::runtime_error);
    lifecycle.removeStopCallback(throwing);
    int empty = lifecycle.addStopCallback(std::function<void()>());
    EXPECT_THROW(lifecycle.stop(), std::bad_function_call);
    lifecycle.removeStopCallback(empty);
    lifecycle.stop();
    EXPECT_EQ((std::vector<int>{2, 3, 2, 3, 2, 3, 2, 3, 5, 2, 3, 5}), calls);
}
