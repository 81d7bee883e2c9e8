#include "tessarine/SubscriptionStorage.h"

#include <stdexcept>

#include "sqlite/Database.h"

namespace lumivale {
namespace tessarine {

SubscriptionStorage::SubscriptionStorage(std::shared_ptr<lumivale::sqlite::Database> theDatabase)
    : database(std::move(theDatabase)) {
    createDbTableIfNecessary();
}

SubscriptionStorage::~SubscriptionStorage() = default;

std::string SubscriptionStorage::getTableName() const { return TABLE_NAME; }

void SubscriptionStorage::createDbTableIfNecessary() {
    database->exec("CREATE TABLE IF NOT EXISTS " + getTableName() +
                   " (collection_name VARCHAR(256),seq_num UNSIGNED BIG INT DEFAULT 0,PRIMARY KEY (collection_name))");
}

void SubscriptionStorage::addSubscription(const std::string& collectionName) {
    auto statement = database->prepare("INSERT OR IGNORE INTO " + getTableName() + " (collection_name) VALUES (?)");
    statement.bind(1, collectionName);
    statement.step();
}

void SubscriptionStorage::deleteSubscription(const std::string& collectionName) {
    auto statement = database->prepare("DELETE FROM " + getTableName() + " WHERE collection_name = ?");
    statement.bind(1, collectionName);
    statement.step();
}

uint64_t SubscriptionStorage::getSequenceNumber(const std::string& collectionName) {
    auto statement = database->prepare("SELECT seq_num FROM " + getTableName() + " WHERE collection_name = ?");
    statement.bind(1, collectionName);
    if (!statement.step()) throw std::runtime_error("Failed to get sequence number for collection");
    return statement(0).getUint64();
}

void SubscriptionStorage::updateSequenceNumber(const std::string& collectionName, uint64_t sequenceNumber) {
    auto statement = database->prepare("UPDATE " + getTableName() + " SET seq_num = ? WHERE collection_name = ?");
    statement.bind(1, sequenceNumber);
    statement.bind(2, collectionName);
    statement.step();
}

std::vector<Subscription> SubscriptionStorage::getSubscriptions() {
    auto statement = database->prepare("SELECT collection_name, seq_num FROM " + getTableName());
    std::vector<Subscription> result;
    while (statement.step()) {
        result.push_back({statement(0).getText(), statement(1).getUint64()});
    }
    return result;
}

}  // namespace tessarine
}  // namespace lumivale
