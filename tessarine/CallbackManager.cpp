#include "tessarine/CallbackManager.h"

#include <utility>

namespace lumivale {
namespace tessarine {

CallbackManager::~CallbackManager() = default;

void CallbackManager::addDeltaReceivedCallback(const DeltaReceivedCallback& callback) {
    auto stored = std::make_shared<const DeltaReceivedCallback>(callback);
    MutexLock lock(mutex);
    deltaReceivedCallbacks.push_back(std::move(stored));
}

std::vector<CallbackManager::DeltaReceivedCallback> CallbackManager::getDeltaReceivedCallbacks() const {
    std::vector<std::shared_ptr<const DeltaReceivedCallback>> stored;
    {
        MutexLock lock(mutex);
        stored = deltaReceivedCallbacks;
    }
    std::vector<DeltaReceivedCallback> callbacks;
    callbacks.reserve(stored.size());
    for (const auto& callback : stored) callbacks.push_back(*callback);
    return callbacks;
}

void CallbackManager::setCollectionIndexerFunction(CollectionIndexerFunction indexer) {
    auto replacement = std::make_shared<const CollectionIndexerFunction>(std::move(indexer));
    {
        MutexLock lock(mutex);
        collectionIndexerFunction.swap(replacement);
    }
    // replacement now holds the previous indexer, released here outside the
    // lock (a getter may still hold its own reference to it).
}

CallbackManager::CollectionIndexerFunction CallbackManager::getCollectionIndexerFunction() const {
    std::shared_ptr<const CollectionIndexerFunction> stored;
    {
        MutexLock lock(mutex);
        stored = collectionIndexerFunction;
    }
    return stored ? *stored : CollectionIndexerFunction();
}

}  // namespace tessarine
}  // namespace lumivale
