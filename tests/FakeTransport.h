// A transport for tests: records what the store sends, lets a test fire the
// transport's events, and can be told to fail. Thread-safe. Also a
// StdThreadCreator that counts the threads it starts, and a remote change.
#pragma once

#include <atomic>
#include <functional>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "tessarine/SyncProtocol.h"
#include "tessarine/ThreadCreator.h"

namespace testsupport {

class FakeTransport : public lumivale::tessarine::SyncProtocol {
public:
    void start() override { ++starts; }

    void sendSubscriptionRequest(const SubscriptionRequest& request) override {
        std::lock_guard<std::mutex> lock(mutex);
        if (failSubscriptions) throw std::runtime_error("subscription send failed");
        subscriptions.push_back(request);
        events.push_back("subscribe " + request.collectionName);
    }

    int sendDelta(const Delta& delta) override {
        std::function<void(const Delta&)> hook;
        int count = 0;
        {
            std::lock_guard<std::mutex> lock(mutex);
            if (failDeltas) throw std::runtime_error("delta send failed");
            deltas.push_back(delta);
            events.push_back("delta " + delta.collectionName + "/" + std::to_string(delta.versionId));
            count = static_cast<int>(deltas.size());
            hook = onSend;
        }
        if (hook) hook(delta);  // outside the lock: it may write through the store
        return count;
    }
    // Runs on every delta taken, on the sending thread, as a transport's own
    // code would.
    void setOnSend(std::function<void(const Delta&)> hook) {
        std::lock_guard<std::mutex> lock(mutex);
        onSend = std::move(hook);
    }

    void sendSnapshotRequest(const std::string& collectionName, const std::string& clientId) override {
        std::lock_guard<std::mutex> lock(mutex);
        events.push_back("snapshot " + collectionName + " " + clientId);
    }

    std::vector<Delta> sentDeltas() const {
        std::lock_guard<std::mutex> lock(mutex);
        return deltas;
    }
    std::vector<SubscriptionRequest> sentSubscriptions() const {
        std::lock_guard<std::mutex> lock(mutex);
        return subscriptions;
    }
    // Every send in order, as "subscribe <collection>" or "delta <collection>/<version>".
    std::vector<std::string> sentEvents() const {
        std::lock_guard<std::mutex> lock(mutex);
        return events;
    }
    void clearSent() {
        std::lock_guard<std::mutex> lock(mutex);
        deltas.clear();
        subscriptions.clear();
        events.clear();
    }
    void setFailDeltas(bool fail) {
        std::lock_guard<std::mutex> lock(mutex);
        failDeltas = fail;
    }
    void setFailSubscriptions(bool fail) {
        std::lock_guard<std::mutex> lock(mutex);
        failSubscriptions = fail;
    }

    std::atomic<int> starts{0};

private:
    mutable std::mutex mutex;
    std::vector<Delta> deltas;
    std::vector<SubscriptionRequest> subscriptions;
    std::vector<std::string> events;
    bool failDeltas = false;
    bool failSubscriptions = false;
    std::function<void(const Delta&)> onSend;
};

// Another client's save as the server delivers it: version id and sequence
// number both n, the primary key as sort key.
inline lumivale::tessarine::SyncProtocol::Delta remoteDelta(const std::string& collection, const std::string& key,
                                                            uint64_t n, std::vector<unsigned char> blob = {9}) {
    return {"OTHERCLIENT", collection, n, key, key, lumivale::tessarine::SyncProtocol::DeltaType::SAVE, std::move(blob), n};
}

class CountingThreadCreator : public StdThreadCreator {
public:
    std::thread createThread(std::function<void()> body) override {
        ++created;
        return StdThreadCreator::createThread(std::move(body));
    }
    std::atomic<int> created{0};
};

}  // namespace testsupport
