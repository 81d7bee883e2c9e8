#include "server/ServerProtocol.h"

#include <stdexcept>

#include "tessarine/Protocol.h"
#include "tessarine/WireFormat.h"

namespace wire = ::tessarine::wire;

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

using wireformat::finishedBytes;
using wireformat::hasText;
using wireformat::kInitialBuilderSize;
using wireformat::readText;
using wireformat::verifiedRoot;

// Wraps an inner buffer (a ServerDeltaList or a Snapshot) in its envelope.
std::vector<unsigned char> envelope(wire::PayloadType type, const std::vector<unsigned char>& inner) {
    flatbuffers::FlatBufferBuilder builder(kInitialBuilderSize);
    auto data = builder.CreateVector(inner);
    builder.Finish(wire::CreateServerPayload(builder, type, data));
    return finishedBytes(builder);
}

}  // namespace

SyncProtocol::SubscriptionRequest parseSubscriptionRequest(const std::vector<unsigned char>& bytes) {
    const auto* table = verifiedRoot<wire::SubscriptionRequest>(bytes);
    if (table == nullptr || !hasText(table->clientId()) || !hasText(table->collectionName())) {
        throw std::runtime_error("Invalid SubscriptionRequest flatbuffer.");
    }
    SyncProtocol::SubscriptionRequest request;
    request.version = readText(table->version());
    request.collectionName = readText(table->collectionName());
    request.clientId = readText(table->clientId());
    request.sequenceNumber = table->sequenceNumber();
    return request;
}

SnapshotRequest parseSnapshotRequest(const std::vector<unsigned char>& bytes) {
    const auto* table = verifiedRoot<wire::SnapshotRequest>(bytes);
    if (table == nullptr || !hasText(table->collectionName()) || !hasText(table->clientId())) {
        throw std::runtime_error("Invalid SnapshotRequest flatbuffer.");
    }
    return SnapshotRequest{readText(table->collectionName()), readText(table->clientId())};
}

std::vector<unsigned char> makeDeltaListPayload(const std::vector<SyncProtocol::Delta>& deltas,
                                                uint64_t sequenceNumber) {
    flatbuffers::FlatBufferBuilder builder(kInitialBuilderSize);
    std::vector<flatbuffers::Offset<wire::ServerDeltaWrapper>> wrappers;
    wrappers.reserve(deltas.size());
    for (const SyncProtocol::Delta& delta : deltas) {
        auto data = builder.CreateVector(protocol::makePayloadForSendDelta(delta));
        wrappers.push_back(wire::CreateServerDeltaWrapper(builder, data));
    }
    auto list = builder.CreateVector(wrappers);
    builder.Finish(wire::CreateServerDeltaList(builder, list, sequenceNumber));
    return envelope(wire::PayloadType_DELTA_LIST, finishedBytes(builder));
}

std::vector<unsigned char> makeSnapshotPayload(const SyncProtocol::Snapshot& snapshot) {
    flatbuffers::FlatBufferBuilder builder(kInitialBuilderSize);
    std::vector<flatbuffers::Offset<wire::TessarineObject>> objects;
    objects.reserve(snapshot.objects.size());
    for (const SyncProtocol::TessarineObject& object : snapshot.objects) {
        auto primaryKey = builder.CreateString(object.primaryKey);
        auto sortKey = builder.CreateString(object.sortKey);
        auto blob = builder.CreateVector(object.blob);
        objects.push_back(wire::CreateTessarineObject(builder, primaryKey, sortKey, blob));
    }
    auto collectionName = builder.CreateString(snapshot.collectionName);
    auto objectVector = builder.CreateVector(objects);
    builder.Finish(wire::CreateSnapshot(builder, collectionName, objectVector, snapshot.sequenceNumber,
                                        snapshot.versionId));
    return envelope(wire::PayloadType_SNAPSHOT, finishedBytes(builder));
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
