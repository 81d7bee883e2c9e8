// Opening a whole store on a FakeTransport, for the tests of the public API.
#pragma once

#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <mutex>
#include <ostream>
#include <string>
#include <vector>

#include "FakeTransport.h"
#include "TestSupport.h"
#include "tessarine/Collection.h"
#include "tessarine/Cursor.h"
#include "tessarine/Tessarine.h"

namespace testsupport {

// Every change a store reports to the application, in order; thread-safe.
class HeardDeltas {
public:
    void listenTo(lumivale::tessarine::Tessarine& store) {
        store.addDeltaReceivedCallback([this](const std::vector<lumivale::tessarine::Delta>& deltas) { add(deltas); });
    }
    void add(const std::vector<lumivale::tessarine::Delta>& deltas) {
        std::lock_guard<std::mutex> lock(mutex);
        heard.insert(heard.end(), deltas.begin(), deltas.end());
    }
    std::vector<lumivale::tessarine::Delta> all() const {
        std::lock_guard<std::mutex> lock(mutex);
        return heard;
    }
    size_t size() const { return all().size(); }
    void clear() {
        std::lock_guard<std::mutex> lock(mutex);
        heard.clear();
    }

private:
    mutable std::mutex mutex;
    std::vector<lumivale::tessarine::Delta> heard;
};

// The store listens to heard from the start; heard outlives the store, whose
// worker reports to it.
struct StoreUnderTest {
    explicit StoreUnderTest(const std::string& path)
        : store(lumivale::tessarine::Tessarine::open(path, transport, threadCreator)) {
        if (store) heard.listenTo(*store);
    }

    std::shared_ptr<FakeTransport> transport = std::make_shared<FakeTransport>();
    std::shared_ptr<CountingThreadCreator> threadCreator = std::make_shared<CountingThreadCreator>();
    HeardDeltas heard;
    std::unique_ptr<lumivale::tessarine::Tessarine> store;
};

// Every row a cursor yields, as "primaryKey=sortKey:status:blob-size".
inline std::vector<std::string> rows(std::unique_ptr<lumivale::tessarine::Cursor> cursor) {
    std::vector<std::string> result;
    while (cursor && cursor->step()) {
        result.push_back(cursor->getPrimaryKey() + "=" + cursor->getSortKey() + ":" +
                         std::to_string(cursor->getStatus()) + ":" + std::to_string(cursor->getBlob().second));
    }
    return result;
}

// An object as a cursor shows it.
struct StoredObject {
    std::string sortKey;
    std::vector<unsigned char> blob;
    int status;
    bool operator==(const StoredObject& o) const { return sortKey == o.sortKey && blob == o.blob && status == o.status; }
};

inline std::ostream& operator<<(std::ostream& out, const StoredObject& o) {
    return out << "{sort " << ::testing::PrintToString(o.sortKey) << ", " << o.blob.size() << " bytes, status "
               << o.status << "}";
}

// Every object a cursor yields, by primary key.
inline std::map<std::string, StoredObject> storedObjects(std::unique_ptr<lumivale::tessarine::Cursor> cursor) {
    std::map<std::string, StoredObject> result;
    while (cursor && cursor->step()) {
        auto blob = cursor->getBlob();
        result[cursor->getPrimaryKey()] = {cursor->getSortKey(),
                                           std::vector<unsigned char>(blob.first, blob.first + blob.second),
                                           cursor->getStatus()};
    }
    return result;
}

}  // namespace testsupport
