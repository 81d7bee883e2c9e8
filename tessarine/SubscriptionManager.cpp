#include "tessarine/SubscriptionManager.h"

#include <exception>

#include "platform/Log.h"
#include "tessarine/LibraryMetadata.h"
#include "tessarine/StoreLog.h"
#include "tessarine/SubscriptionStorage.h"

namespace lumivale {
namespace tessarine {

SubscriptionManager::SubscriptionManager(std::shared_ptr<lumivale::sqlite::Database> /*database*/,
                                         std::shared_ptr<SyncProtocol> theSyncProtocol,
                                         std::shared_ptr<SubscriptionStorage> theSubscriptionStorage,
                                         std::shared_ptr<LibraryMetadata> theLibraryMetadata)
    : syncProtocol(std::move(theSyncProtocol)),
      subscriptionStorage(std::move(theSubscriptionStorage)),
      libraryMetadata(std::move(theLibraryMetadata)) {
    connectionEstablishedCallbackId =
        this->syncProtocol->addConnectionEstablishedCallback([this] { onConnectionEstablished(); });
    subscriptionResponseCallbackId = this->syncProtocol->addSubscriptionResponseReceivedCallback(
        [this](const SyncProtocol::SubscriptionResponse& response) { onSubscriptionResponseReceived(response); });
}

SubscriptionManager::~SubscriptionManager() {
    syncProtocol->removeConnectionEstablishedCallback(connectionEstablishedCallbackId);
    syncProtocol->removeSubscriptionResponseReceivedCallback(subscriptionResponseCallbackId);
}

void SubscriptionManager::subscribeCollection(const std::string& collectionName) {
    subscriptionStorage->addSubscription(collectionName);
    sendSubscribeCollectionRequest(collectionName, subscriptionStorage->getSequenceNumber(collectionName));
}

void SubscriptionManager::sendSubscribeCollectionRequest(const std::string& collectionName,
                                                         uint64_t sequenceNumber) {
    SyncProtocol::SubscriptionRequest request;
    request.version = std::string(1, static_cast<char>(libraryMetadata->getVersion() & 0xFF));
    request.collectionName = collectionName;
    request.clientId = libraryMetadata->getClientUuid();
    request.sequenceNumber = sequenceNumber;
    syncProtocol->sendSubscriptionRequest(request);
}

void SubscriptionManager::updateSequenceNumber(const std::string& collectionName, uint64_t sequenceNumber) {
    subscriptionStorage->updateSequenceNumber(collectionName, sequenceNumber);
}

uint64_t SubscriptionManager::getSequenceNumber(const std::string& collectionName) {
    return subscriptionStorage->getSequenceNumber(collectionName);
}

void SubscriptionManager::onConnectionEstablished() {
    lv_printLog(LogPriority::kDebug, kStoreLogTag, "SubscriptionManager::onConnectionEstablished is called back");
    try {
        for (const Subscription& subscription : subscriptionStorage->getSubscriptions()) {
            sendSubscribeCollectionRequest(subscription.collectionName, subscription.sequenceNumber);
        }
    } catch (const std::exception&) {
        // The other connection listeners (the queue's resend) must still run;
        // the collections not yet resubscribed wait for the next connection.
    }
}

void SubscriptionManager::onSubscriptionResponseReceived(const SyncProtocol::SubscriptionResponse&) {}

}  // namespace tessarine
}  // namespace lumivale
