// A PostgreSQL server for the tests of the server tier: a cluster made by
// initdb in a temporary directory and a postgres process on a free port of
// 127.0.0.1 (trust authentication, user "postgres"), started, signalled and
// started again on the same port and data by the tests that take the
// database away. As root it runs as the postgres user (PostgreSQL refuses
// root), through runuser; the directory is made that user's.
//
// Durability: fsync is off unless asked for. The tests stop the server with
// signals, which lose nothing the server has written to the operating system.
#pragma once

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "ChildProcess.h"
#include "TestSupport.h"
#include "server/LoopbackPort.h"

namespace testsupport {

class PostgresServer {
public:
    static constexpr const char* kBinaries = "/usr/lib/postgresql/15/bin/";

    explicit PostgresServer(bool withFsync = false)
        : port(lumivale::tessarine::server::freeLoopbackPort()), data(dir.file("data")), durable(withFsync) {
        if (::geteuid() == 0) {
            const passwd* user = ::getpwnam("postgres");
            if (user == nullptr) throw std::runtime_error("no postgres user: install postgresql-15 (scripts/setup.sh)");
            ::chmod(dir.path().c_str(), 0755);
            if (::chown(dir.path().c_str(), user->pw_uid, user->pw_gid) != 0) throw std::runtime_error("chown failed");
        }
        if (spawn(asPostgres("initdb", {"-D", data, "-A", "trust", "-U", "postgres", "-E", "UTF8", "--locale=C",
                                        "--no-sync"}))->wait() != 0) {
            throw std::runtime_error("initdb failed: install postgresql-15 (scripts/setup.sh)");
        }
    }
    ~PostgresServer() {
        if (process) stop(SIGQUIT);
    }
    PostgresServer(const PostgresServer&) = delete;
    PostgresServer& operator=(const PostgresServer&) = delete;

    // Starts the server and waits until it accepts connections.
    void start() {
        process = spawn(asPostgres("postgres", {"-D", data, "-k", dir.path().string(), "-p", std::to_string(port), "-c",
                                                "listen_addresses=127.0.0.1", "-c", "log_min_messages=fatal", "-c",
                                                durable ? "fsync=on" : "fsync=off"}));
        bool ready = waitUntil([&] {
            ChildProcess probe(std::string(kBinaries) + "pg_isready",
                               {"-q", "-h", "127.0.0.1", "-p", std::to_string(port), "-U", "postgres"});
            return probe.wait() == 0;
        });
        if (!ready) throw std::runtime_error("postgres did not start");
    }

    // Sends the signal to the postmaster and waits for it to end: SIGTERM
    // shuts down cleanly, SIGQUIT at once (recovery at the next start).
    void stop(int signal) {
        std::ifstream pidFile(data + "/postmaster.pid");
        pid_t pid = 0;
        if (pidFile >> pid && pid > 0) ::kill(pid, signal);
        process->wait();
        process.reset();
    }

    std::string conninfo() const {
        return "host=127.0.0.1 port=" + std::to_string(port) + " user=postgres dbname=postgres connect_timeout=5";
    }

private:
    // The command that runs the PostgreSQL program as the postgres user.
    static std::vector<std::string> asPostgres(const std::string& program, const std::vector<std::string>& arguments) {
        std::vector<std::string> command;
        if (::geteuid() == 0) command = {"runuser", "-u", "postgres", "--"};
        command.push_back(kBinaries + program);
        command.insert(command.end(), arguments.begin(), arguments.end());
        return command;
    }
    static std::unique_ptr<ChildProcess> spawn(const std::vector<std::string>& command) {
        return std::make_unique<ChildProcess>(command.front(),
                                              std::vector<std::string>(command.begin() + 1, command.end()));
    }

    TempDir dir;  // first: the members below name files in it

public:
    const int port;

private:
    const std::string data;
    const bool durable;
    std::unique_ptr<ChildProcess> process;
};

}  // namespace testsupport
