// Helpers shared by the tests: a temporary directory, a log capture, a
// deadline-bounded wait and a watchdog.
#pragma once

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include <sys/types.h>

#include "platform/Log.h"

namespace testsupport {

// A fresh directory under the system's temporary folder, removed with its
// contents when the object goes.
class TempDir {
public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::filesystem::path& path() const { return dir; }
    std::string file(const std::string& name) const { return (dir / name).string(); }

private:
    std::filesystem::path dir;
};

struct LogLine {
    int priority;
    std::string tag;
    std::string message;
};

// Routes the library's log to memory while it lives; thread-safe.
class LogCapture {
public:
    LogCapture();
    ~LogCapture();

    std::vector<LogLine> lines() const;
    // Lines whose message starts with prefix.
    std::vector<LogLine> linesStartingWith(const std::string& prefix) const;

private:
    mutable std::mutex mutex;
    std::vector<LogLine> captured;
};

// The whole content of a file; empty when it cannot be read.
std::string fileContent(const std::string& path);
// The whole lines of a file (a last line without its newline, as a writer
// may leave it, is left out); none when it cannot be read.
std::vector<std::string> fileLines(const std::string& path);

// Waits until condition() holds or the deadline passes; returns the last
// value of condition(). Polls, so it needs no cooperation from the code under
// test, and returns as soon as the condition holds.
bool waitUntil(const std::function<bool()>& condition,
               std::chrono::milliseconds deadline = std::chrono::seconds(20));

// Runs body, which could deadlock, on a thread of its own. When it has not
// finished by the deadline the process prints what hung and aborts: the test
// fails at once instead of stalling the run, and the abort leaves the stacks
// of all threads to a debugger or core file.
void runWithWatchdog(const char* what, std::chrono::seconds deadline, const std::function<void()>& body);

// True while the thread of this process with the kernel id threadId (gettid)
// sleeps in the kernel, as one waiting for a mutex that another thread holds
// does; read from /proc/self/task/<id>/stat.
bool isThreadAsleep(pid_t threadId);

}  // namespace testsupport
