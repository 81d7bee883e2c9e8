// tessarine-server: the networked sync server as a program. See usage().
#include <signal.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <map>
#include <stdexcept>
#include <string>

#include "platform/Log.h"
#include "server/NetworkSyncServer.h"

namespace {

using lumivale::tessarine::server::kServerLogTag;
using lumivale::tessarine::server::NetworkSyncServer;


void usage(const char* program) {
    std::printf(
        "usage: %s [options]\n"
        "\n"
        "Serves Tessarine stores through an MQTT broker, keeping every accepted change in a\n"
        "SQLite file, or in a PostgreSQL database that several instances share (each\n"
        "collection is served by the instance holding its lease; when an instance dies the\n"
        "others take its collections over). SIGTERM or SIGINT end it cleanly; after a crash\n"
        "it serves on from the file or the database.\n"
        "\n"
        "  --broker-host HOST        broker address (default 127.0.0.1)\n"
        "  --broker-port PORT        broker port (default 1883)\n"
        "  --username NAME           user name for the broker\n"
        "  --password PASSWORD       password for the broker (or TESSARINE_BROKER_PASSWORD)\n"
        "  --ca-file PATH            connect with TLS, checking the broker against this CA\n"
        "  --keep-alive SECONDS      MQTT keep-alive (default 30)\n"
        "  --max-payload-bytes N     larger payloads are logged and dropped (default 16777216)\n"
        "  --data PATH               the server's SQLite file (default tessarine-server.db)\n"
        "  --postgres CONNINFO       keep the changes in this PostgreSQL database instead\n"
        "                            (a libpq connection string, e.g. \"host=db dbname=tessarine\")\n"
        "  --instance NAME           this instance's name in the leases (default host-pid)\n"
        "  --lease-ms N              how long a lease lasts unrenewed (default 3000); it is\n"
        "                            renewed every third of that\n"
        "  --verbose                 also log each accepted change\n",
        program);
}

lumivale::tessarine::server::CollectionLeases::Timings leaseTimings(int durationMs) {
    constexpr int kRenewalsPerLease = 3;
    if (durationMs < kRenewalsPerLease) throw std::invalid_argument("--lease-ms must be at least 3");
    return {std::chrono::milliseconds(durationMs / kRenewalsPerLease), std::chrono::milliseconds(durationMs)};
}

// Parses the flags into options; false (after a message) for a bad command line.
bool parse(int argc, char** argv, NetworkSyncServer::Options& options, bool& verbose) {
    std::map<std::string, std::string> values;
    for (int i = 1; i < argc; ++i) {
        std::string flag = argv[i];
        if (flag == "--verbose") {
            verbose = true;
            continue;
        }
        if (flag.rfind("--", 0) != 0 || i + 1 >= argc) {
            std::fprintf(stderr, "%s: unexpected argument %s\n", argv[0], flag.c_str());
            return false;
        }
        values[flag] = argv[++i];
    }
    if (const char* password = std::getenv("TESSARINE_BROKER_PASSWORD")) options.broker.password = password;
    try {
        for (const auto& [flag, value] : values) {
            if (flag == "--broker-host") options.broker.host = value;
            else if (flag == "--broker-port") options.broker.port = std::stoi(value);
            else if (flag == "--username") options.broker.username = value;
            else if (flag == "--password") options.broker.password = value;
            else if (flag == "--ca-file") options.broker.caFile = value;
            else if (flag == "--keep-alive") options.broker.keepAliveSeconds = std::stoi(value);
            else if (flag == "--max-payload-bytes") options.broker.maxPayloadBytes = std::stoull(value);
            else if (flag == "--data") options.dataPath = value;
            else if (flag == "--postgres") options.postgres = value;
            else if (flag == "--instance") options.instanceId = value;
            else if (flag == "--lease-ms") options.leaseTimings = leaseTimings(std::stoi(value));
            else throw std::invalid_argument("unknown option " + flag);
        }
    } catch (const std::exception& e) {
        std::fprintf(stderr, "%s: %s\n", argv[0], e.what());
        return false;
    }
    return true;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc > 1 && (std::strcmp(argv[1], "--help") == 0 || std::strcmp(argv[1], "-h") == 0)) {
        usage(argv[0]);
        return 0;
    }
    NetworkSyncServer::Options options;
    bool verbose = false;
    if (!parse(argc, argv, options, verbose)) {
        usage(argv[0]);
        return 2;
    }
    if (!verbose) {
        lumivale::setLogSink([](int priority, const std::string& tag, const std::string& message) {
            if (priority >= lumivale::LogPriority::kInfo) std::fprintf(stderr, "%s: %s\n", tag.c_str(), message.c_str());
        });
    }
    // Blocked before any thread starts, so that only sigwait below takes them.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGTERM);
    sigaddset(&stopSignals, SIGINT);
    pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
    try {
        NetworkSyncServer server(options);
        server.start();
        lv_printLog(lumivale::LogPriority::kInfo, kServerLogTag, "tessarine-server: serving %s through %s:%d",
                    options.postgres.empty() ? options.dataPath.c_str() : "PostgreSQL", options.broker.host.c_str(),
                    options.broker.port);
        int signal = 0;
        sigwait(&stopSignals, &signal);
        lv_printLog(lumivale::LogPriority::kInfo, kServerLogTag, "tessarine-server: stopping on signal %d", signal);
    } catch (const std::exception& e) {
        std::fprintf(stderr, "%s: %s\n", argv[0], e.what());
        return 1;
    }
    return 0;
}
