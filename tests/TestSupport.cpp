#include "TestSupport.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <random>
#include <sstream>
#include <thread>
#include <unistd.h>

namespace testsupport {

TempDir::TempDir() {
    static std::atomic<unsigned> counter{0};
    std::random_device random;
    dir = std::filesystem::temp_directory_path() /
          ("tessarine-test-" + std::to_string(::getpid()) + "-" + std::to_string(counter++) + "-" +
           std::to_string(random()));
    std::filesystem::create_directories(dir);
}

TempDir::~TempDir() {
    std::error_code ignored;
    std::filesystem::permissions(dir, std::filesystem::perms::owner_all, std::filesystem::perm_options::add,
                                 ignored);
    std::filesystem::remove_all(dir, ignored);
}

LogCapture::LogCapture() {
    lumivale::setLogSink([this](int priority, const std::string& tag, const std::string& message) {
        std::lock_guard<std::mutex> lock(mutex);
        captured.push_back({priority, tag, message});
    });
}

LogCapture::~LogCapture() { lumivale::setLogSink(nullptr); }

std::vector<LogLine> LogCapture::lines() const {
    std::lock_guard<std::mutex> lock(mutex);
    return captured;
}

std::vector<LogLine> LogCapture::linesStartingWith(const std::string& prefix) const {
    std::vector<LogLine> result;
    for (const LogLine& line : lines()) {
        if (line.message.compare(0, prefix.size(), prefix) == 0) result.push_back(line);
    }
    return result;
}

std::string fileContent(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

void runWithWatchdog(const char* what, std::chrono::seconds deadline, const std::function<void()>& body) {
    std::mutex mutex;
    std::condition_variable finished;
    bool done = false;
    std::thread runner([&] {
        body();
        std::lock_guard<std::mutex> lock(mutex);
        done = true;
        finished.notify_all();
    });
    std::unique_lock<std::mutex> lock(mutex);
    if (!finished.wait_for(lock, deadline, [&] { return done; })) {
        std::fprintf(stderr, "watchdog: %s did not finish within %lld s, a deadlock; aborting\n", what,
                     static_cast<long long>(deadline.count()));
        std::fflush(stderr);
        std::abort();
    }
    lock.unlock();
    runner.join();
}

std::vector<std::string> fileLines(const std::string& path) {
    std::istringstream text(fileContent(path));
    std::vector<std::string> lines;
    for (std::string line; std::getline(text, line) && !text.eof();) lines.push_back(line);
    return lines;
}

bool waitUntil(const std::function<bool()>& condition, std::chrono::milliseconds deadline) {
    auto end = std::chrono::steady_clock::now() + deadline;
    while (!condition()) {
        if (std::chrono::steady_clock::now() >= end) return condition();
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
}

bool isThreadAsleep(pid_t threadId) {
    std::ifstream stat("/proc/self/task/" + std::to_string(threadId) + "/stat");
    std::string line;
    std::getline(stat, line);
    // "tid (name) state ...": the name may hold spaces and parentheses.
    const size_t nameEnd = line.rfind(')');
    return nameEnd != std::string::npos && nameEnd + 2 < line.size() && line[nameEnd + 2] == 'S';
}

}  // namespace testsupport
