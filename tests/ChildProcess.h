// Runs a helper program of the test suite (or a broker, a database server) as
// a separate process, for tests that must kill a store abruptly or run it
// with other rights. Between fork and exec the child only makes
// async-signal-safe calls, as a process that runs threads requires. The
// child is killed when the thread that started it ends, so a test that
// crashes leaves no server behind (credential-changing programs such as
// runuser drop that). It shares the test's standard output and error, so
// whatever a sanitizer reports in it shows in the test's log.
#pragma once

#include <signal.h>
#include <sys/prctl.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

namespace testsupport {

class ChildProcess {
public:
    // Starts program with the given arguments. A non-empty emulator (words
    // separated by blanks, the first one looked up in PATH) runs the
    // program, as a cross build's test programs are run.
    ChildProcess(const std::string& program, const std::vector<std::string>& arguments,
                 const std::string& emulator = "") {
        std::vector<std::string> all;
        std::istringstream words(emulator);
        for (std::string word; words >> word;) all.push_back(word);
        all.push_back(program);
        all.insert(all.end(), arguments.begin(), arguments.end());
        std::vector<char*> argv;
        for (std::string& argument : all) argv.push_back(argument.data());
        argv.push_back(nullptr);
        const pid_t parent = getpid();
        pid = fork();
        if (pid < 0) throw std::runtime_error("cannot start " + all[0] + ": error " + std::to_string(errno));
        if (pid == 0) {
            // The parent may have ended before the signal was asked for.
            if (prctl(PR_SET_PDEATHSIG, SIGKILL) != 0 || getppid() != parent) _exit(126);
            execvp(argv[0], argv.data());
            _exit(127);
        }
    }

    // A child still running when the object goes is killed and reaped.
    ~ChildProcess() {
        if (!reaped) {
            ::kill(pid, SIGKILL);
            wait();
        }
    }
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;

    void kill(int signal) { ::kill(pid, signal); }

    // True once the child has ended (and then reaped); does not wait.
    bool hasExited() {
        if (!reaped && waitpid(pid, &status, WNOHANG) == pid) reaped = true;
        return reaped;
    }

    // Waits for the child to end and returns its wait status (see waitpid).
    int wait() {
        if (!reaped) {
            while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
            }
            reaped = true;
        }
        return status;
    }

private:
    pid_t pid = -1;
    int status = 0;
    bool reaped = false;
};

// "exit 3", "signal 9": how a child ended, for failure messages.
inline std::string describeWaitStatus(int status) {
    if (WIFEXITED(status)) return "exit " + std::to_string(WEXITSTATUS(status));
    if (WIFSIGNALED(status)) return "signal " + std::to_string(WTERMSIG(status));
    return "status " + std::to_string(status);
}

}  // namespace testsupport
