// The wire toolkit for the application's transport: builds the FlatBuffers
// buffers the transport sends and reads the ones it receives, converting
// between them and the SyncProtocol records. The store itself calls none of
// these; the schema is tessarine/schema/tessarine.fbs (namespace
// tessarine::wire), and its generated header is installed as
// tessarine/schema/tessarine_generated.h for transports that want the tables.
// This header does not need it.
//
// Sending: publish makePayloadForSendDelta's bytes on TOPIC_CHANGE_RECORD,
// makePayloadForSubscription's on TOPIC_SUBSCRIBE_COLLECTION and
// makePayloadForSnapshotRequest's on TOPIC_SNAPSHOT. Receiving: pass a server
// buffer to deserializeServerPayload, then its data to deserializeDeltaList
// (PayloadType::DELTA_LIST) or deserializeSnapshot (PayloadType::SNAPSHOT).
//
// Errors: every failure is a std::runtime_error with a fixed message. Before
// throwing for a buffer that is not valid, a reader logs one line at priority
// 6 under the tag "tessarine" ("Error deserializing <Table>: invalid", or
// "Error deserializing ServerDeltaWrapper: no data"); enum conversions throw
// without logging. A reader returns all of a buffer or throws: no partial
// result. Any bytes at all may be passed to a reader; none crashes on them.
//
// Reading: every buffer is verified in full (nesting depth 64, at most
// 1000000 tables) before anything is read. Strings are copied as
// zero-terminated text, so a string holding a zero byte arrives cut at it;
// blobs and data are copied whole. Fields a buffer may leave out:
//   - ServerPayload without data: rejected ("Invalid ServerPayload flatbuffer.").
//   - ServerDelta without collectionName or primaryKey: rejected
//     ("Invalid ServerDelta flatbuffer.").
//   - Snapshot without collectionName, or any of its TessarineObjects without
//     primaryKey: rejected ("Invalid Snapshot flatbuffer.").
//   - Any other absent string, blob or vector reads as empty; an absent
//     scalar reads as its default (0, SAVE, DELTA_LIST).
//   - A delta's versionId is the value stored under its clientId in its
//     version vector (found by binary search, comparing keys as
//     zero-terminated text); without such an entry, or without a version
//     vector, it is 0.
//
// Threads: every function is a pure transformation of its arguments and may
// run on any thread, several at once.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "tessarine/SyncProtocol.h"

// The generated wire types, declared here so that this header compiles
// without the generated code.
namespace tessarine {
namespace wire {
struct ServerDelta;
enum ChangeType : int8_t;
enum PayloadType : int8_t;
}  // namespace wire
}  // namespace tessarine

namespace lumivale {
namespace tessarine {
namespace protocol {

// The topic each outgoing payload is published on.
inline constexpr char TOPIC_CHANGE_RECORD[] = "/tessarine_change_record";
inline constexpr char TOPIC_SUBSCRIBE_COLLECTION[] = "/tessarine_subscribe_collection";
inline constexpr char TOPIC_SNAPSHOT[] = "/tessarine_snapshot";

// SAVE -> 0, DELETE -> 1; anything else throws "Invalid SyncProtocol::DeltaType".
::tessarine::wire::ChangeType convertDeltaType(SyncProtocol::DeltaType type);

// 0 -> SAVE, 1 -> DELETE; anything else throws "Invalid SyncProtocol::DeltaType".
SyncProtocol::DeltaType convertChangeType(::tessarine::wire::ChangeType type);

// 0 -> DELTA_LIST (1), 1 -> SNAPSHOT (2); anything else throws
// "Invalid SyncProtocol::PayloadType".
SyncProtocol::PayloadType convertPayloadType(::tessarine::wire::PayloadType type);

// Reads one delta out of a ServerDelta table of a buffer that has passed
// verification, giving it sequenceNumber. Throws "Invalid ServerDelta
// flatbuffer." (logged) when collectionName or primaryKey is absent, and
// "Invalid SyncProtocol::DeltaType" for a type other than 0 or 1.
SyncProtocol::Delta makeTessarineDelta(const ::tessarine::wire::ServerDelta& serverDelta,
                                       uint64_t sequenceNumber);

// The same for a whole ServerDelta buffer held in a string or a byte vector.
// These verify the buffer first: one that fails logs "Error deserializing
// ServerDelta: invalid" and throws "Invalid ServerDelta flatbuffer.".
SyncProtocol::Delta makeTessarineDelta(const std::string& buffer, uint64_t sequenceNumber);
SyncProtocol::Delta makeTessarineDelta(const std::vector<unsigned char>& buffer, uint64_t sequenceNumber);

// Takes a server buffer (root ServerPayload) out of its envelope. Throws
// "Invalid ServerPayload flatbuffer." or "Invalid SyncProtocol::PayloadType".
SyncProtocol::ServerPayload deserializeServerPayload(std::vector<unsigned char> bytes);

// Reads a ServerDeltaList buffer: its deltas in order, each carrying the
// list's sequence number. The list is verified, then each wrapper's data as
// a ServerDelta buffer of its own. Throws "Invalid ServerDeltaList
// flatbuffer.", "Invalid ServerDeltaWrapper flatbuffer." (a wrapper without
// data), "Invalid ServerDelta flatbuffer." or "Invalid SyncProtocol::DeltaType".
std::vector<SyncProtocol::Delta> deserializeDeltaList(const std::vector<unsigned char>& bytes);

// Reads a Snapshot buffer, its objects in order. Throws "Invalid Snapshot
// flatbuffer.".
SyncProtocol::Snapshot deserializeSnapshot(const std::vector<unsigned char>& bytes);

// Building: each payload is built in its own builder (1024 bytes to start,
// growing as needed) and returned as a copy of the finished buffer, which has
// no file identifier. Strings and blobs are written whole, zero bytes
// included; scalars equal to their default are left out.

// A SubscriptionRequest buffer for the request; sequenceNumber 0 is not
// written.
std::vector<unsigned char> makePayloadForSubscription(const SyncProtocol::SubscriptionRequest& request);

// A ServerDelta buffer for a local change: its version vector holds the one
// entry clientId -> versionId. SAVE and versionId 0 are not written, nor is
// the sequence number. Throws "Invalid SyncProtocol::DeltaType" for a type
// other than SAVE or DELETE.
std::vector<unsigned char> makePayloadForSendDelta(const SyncProtocol::Delta& delta);
// The same, naming the version id of the change the transport sent just
// before this one in the same collection since subscribing, or the change's
// own for the first (previousVersionId in the schema; not written when 0),
// so that a server can tell that one, or the subscription, was lost.
std::vector<unsigned char> makePayloadForSendDelta(const SyncProtocol::Delta& delta, uint64_t previousVersionId);
// The previousVersionId of a ServerDelta buffer; 0 when it has none. Throws
// as makeTessarineDelta does for a buffer that is not valid.
uint64_t previousVersionIdOf(const std::vector<unsigned char>& buffer);

// A SnapshotRequest buffer asking for a snapshot of collectionName on behalf
// of clientId.
std::vector<unsigned char> makePayloadForSnapshotRequest(const std::string& collectionName,
                                                         const std::string& clientId);

}  // namespace protocol
}  // namespace tessarine
}  // namespace lumivale
