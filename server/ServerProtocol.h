// The server's half of the wire format: reads the two requests a client
// sends that the store's protocol functions only build (subscriptions and
// snapshot requests), and builds the two ServerPayload buffers a client reads
// (delta lists and snapshots).
//
// It is the mirror of tessarine/Protocol.h and leans on it wherever a
// function exists there: change records are read with
// protocol::makeTessarineDelta, and every delta inside a delta list is the
// buffer protocol::makePayloadForSendDelta builds. So whatever this file
// writes reads back through protocol::deserializeServerPayload,
// deserializeDeltaList and deserializeSnapshot, and whatever a store's
// transport writes reads here.
//
// Errors: a buffer that is not valid gives a std::runtime_error with a fixed
// message ("Invalid SubscriptionRequest flatbuffer.", "Invalid
// SnapshotRequest flatbuffer."); nothing is logged here. Any bytes at all may
// be passed to a reader; none crashes on them. Strings are read as
// zero-terminated text, as the store's readers read them.
//
// Threads: pure functions, callable from any thread.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

// A client's request for a snapshot of one collection.
struct SnapshotRequest {
    std::string collectionName;
    std::string clientId;
};

// Reads a SubscriptionRequest buffer. Rejected unless it verifies and names
// both a client id and a collection.
SyncProtocol::SubscriptionRequest parseSubscriptionRequest(const std::vector<unsigned char>& bytes);

// Reads a SnapshotRequest buffer. Rejected unless it verifies and names both
// a collection and a client id.
SnapshotRequest parseSnapshotRequest(const std::vector<unsigned char>& bytes);

// A ServerPayload of type DELTA_LIST whose list carries sequenceNumber and
// the deltas in order, each as its own ServerDelta buffer. Throws "Invalid
// SyncProtocol::DeltaType" for a delta of another type.
std::vector<unsigned char> makeDeltaListPayload(const std::vector<SyncProtocol::Delta>& deltas,
                                                uint64_t sequenceNumber);

// A ServerPayload of type SNAPSHOT carrying the snapshot, objects in the
// order given.
std::vector<unsigned char> makeSnapshotPayload(const SyncProtocol::Snapshot& snapshot);

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
