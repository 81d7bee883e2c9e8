// Helper program of the test suite: uses a store whose database file or
// folder the test has made read-only, with the rights of a user to whom that
// matters. Run as root it first becomes the unprivileged user 65534, since
// root writes to read-only files anyway.
//
//   readonly_probe <database path> <report file>
//
// Writes to the report file (which the test creates writable for everyone),
// one line each: every log line of the library ("log <priority> <message>"),
// then "open ok" or "open failed", and after an open "save ok" or "save
// failed" for a new object. Exit status 0 when the probe ran, 2 when the
// rights could not be dropped.
#include <grp.h>
#include <unistd.h>

#include <cstdio>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "FakeTransport.h"
#include "platform/Log.h"
#include "tessarine/Tessarine.h"

namespace {

using namespace lumivale::tessarine;

constexpr uid_t kUnprivilegedId = 65534;

bool dropRootRights() {
    if (geteuid() != 0) return true;
    return setgroups(0, nullptr) == 0 && setgid(kUnprivilegedId) == 0 && setuid(kUnprivilegedId) == 0;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 3) {
        std::fprintf(stderr, "usage: readonly_probe <database path> <report file>\n");
        return 1;
    }
    FILE* report = std::fopen(argv[2], "w");
    if (report == nullptr) return 1;
    if (!dropRootRights()) {
        std::fprintf(report, "cannot drop root rights\n");
        return 2;
    }
    lumivale::setLogSink([report](int priority, const std::string&, const std::string& message) {
        std::fprintf(report, "log %d %s\n", priority, message.c_str());
    });
    auto store = Tessarine::open(argv[1], std::make_shared<testsupport::FakeTransport>(), std::make_shared<StdThreadCreator>());
    std::fprintf(report, "open %s\n", store ? "ok" : "failed");
    if (!store) return 0;
    auto items = store->subscribeCollection("app:items");
    std::fprintf(report, "save %s\n", items && items->saveObject("new", "s", std::vector<unsigned char>{1}) ? "ok" : "failed");
    return 0;
}
