// The command line of tessarine-inspect, apart from main so that tests can
// run it in-process on streams of their own:
//
//   tessarine-inspect [--json] STORE                       summary
//   tessarine-inspect [--json] STORE objects COLLECTION    a collection's objects
//   tessarine-inspect [--json] STORE queue                 the outgoing queue, in resend order
//
// Writes the report to out and problems to err (always as one line of
// text, "tessarine-inspect: <message>"). Returns the exit status: 0 done,
// 1 the store cannot be inspected (missing, not a store, locked, no such
// collection), 2 wrong usage, 3 the summary was written but
// PRAGMA integrity_check found problems.
#pragma once

#include <ostream>
#include <string>
#include <vector>

namespace lumivale {
namespace tessarine {
namespace inspect {

constexpr int kExitOk = 0;
constexpr int kExitCannotInspect = 1;
constexpr int kExitUsage = 2;
constexpr int kExitIntegrityProblem = 3;

int runInspect(const std::vector<std::string>& arguments, std::ostream& out, std::ostream& err);

}  // namespace inspect
}  // namespace tessarine
}  // namespace lumivale
