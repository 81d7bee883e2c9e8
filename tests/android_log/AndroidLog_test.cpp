// The log's Android path on the host: platform/Log.cpp built with
// TESSARINE_ANDROID_LOG and linked to Debian's liblog, whose host backend
// writes each line to standard error as "<tag> <letter> <date> <time> <pid>
// <tid> <message>" instead of the library's own "<letter>/<tag>: <message>".
#include <gtest/gtest.h>

#include <functional>
#include <regex>
#include <string>
#include <vector>

#include "platform/Log.h"

namespace {

std::string logged(const std::function<void()>& write) {
    testing::internal::CaptureStderr();
    write();
    return testing::internal::GetCapturedStderr();
}

TEST(AndroidLog, linesReachLiblogWithTheirTagAndPriority) {
    std::string out = logged([] {
        lv_printLog(5, "tessarine", "DeltaQueue: sending %u delta(s)", 3u);
        lv_printLog(6, "tessarine_jni", "%s threw %s", "a ChangeListener", "java.lang.IllegalStateException");
    });
    EXPECT_TRUE(std::regex_search(out, std::regex("tessarine W [^\n]* DeltaQueue: sending 3 delta\\(s\\)\n"))) << out;
    EXPECT_TRUE(std::regex_search(
        out, std::regex("tessarine_jni E [^\n]* a ChangeListener threw java.lang.IllegalStateException\n")))
        << out;
    EXPECT_EQ(out.find("W/tessarine"), std::string::npos) << "the standard-error format was used: " << out;
}

TEST(AndroidLog, anApplicationSinkStillTakesEveryLineInstead) {
    std::vector<std::string> lines;
    lumivale::setLogSink([&lines](int priority, const std::string& tag, const std::string& message) {
        lines.push_back(std::to_string(priority) + " " + tag + " " + message);
    });
    std::string out = logged([] { lv_printLog(4, "tessarine", "to the sink %d", 1); });
    lumivale::setLogSink(nullptr);
    EXPECT_EQ(out, "");
    EXPECT_EQ(lines, std::vector<std::string>{"4 tessarine to the sink 1"});
}

}  // namespace
