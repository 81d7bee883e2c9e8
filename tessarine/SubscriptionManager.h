// Subscribes collections with the server and keeps each one's sequence
// number: on Tessarine::subscribeCollection, and again for every stored
// subscription each time the transport reports a connection.
//
// Registers with the transport on construction and removes its
// registrations on destruction, so a transport that outlives the store never
// calls into a destroyed manager. Must not be destroyed from inside one of
// the transport's deliveries (removal waits for the delivery to end).
//
// Threads: no lock of its own. subscribeCollection runs on application
// threads, onConnectionEstablished on the transport's thread,
// updateSequenceNumber on the worker. Errors: subscribeCollection and the
// storage pass-throughs throw; onConnectionEstablished swallows
// std::exception (the remaining collections wait for the next connection).
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class LibraryMetadata;
class SubscriptionStorage;

class SubscriptionManager {
public:
    SubscriptionManager(std::shared_ptr<lumivale::sqlite::Database> database,
                        std::shared_ptr<SyncProtocol> syncProtocol,
                        std::shared_ptr<SubscriptionStorage> subscriptionStorage,
                        std::shared_ptr<LibraryMetadata> libraryMetadata);
    virtual ~SubscriptionManager();
    SubscriptionManager(const SubscriptionManager&) = delete;
    SubscriptionManager& operator=(const SubscriptionManager&) = delete;

    // Records the collection (keeping an existing row) and asks the server
    // for it from the stored sequence number on.
    virtual void subscribeCollection(const std::string& collectionName);
    virtual void sendSubscribeCollectionRequest(const std::string& collectionName, uint64_t sequenceNumber);
    virtual void updateSequenceNumber(const std::string& collectionName, uint64_t sequenceNumber);
    virtual uint64_t getSequenceNumber(const std::string& collectionName);

    void onConnectionEstablished();
    void onSubscriptionResponseReceived(const SyncProtocol::SubscriptionResponse& response);

private:
    std::shared_ptr<SyncProtocol> syncProtocol;
    std::shared_ptr<SubscriptionStorage> subscriptionStorage;
    std::shared_ptr<LibraryMetadata> libraryMetadata;
    int connectionEstablishedCallbackId = 0;
    int subscriptionResponseCallbackId = 0;
};

}  // namespace tessarine
}  // namespace lumivale
