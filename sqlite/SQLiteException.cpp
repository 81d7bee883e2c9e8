#include "sqlite/SQLiteException.h"

namespace lumivale {
namespace sqlite {

namespace {
std::string describe(int code, const std::string& sqliteMessage, const std::string& context) {
    std::string text = sqliteMessage + " (SQLite error " + std::to_string(code) + ")";
    if (!context.empty()) text += " while " + context;
    return text;
}
}  // namespace

SQLiteException::SQLiteException(int code, const std::string& sqliteMessage, const std::string& context)
    : std::runtime_error(describe(code, sqliteMessage, context)), code_(code) {}

}  // namespace sqlite
}  // namespace lumivale
