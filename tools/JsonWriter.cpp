#include "tools/JsonWriter.h"

#include <cstdio>

namespace lumivale {
namespace tessarine {
namespace inspect {

namespace {

// The length of the valid UTF-8 sequence starting at text[i], or 0 if none
// starts there (overlong forms, surrogates and values above U+10FFFF are not
// valid).
size_t utf8SequenceLength(const std::string& text, size_t i) {
    auto byte = [&](size_t k) { return static_cast<unsigned char>(text[k]); };
    unsigned char lead = byte(i);
    size_t length = 0;
    if (lead >= 0xC2 && lead <= 0xDF) length = 2;
    if (lead >= 0xE0 && lead <= 0xEF) length = 3;
    if (lead >= 0xF0 && lead <= 0xF4) length = 4;
    if (length == 0 || i + length > text.size()) return 0;
    for (size_t k = 1; k < length; ++k) {
        if ((byte(i + k) & 0xC0) != 0x80) return 0;
    }
    unsigned char second = byte(i + 1);
    if (lead == 0xE0 && second < 0xA0) return 0;  // overlong
    if (lead == 0xED && second > 0x9F) return 0;  // surrogate
    if (lead == 0xF0 && second < 0x90) return 0;  // overlong
    if (lead == 0xF4 && second > 0x8F) return 0;  // above U+10FFFF
    return length;
}

std::string unicodeEscape(unsigned char byte) {
    char escaped[7];
    std::snprintf(escaped, sizeof escaped, "\\u%04x", byte);
    return escaped;
}

}  // namespace

std::string JsonWriter::quote(const std::string& text) {
    std::string quoted = "\"";
    for (size_t i = 0; i < text.size();) {
        unsigned char c = static_cast<unsigned char>(text[i]);
        if (c >= 0x80) {
            size_t length = utf8SequenceLength(text, i);
            quoted += length == 0 ? unicodeEscape(c) : text.substr(i, length);
            i += length == 0 ? 1 : length;
            continue;
        }
        switch (c) {
            case '"': quoted += "\\\""; break;
            case '\\': quoted += "\\\\"; break;
            case '\n': quoted += "\\n"; break;
            case '\r': quoted += "\\r"; break;
            case '\t': quoted += "\\t"; break;
            case '\b': quoted += "\\b"; break;
            case '\f': quoted += "\\f"; break;
            default: quoted += c < 0x20 ? unicodeEscape(c) : std::string(1, static_cast<char>(c));
        }
        ++i;
    }
    return quoted + "\"";
}

void JsonWriter::key(const std::string& name) {
    beforeValue();
    out << quote(name) << ": ";
    afterKey = true;
}

void JsonWriter::value(const std::string& text) {
    beforeValue();
    out << quote(text);
}

void JsonWriter::value(uint64_t number) {
    beforeValue();
    out << number;
}

void JsonWriter::value(int number) {
    beforeValue();
    out << number;
}

void JsonWriter::value(bool flag) {
    beforeValue();
    out << (flag ? "true" : "false");
}

void JsonWriter::null() {
    beforeValue();
    out << "null";
}

// A value directly after its key stays on the key's line; any other member
// starts a line of its own, after a comma if it is not the first.
void JsonWriter::beforeValue() {
    if (afterKey) {
        afterKey = false;
        return;
    }
    if (hasMembers.empty()) return;
    if (hasMembers.back()) out << ',';
    hasMembers.back() = true;
    newline();
}

void JsonWriter::open(char bracket) {
    beforeValue();
    out << bracket;
    hasMembers.push_back(false);
}

void JsonWriter::close(char bracket) {
    bool any = hasMembers.back();
    hasMembers.pop_back();
    if (any) newline();
    out << bracket;
    if (hasMembers.empty()) out << '\n';
}

void JsonWriter::newline() { out << '\n' << std::string(2 * hasMembers.size(), ' '); }

}  // namespace inspect
}  // namespace tessarine
}  // namespace lumivale
