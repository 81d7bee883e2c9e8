// Holds the application's two hooks into a store: the callbacks that hear of
// every applied change, and the indexer that turns an object into index
// entries.
//
// One instance per store, shared by CollectionStorage (which asks for the
// indexer on every save) and the delta handler (which calls the callbacks).
// Callbacks accumulate in registration order and cannot be removed; an empty
// function is stored like any other. An empty indexer means no indexing.
//
// Threads: every operation may be called from any thread at any time, so an
// application may register while the store runs. One mutex guards both
// members. No application code runs while it is held: the functions are kept
// behind shared pointers, so the lock only ever copies and releases pointers,
// while the copies handed out and the stored functions that get replaced are
// made and destroyed outside it. The getters return copies, which the caller
// invokes without holding anything of the manager; a registration after a
// get does not change that copy.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/ThreadAnnotations.h"
#include "tessarine/Delta.h"

namespace lumivale {
namespace tessarine {

class CallbackManager {
public:
    // Receives every delta of one applied batch in one call.
    using DeltaReceivedCallback = std::function<void(const std::vector<Delta>&)>;
    // (collection name, primary key, sort key, blob) to index entries, field
    // name to field value; a field name may repeat.
    using CollectionIndexerFunction = std::function<std::unordered_multimap<std::string, std::string>(
        const std::string&, const std::string&, const std::string&, const std::vector<unsigned char>&)>;

    virtual ~CallbackManager();

    virtual void addDeltaReceivedCallback(const DeltaReceivedCallback& callback);
    virtual std::vector<DeltaReceivedCallback> getDeltaReceivedCallbacks() const;
    // Replaces the indexer; an empty function switches indexing off. Later
    // saves use the new one; existing index rows are not rebuilt.
    virtual void setCollectionIndexerFunction(CollectionIndexerFunction indexer);
    // A copy of the indexer, empty when none is set.
    virtual CollectionIndexerFunction getCollectionIndexerFunction() const;

private:
    mutable Mutex mutex;
    std::vector<std::shared_ptr<const DeltaReceivedCallback>> deltaReceivedCallbacks TS_GUARDED_BY(mutex);
    std::shared_ptr<const CollectionIndexerFunction> collectionIndexerFunction TS_GUARDED_BY(mutex);
};

}  // namespace tessarine
}  // namespace lumivale
