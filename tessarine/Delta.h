// The change record that the application's delta callbacks receive: one
// applied change, local or remote, with its status. It carries neither the
// writer's client id, the version id nor the sequence number.
#pragma once

#include <string>
#include <vector>

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {

struct Delta {
    std::string collectionName;
    SyncProtocol::DeltaType type = SyncProtocol::DeltaType::SAVE;
    std::string primaryKey;
    std::string sortKey;
    std::vector<unsigned char> blob;
    SyncProtocol::DeltaStatus status = SyncProtocol::DeltaStatus::PENDING;
};

}  // namespace tessarine
}  // namespace lumivale
