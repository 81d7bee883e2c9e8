#include "tessarine/VersionIdGenerator.h"

#include <utility>

#include "sqlite/Database.h"
#include "tessarine/VersionIdGeneratorQueries.h"

namespace lumivale {
namespace tessarine {

VersionIdGenerator::VersionIdGenerator(std::shared_ptr<lumivale::sqlite::Database> theDatabase)
    : database(std::move(theDatabase)) {
    createVersionIdTable();
}

VersionIdGenerator::~VersionIdGenerator() = default;

void VersionIdGenerator::initializeVersionId(const std::string& collectionName) {
    auto statement = database->prepare(dbqueries::InitializeVersionId::getSql(TABLE_NAME));
    statement.bind(1, collectionName);
    statement.step();
}

uint64_t VersionIdGenerator::incrementAndGetVersionId(const std::string& collectionName) {
    uint64_t versionId = 0;
    database->runInTransaction(
        [this, collectionName, &versionId] {
            incrementVersionId(collectionName);
            versionId = queryVersionId(collectionName);
        },
        lumivale::sqlite::Database::TransactionType::Immediate);
    return versionId;
}

void VersionIdGenerator::createVersionIdTable() {
    database->exec(dbqueries::CreateVersionIdTable::getSql(TABLE_NAME));
}

void VersionIdGenerator::incrementVersionId(const std::string& collectionName) {
    auto statement = database->prepare(dbqueries::IncrementVersionId::getSql(TABLE_NAME));
    statement.bind(1, collectionName);
    statement.step();
}

uint64_t VersionIdGenerator::queryVersionId(const std::string& collectionName) {
    auto statement = database->prepare(dbqueries::QueryVersionId::getSql(TABLE_NAME));
    statement.bind(1, collectionName);
    if (!statement.step()) return 0;
    // The column holds an unsigned 64-bit counter in SQLite's signed integer.
    return statement(0).getUint64();
}

}  // namespace tessarine
}  // namespace lumivale
