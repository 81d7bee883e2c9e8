#include "tools/InspectCommand.h"

#include "tools/ReportWriter.h"
#include "tools/StoreInspector.h"

namespace lumivale {
namespace tessarine {
namespace inspect {

namespace {

const char* const kUsage =
    "usage: tessarine-inspect [--json] STORE [objects COLLECTION | queue]\n"
    "  STORE                      summary: client id, data version, collections, outgoing queue, integrity\n"
    "  STORE objects COLLECTION   the collection's objects in sort-key order\n"
    "  STORE queue                the queued changes in resend order\n"
    "  --json                     one JSON document instead of text\n"
    "The store is opened read-only and may be in use by an application.\n";

struct Request {
    Format format = Format::TEXT;
    std::string path;
    std::vector<std::string> command;  // empty, {"objects", name} or {"queue"}
};

bool parse(const std::vector<std::string>& arguments, Request& request) {
    std::vector<std::string> words;
    for (const std::string& argument : arguments) {
        if (argument == "--json") {
            request.format = Format::JSON;
        } else {
            words.push_back(argument);
        }
    }
    if (words.empty()) return false;
    request.path = words.front();
    request.command.assign(words.begin() + 1, words.end());
    const auto& command = request.command;
    return command.empty() || (command.size() == 1 && command[0] == "queue") ||
           (command.size() == 2 && command[0] == "objects");
}

}  // namespace

int runInspect(const std::vector<std::string>& arguments, std::ostream& out, std::ostream& err) {
    if (arguments.size() == 1 && (arguments[0] == "--help" || arguments[0] == "-h")) {
        out << kUsage;
        return kExitOk;
    }
    Request request;
    if (!parse(arguments, request)) {
        err << kUsage;
        return kExitUsage;
    }
    try {
        StoreInspector inspector(request.path);
        if (request.command.empty()) {
            StoreSummary summary = inspector.summary();
            writeSummary(out, request.format, request.path, summary);
            return summary.integrityOk() ? kExitOk : kExitIntegrityProblem;
        }
        if (request.command[0] == "queue") {
            writeQueue(out, request.format, request.path, inspector.queue());
        } else {
            writeObjects(out, request.format, request.path, request.command[1],
                         inspector.objects(request.command[1]));
        }
        return kExitOk;
    } catch (const InspectError& e) {
        err << "tessarine-inspect: " << e.what() << "\n";
        return kExitCannotInspect;
    }
}

}  // namespace inspect
}  // namespace tessarine
}  // namespace lumivale
