// The table "subscriptions": every collection the store has subscribed to,
// with the last server sequence number applied for it (0 until the first).
//
// Threads: no lock; each operation is one statement on the shared
// connection. Errors: getSequenceNumber throws std::runtime_error "Failed to
// get sequence number for collection" for a collection without a row;
// SQLiteException passes through.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

struct Subscription {
    std::string collectionName;
    uint64_t sequenceNumber = 0;
};

class SubscriptionStorage {
public:
    static inline const std::string TABLE_NAME = "subscriptions";

    // Creates the table if it is missing.
    explicit SubscriptionStorage(std::shared_ptr<lumivale::sqlite::Database> database);
    virtual ~SubscriptionStorage();

    // Adds a row with sequence number 0; an existing row stays as it is.
    virtual void addSubscription(const std::string& collectionName);
    virtual void deleteSubscription(const std::string& collectionName);
    virtual uint64_t getSequenceNumber(const std::string& collectionName);
    // Overwrites the stored number, larger or smaller; no row, no change.
    virtual void updateSequenceNumber(const std::string& collectionName, uint64_t sequenceNumber);
    // Every row, in the database's order.
    virtual std::vector<Subscription> getSubscriptions();

    std::string getTableName() const;
    void createDbTableIfNecessary();

private:
    std::shared_ptr<lumivale::sqlite::Database> database;
};

}  // namespace tessarine
}  // namespace lumivale
