// The transport between a store and its server, implemented by the
// application, and the records that cross it.
//
// The records are plain values: default-constructible with empty strings and
// vectors, copied member by member into jobs, queues and callback arguments.
// Strings are byte strings; blobs are counted byte vectors; 64-bit numbers are
// unsigned. The enum values are stored in the database and passed to and from
// the application, so they are fixed.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace lumivale {
namespace tessarine {

class SyncProtocol {
public:
    // What a delta does to one object.
    enum class DeltaType : int32_t { SAVE = 1, DELETE = 2 };

    // How far a locally written delta has travelled; ordered
    // PENDING < SENT < PERSISTED.
    enum class DeltaStatus : int32_t { PENDING = 1, SENT = 2, PERSISTED = 3 };

    // The kind of a server payload's inner buffer.
    enum class PayloadType : int32_t { DELTA_LIST = 1, SNAPSHOT = 2 };

    // One change to one object. (collectionName, versionId) identifies a
    // queued local delta. clientId is empty in a delta a Collection makes and
    // stamped by the delta queue when it goes to the transport;
    // sequenceNumber is set only on deltas that came from the server.
    struct Delta {
        std::string clientId;
        std::string collectionName;
        uint64_t versionId = 0;
        std::string primaryKey;
        std::string sortKey;
        DeltaType type = DeltaType::SAVE;
        std::vector<unsigned char> blob;
        uint64_t sequenceNumber = 0;
    };

    // A new status for a delta, found in the queue by its collection name
    // and version id.
    struct DeltaStatusUpdate {
        Delta delta;
        DeltaStatus status = DeltaStatus::PENDING;
    };

    // One object inside a snapshot.
    struct TessarineObject {
        std::string primaryKey;
        std::string sortKey;
        std::vector<unsigned char> blob;
    };

    // The full content of one collection at one point. versionId is the
    // highest version id of this client's own changes that it contains.
    struct Snapshot {
        std::string collectionName;
        std::vector<TessarineObject> objects;
        uint64_t sequenceNumber = 0;
        uint64_t versionId = 0;
    };

    // What the store asks of the server when it subscribes to a collection.
    // version is one byte: the low 8 bits of the library's data version.
    struct SubscriptionRequest {
        std::string version;
        std::string collectionName;
        std::string clientId;
        uint64_t sequenceNumber = 0;
    };

    // The server's answer to a subscription. The store reads none of its
    // fields; a transport fills in what its server says.
    struct SubscriptionResponse {
        std::string collectionName;
        uint64_t sequenceNumber = 0;
    };

    // A server payload taken out of its envelope.
    struct ServerPayload {
        PayloadType type = PayloadType::DELTA_LIST;
        std::vector<unsigned char> data;
    };
};

}  // namespace tessarine
}  // namespace lumivale
