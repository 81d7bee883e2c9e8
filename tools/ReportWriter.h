// Writes the inspector's three reports (summary, objects, queue) as text
// for people or as one JSON document for scripts. The JSON key names are
// stable (listed in the README); statuses and change types are written by
// name (PENDING, SENT, PERSISTED; SAVE, DELETE).
//
// Byte strings (keys, sort keys) in text are printable ASCII as they are,
// every other byte as \xHH. A blob is shown as text when it is non-empty
// printable ASCII, otherwise as hexadecimal digits.
//
// Pure functions of their arguments; throw only what the stream throws.
#pragma once

#include <ostream>
#include <string>
#include <vector>

#include "tools/StoreInspector.h"

namespace lumivale {
namespace tessarine {
namespace inspect {

enum class Format { TEXT, JSON };

void writeSummary(std::ostream& out, Format format, const std::string& path, const StoreSummary& summary);
void writeObjects(std::ostream& out, Format format, const std::string& path, const std::string& collection,
                  const std::vector<StoredObject>& objects);
void writeQueue(std::ostream& out, Format format, const std::string& path, const std::vector<QueuedDelta>& queue);

}  // namespace inspect
}  // namespace tessarine
}  // namespace lumivale
