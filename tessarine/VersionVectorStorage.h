// The version vector of each collection: per writing client, the highest
// version id of that client's changes that this store has seen, kept in the
// table "collection_version_vectors".
//
// Threads: no lock. updateCollectionVersionVector reads and then writes, so
// it runs inside the caller's transaction (the delta handler's delivery).
// Errors: SQLiteException passes through.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class VersionVectorStorage {
public:
    // Creates the table if it is missing.
    explicit VersionVectorStorage(std::shared_ptr<lumivale::sqlite::Database> database);
    virtual ~VersionVectorStorage();

    // Records versionId for (collection, client) unless a higher one is
    // already recorded; version ids compare as unsigned 64-bit numbers.
    virtual void updateCollectionVersionVector(const std::string& collectionName, const std::string& clientId,
                                               uint64_t versionId);
    // The highest version id recorded for (collection, client); 0 when none.
    virtual uint64_t getCollectionVersion(const std::string& collectionName, const std::string& clientId);

    std::string getTableName() const;

private:
    std::shared_ptr<lumivale::sqlite::Database> database;
};

}  // namespace tessarine
}  // namespace lumivale
