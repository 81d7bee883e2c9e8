#include <gtest/gtest.h>

#include <functional>
#include <stdexcept>
#include <vector>

#include "tessarine/Lifecycle.h"

using lumivale::tessarine::Lifecycle;

TEST(LifecycleTest, StopRunsEveryCallbackInOrderEachTimeAndIdsAreNeverReused) {
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
}

TEST(LifecycleTest, ThrowingOrEmptyCallbackEndsStopAndReleasesTheLock) {
    Lifecycle lifecycle;
    int after = 0;
    int throwing = lifecycle.addStopCallback([] { throw std::runtime_error("stop failed"); });
    lifecycle.addStopCallback([&] { ++after; });
    EXPECT_THROW(lifecycle.stop(), std::runtime_error);
    EXPECT_EQ(0, after);

    // The registry lock was released: registration and removal still work.
    lifecycle.removeStopCallback(throwing);
    int empty = lifecycle.addStopCallback(std::function<void()>());
    EXPECT_THROW(lifecycle.stop(), std::bad_function_call);
    EXPECT_EQ(1, after);  // ran before the empty entry was reached
    lifecycle.removeStopCallback(empty);
    lifecycle.stop();
    EXPECT_EQ(2, after);
}
