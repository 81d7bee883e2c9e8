#include <gtest/gtest.h>

#include <vector>

#include "tessarine/SyncProtocol.h"

using lumivale::tessarine::SyncProtocol;

namespace {

TEST(SyncRecordsTest, EmptyFieldsAndBlobsWithZeroBytesSurviveCopies) {
    SyncProtocol::Delta original;
    original.blob = {'x', 0, 'y', 0};
    std::vector<SyncProtocol::Delta> batch{original, SyncProtocol::Delta()};
    SyncProtocol::Delta assigned;
    assigned = batch[0];
    EXPECT_EQ((std::vector<unsigned char>{'x', 0, 'y', 0}), assigned.blob);
    EXPECT_TRUE(batch[1].blob.empty() && batch[1].sortKey.empty() && assigned.sortKey.empty());
}

}  // namespace
