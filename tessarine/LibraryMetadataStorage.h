// The key/value table "library_metadata" that records facts about the store
// itself (its client id and its data version), as text.
//
// Threads: no lock; each operation is one statement on the shared
// connection. Errors: getString throws KeyNotFoundError for a missing key;
// SQLiteException passes through.
#pragma once

#include <memory>
#include <stdexcept>
#include <string>

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class LibraryMetadataStorage {
public:
    static inline const std::string TABLE_NAME = "library_metadata";

    // what() is: Key not found: "<key>"
    class KeyNotFoundError : public std::runtime_error {
    public:
        explicit KeyNotFoundError(const std::string& key);
    };

    // Creates the table if it is missing.
    explicit LibraryMetadataStorage(std::shared_ptr<lumivale::sqlite::Database> database);

    void createDbTableIfNecessary();
    std::string getString(const std::string& key);
    // The value parsed as a decimal number (0 when it holds none).
    long long getInt64(const std::string& key);
    void setString(const std::string& key, const std::string& value);
    void setInt64(const std::string& key, long long value);

private:
    std::shared_ptr<lumivale::sqlite::Database> database;
};

}  // namespace tessarine
}  // namespace lumivale
