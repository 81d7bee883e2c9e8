#include "tessarine/LibraryMetadataStorage.h"

#include "sqlite/Database.h"
#include "tessarine/StringUtils.h"

namespace lumivale {
namespace tessarine {

namespace {
const std::string& kTable = LibraryMetadataStorage::TABLE_NAME;
}

LibraryMetadataStorage::KeyNotFoundError::KeyNotFoundError(const std::string& key)
    : std::runtime_error("Key not found: \"" + key + "\"") {}

LibraryMetadataStorage::LibraryMetadataStorage(std::shared_ptr<lumivale::sqlite::Database> theDatabase)
    : database(std::move(theDatabase)) {
    createDbTableIfNecessary();
}

void LibraryMetadataStorage::createDbTableIfNecessary() {
    database->exec("CREATE TABLE IF NOT EXISTS " + kTable + " (key VARCHAR(128),value VARCHAR(128),PRIMARY KEY (key))");
}

std::string LibraryMetadataStorage::getString(const std::string& key) {
    auto statement = database->prepare("SELECT value FROM " + kTable + " WHERE  key = ?");
    statement.bind(1, key);
    if (!statement.step()) throw KeyNotFoundError(key);
    return statement(0).getText();
}

long long LibraryMetadataStorage::getInt64(const std::string& key) { return stringToLongLong(getString(key)); }

void LibraryMetadataStorage::setString(const std::string& key, const std::string& value) {
    auto statement = database->prepare("INSERT OR REPLACE INTO " + kTable + " (key, value) VALUES (?, ?)");
    statement.bind(1, key);
    statement.bind(2, value);
    statement.step();
}

void LibraryMetadataStorage::setInt64(const std::string& key, long long value) {
    setString(key, std::to_string(value));
}

}  // namespace tessarine
}  // namespace lumivale
