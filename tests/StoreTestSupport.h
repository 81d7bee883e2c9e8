// Opening a whole store on a FakeTransport, for the tests of the public API.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "FakeTransport.h"
#include "TestSupport.h"
#include "tessarine/Collection.h"
#include "tessarine/Cursor.h"
#include "tessarine/Tessarine.h"

namespace testsupport {

struct StoreUnderTest {
    explicit StoreUnderTest(const std::string& path)
        : store(lumivale::tessarine::Tessarine::open(path, transport, threadCreator)) {}

    std::shared_ptr<FakeTransport> transport = std::make_shared<FakeTransport>();
    std::shared_ptr<CountingThreadCreator> threadCreator = std::make_shared<CountingThreadCreator>();
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

}  // namespace testsupport
