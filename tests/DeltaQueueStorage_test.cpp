#include <gtest/gtest.h>

#include "sqlite/Database.h"
#include "tessarine/DeltaQueueStorage.h"

namespace {

using lumivale::tessarine::SyncProtocol;

TEST(DeltaQueueStorageDeathTest, StoringPersistedIsABrokenInvariant) {
    auto db = std::make_shared<lumivale::sqlite::Database>(":memory:", lumivale::sqlite::kOpenReadWriteCreate);
    lumivale::tessarine::DeltaQueueStorage storage(db);
    SyncProtocol::Delta delta{"WRITER", "a:b", 1, "k", "s", SyncProtocol::DeltaType::SAVE, {1}, 0};
    EXPECT_DEATH(storage.updateDeltaStatus(delta, SyncProtocol::DeltaStatus::PERSISTED),
                 "Assert \\(DeltaQueueStorage:[0-9]+\\): Deltas with status=PERSISTED should be deleted from the queue");
}

}  // namespace
