#include "tessarine/StringUtils.h"

#include <locale>
#include <sstream>

namespace lumivale {
namespace tessarine {

namespace dbqueries {

std::string quoted(const std::string& name) { return concat({"\"", name, "\""}); }

std::string concat(std::initializer_list<std::string_view> parts) {
    size_t size = 0;
    for (std::string_view part : parts) size += part.size();
    std::string result;
    result.reserve(size);
    for (std::string_view part : parts) result.append(part);
    return result;
}

}  // namespace dbqueries

std::string stringReplace(const std::string& text, const std::string& pattern, const std::string& replacement) {
    if (pattern.empty()) return text;
    std::string result;
    std::string::size_type position = 0;
    while (position < text.size()) {
        std::string::size_type found = text.find(pattern, position);
        if (found == std::string::npos) {
            result.append(text, position, std::string::npos);
            break;
        }
        result.append(text, position, found - position);
        result += replacement;
        position = found + pattern.size();
    }
    return result;
}

long long stringToLongLong(const std::string& text) {
    std::istringstream stream(text);
    // The application's global locale could add digit grouping; numbers are
    // always stored in the classic form.
    stream.imbue(std::locale::classic());
    // A failed extraction stores 0 (or the limit on overflow) in value.
    long long value = 0;
    stream >> value;
    return value;
}

}  // namespace tessarine
}  // namespace lumivale
