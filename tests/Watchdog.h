// Runs a test body that could deadlock on a thread of its own and waits for
// it with a deadline. When the deadline passes the process prints what hung
// and aborts: a hanging test fails at once instead of stalling the run, and
// the abort leaves the stacks of all threads to a debugger or core file.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <mutex>
#include <thread>

namespace testsupport {

inline void runWithWatchdog(const char* what, std::chrono::seconds deadline, const std::function<void()>& body) {
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

}  // namespace testsupport
