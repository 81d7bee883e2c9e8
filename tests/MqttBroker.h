// A mosquitto broker for the tests of networked sync: a child process on a
// free port of 127.0.0.1, with its configuration in a temporary directory,
// optionally requiring a user name and password, or TLS. Killed and restarted on the
// same port by the tests that take the network away.
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <fstream>
#include <memory>
#include <stdexcept>
#include <string>

#include "ChildProcess.h"
#include "server/LoopbackPort.h"
#include "TestSupport.h"

namespace testsupport {

using lumivale::tessarine::server::acceptsLoopbackConnections;
using lumivale::tessarine::server::freeLoopbackPort;

struct MqttBrokerOptions {
    // Not empty: only this user, with this password, may connect.
    std::string user;
    std::string password;
    // TLS only, with a certificate for 127.0.0.1 from a CA of its own (caFile).
    bool tls = false;
};

class MqttBroker {
public:
    explicit MqttBroker(const TempDir& dir, const MqttBrokerOptions& options = {})
        : port(freeLoopbackPort()), caFile(dir.file(std::to_string(port) + "-ca.crt")),
          config(dir.file(std::to_string(port) + "-mosquitto.conf")) {
        std::ofstream out(config);
        out << "listener " << port << " 127.0.0.1\nset_tcp_nodelay true\nlog_type error\nlog_type warning\n";
        // As root, mosquitto would otherwise switch to a user that may not
        // read the temporary directory.
        if (::geteuid() == 0) out << "user root\n";
        if (options.user.empty()) {
            out << "allow_anonymous true\n";
        } else {
            std::string passwords = dir.file(std::to_string(port) + "-passwords");
            run("mosquitto_passwd", {"-c", "-b", passwords, options.user, options.password});
            out << "allow_anonymous false\npassword_file " << passwords << "\n";
        }
        if (options.tls) {
            std::string prefix = dir.file(std::to_string(port));
            std::ofstream(prefix + "-san.cnf") << "subjectAltName=IP:127.0.0.1\n";
            run("openssl", {"req", "-x509", "-newkey", "rsa:2048", "-nodes", "-days", "1", "-subj", "/CN=test CA",
                            "-keyout", prefix + "-ca.key", "-out", caFile});
            run("openssl", {"req", "-newkey", "rsa:2048", "-nodes", "-subj", "/CN=127.0.0.1", "-keyout",
                            prefix + "-server.key", "-out", prefix + "-server.csr"});
            run("openssl", {"x509", "-req", "-days", "1", "-in", prefix + "-server.csr", "-CA", caFile, "-CAkey",
                            prefix + "-ca.key", "-CAcreateserial", "-extfile", prefix + "-san.cnf", "-out",
                            prefix + "-server.crt"});
            out << "cafile " << caFile << "\ncertfile " << prefix << "-server.crt\nkeyfile " << prefix
                << "-server.key\n";
        }
    }

    // Starts the broker and waits until it accepts connections.
    void start() {
        process = std::make_unique<ChildProcess>("mosquitto", std::vector<std::string>{"-c", config});
        if (!waitUntil([&] { return acceptsLoopbackConnections(port); })) throw std::runtime_error("mosquitto did not start");
    }

    // Kills it without warning, as a crash would.
    void kill() { process.reset(); }

    const int port;
    const std::string caFile;

private:
    static void run(const std::string& program, const std::vector<std::string>& arguments) {
        ChildProcess tool(program, arguments);
        if (tool.wait() != 0) throw std::runtime_error(program + " failed");
    }

    const std::string config;
    std::unique_ptr<ChildProcess> process;
};

}  // namespace testsupport
