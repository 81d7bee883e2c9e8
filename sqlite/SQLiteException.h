// The one exception type of the SQLite access layer.
//
// what() reads "<SQLite's message> (SQLite error <code>) while <action>: <SQL>",
// so a log line that prints it says both what SQLite objected to and to which
// statement. code() is SQLite's extended result code.
#pragma once

#include <stdexcept>
#include <string>

namespace lumivale {
namespace sqlite {

// SQLite's result code for a write refused by a database opened read-only.
constexpr int kErrorReadOnly = 8;

class SQLiteException : public std::runtime_error {
public:
    SQLiteException(int code, const std::string& sqliteMessage, const std::string& context);

    int code() const noexcept { return code_; }

private:
    int code_;
};

}  // namespace sqlite
}  // namespace lumivale
