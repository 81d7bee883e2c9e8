#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "tessarine/CallbackManager.h"

using lumivale::tessarine::CallbackManager;
using lumivale::tessarine::Delta;
using Fields = std::unordered_multimap<std::string, std::string>;

namespace {

CallbackManager::CollectionIndexerFunction indexerReturning(const std::string& tag) {
    return [tag](const std::string&, const std::string&, const std::string&, const std::vector<unsigned char>&) {
        return Fields{{tag, tag}};
    };
}

// Registration while the store runs must be safe: a writer thread adds
// callbacks and swaps indexers while this thread keeps reading. In the
// sanitizer build a use of a released function fails the test.
TEST(CallbackManagerTest, RegistrationFromAnotherThreadDuringReadsIsSafeAndCopiesDoNotSeeLaterChanges) {
    CallbackManager manager;
    constexpr int kAdds = 2000;
    std::atomic<bool> writerDone{false};
    std::thread writer([&] {
        for (int i = 0; i < kAdds; ++i) {
            manager.addDeltaReceivedCallback([i](const std::vector<Delta>&) { (void)i; });
            manager.setCollectionIndexerFunction(indexerReturning("field" + std::to_string(i)));
        }
        writerDone = true;
    });
    size_t lastSize = 0;
    for (bool done = false; !done;) {
        done = writerDone;  // read once more after the writer has finished
        auto callbacks = manager.getDeltaReceivedCallbacks();
        EXPECT_GE(callbacks.size(), lastSize);
        lastSize = callbacks.size();
        for (const auto& callback : callbacks) callback({});
        if (auto indexer = manager.getCollectionIndexerFunction()) {
            EXPECT_EQ(1u, indexer("a:b", "p", "s", {}).size());
        }
    }
    writer.join();
    EXPECT_EQ(static_cast<size_t>(kAdds), lastSize);
    EXPECT_EQ(1u, manager.getCollectionIndexerFunction()("a:b", "p", "s", {}).count("field1999"));

    // A copy keeps the registration order and does not see later changes;
    // a copied indexer outlives its replacement.
    CallbackManager fresh;
    std::vector<int> calls;
    auto first = [&](const std::vector<Delta>&) { calls.push_back(1); };
    fresh.addDeltaReceivedCallback(first);
    fresh.addDeltaReceivedCallback([&](const std::vector<Delta>&) { calls.push_back(2); });
    fresh.addDeltaReceivedCallback(first);
    fresh.addDeltaReceivedCallback([&](const std::vector<Delta>&) { calls.push_back(4); });
    auto copy = fresh.getDeltaReceivedCallbacks();
    fresh.addDeltaReceivedCallback([&](const std::vector<Delta>&) { calls.push_back(3); });
    for (const auto& callback : copy) callback({});
    EXPECT_EQ((std::vector<int>{1, 2, 1, 4}), calls);
    fresh.setCollectionIndexerFunction(indexerReturning("old"));
    auto oldIndexer = fresh.getCollectionIndexerFunction();
    fresh.setCollectionIndexerFunction(nullptr);
    EXPECT_FALSE(fresh.getCollectionIndexerFunction());
    EXPECT_EQ(1u, oldIndexer("a:b", "pk", "sk", {}).count("old"));
}

}  // namespace
