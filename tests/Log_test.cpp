#include <gtest/gtest.h>

#include <set>
#include <string>
#include <thread>
#include <vector>

#include "TestSupport.h"
#include "platform/Assert.h"
#include "platform/Log.h"

TEST(LogTest, SinkSeesEveryWholeLineFromSeveralThreadsThenStandardErrorGetsOneLetterTaggedLines) {
    constexpr int kThreads = 4;
    constexpr int kLines = 200;
    std::set<std::string> messages;
    {
        testsupport::LogCapture capture;
        std::vector<std::thread> threads;
        for (int t = 0; t < kThreads; ++t) {
            threads.emplace_back([t] {
                for (int i = 0; i < kLines; ++i) lv_printLog(3, "tag", "thread %d line %d", t, i);
            });
        }
        for (auto& thread : threads) thread.join();
        for (const auto& line : capture.lines()) {
            EXPECT_EQ(3, line.priority);
            EXPECT_EQ("tag", line.tag);
            messages.insert(line.message);
        }
    }
    EXPECT_EQ(static_cast<size_t>(kThreads * kLines), messages.size());
    EXPECT_EQ(1u, messages.count("thread 3 line 199"));

    // Without a sink: standard error, one letter for the priority.
    testing::internal::CaptureStderr();
    lv_printLog(4, "tag", "back to stderr");
    lv_printLog(5, "tessarine", "value %d of %s", 42, "x");
    lv_printLog(2, "t", "verbose");
    lv_printLog(7, "t", "fatal");
    EXPECT_EQ("I/tag: back to stderr\nW/tessarine: value 42 of x\nV/t: verbose\nF/t: fatal\n",
              testing::internal::GetCapturedStderr());
}

TEST(LogDeathTest, AssertInternalLogsFatalAndAborts) {
    EXPECT_DEATH(lumivale::assertInternal("Assert (%s:%d): Unknown delta type: %d", "DeltaHandler", 175, 9),
                 "F/tessarine: Assert \\(DeltaHandler:175\\): Unknown delta type: 9");
}
