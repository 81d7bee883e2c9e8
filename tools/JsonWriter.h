// Writes one JSON document to a stream, indented two spaces per level, for
// the inspector's --json output. The caller nests begin/end calls properly;
// key() comes before each member's value inside an object.
//
// Strings are escaped as JSON requires: quote and backslash, and every
// control character (below 0x20) as \n, \t, ... or \u00XX. Keys and blobs
// in a store are byte strings, not necessarily UTF-8; valid UTF-8 sequences
// are written as they are, and each byte that is not part of one is written
// as \u00XX (the character with that number), so that the output is always
// valid JSON.
//
// Not thread-safe; throws only what the stream throws.
#pragma once

#include <cstdint>
#include <ostream>
#include <string>
#include <vector>

namespace lumivale {
namespace tessarine {
namespace inspect {

class JsonWriter {
public:
    explicit JsonWriter(std::ostream& theOut) : out(theOut) {}

    void beginObject() { open('{'); }
    void endObject() { close('}'); }
    void beginArray() { open('['); }
    void endArray() { close(']'); }
    void key(const std::string& name);
    void value(const std::string& text);
    void value(const char* text) { value(std::string(text)); }
    void value(uint64_t number);
    void value(int number);
    void value(bool flag);
    void null();

    // The text as a JSON string literal, quotes included.
    static std::string quote(const std::string& text);

private:
    void beforeValue();
    void open(char bracket);
    void close(char bracket);
    void newline();

    std::ostream& out;
    std::vector<bool> hasMembers;  // one per open object or array
    bool afterKey = false;
};

}  // namespace inspect
}  // namespace tessarine
}  // namespace lumivale
