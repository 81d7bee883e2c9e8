#include "tessarine/VersionVectorStorage.h"

#include "sqlite/Database.h"

namespace lumivale {
namespace tessarine {

VersionVectorStorage::VersionVectorStorage(std::shared_ptr<lumivale::sqlite::Database> theDatabase)
    : database(std::move(theDatabase)) {
    this->database->exec("CREATE TABLE IF NOT EXISTS " + getTableName() +
                         " (collection_name VARCHAR(256),client_id VARCHAR(128),version_id UNSIGNED BIG INT,"
                         "PRIMARY KEY (collection_name, client_id))");
}

VersionVectorStorage::~VersionVectorStorage() = default;

std::string VersionVectorStorage::getTableName() const { return "collection_version_vectors"; }

void VersionVectorStorage::updateCollectionVersionVector(const std::string& collectionName,
                                                         const std::string& clientId, uint64_t versionId) {
    // SQLite compares the stored numbers as signed; the comparison that
    // matters is the unsigned one, so it is made here.
    if (versionId <= getCollectionVersion(collectionName, clientId)) return;
    auto statement = database->prepare("INSERT OR REPLACE INTO " + getTableName() +
                                       " (collection_name, client_id, version_id) VALUES (?, ?, ?)");
    statement.bind(1, collectionName);
    statement.bind(2, clientId);
    statement.bind(3, versionId);
    statement.step();
}

uint64_t VersionVectorStorage::getCollectionVersion(const std::string& collectionName, const std::string& clientId) {
    auto statement = database->prepare("SELECT version_id FROM " + getTableName() +
                                       " WHERE collection_name = ? AND client_id = ?");
    statement.bind(1, collectionName);
    statement.bind(2, clientId);
    return statement.step() ? statement(0).getUint64() : 0;
}

}  // namespace tessarine
}  // namespace lumivale
