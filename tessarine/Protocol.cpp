#include "tessarine/Protocol.h"

#include <stdexcept>

#include "platform/Log.h"
#include "tessarine/StoreLog.h"
#include "tessarine/WireFormat.h"

namespace wire = ::tessarine::wire;

namespace lumivale {
namespace tessarine {
namespace protocol {

namespace {

using wireformat::finishedBytes;
using wireformat::kInitialBuilderSize;
using wireformat::readBytes;
using wireformat::readText;
using wireformat::verifiedRoot;


[[noreturn]] void rejectBuffer(const char* logLine, const char* message) {
    lv_printLog(LogPriority::kError, kStoreLogTag, "%s", logLine);
    throw std::runtime_error(message);
}

[[noreturn]] void rejectServerDelta() {
    rejectBuffer("Error deserializing ServerDelta: invalid", "Invalid ServerDelta flatbuffer.");
}

[[noreturn]] void rejectSnapshot() {
    rejectBuffer("Error deserializing Snapshot: invalid", "Invalid Snapshot flatbuffer.");
}

uint64_t versionOf(const wire::ServerDelta& serverDelta) {
    const auto* versionVector = serverDelta.versionVector();
    if (versionVector == nullptr) return 0;
    const char* writer = serverDelta.clientId() == nullptr ? "" : serverDelta.clientId()->c_str();
    const wire::VersionMap* entry = versionVector->LookupByKey(writer);
    return entry == nullptr ? 0 : entry->value();
}

SyncProtocol::TessarineObject makeTessarineObject(const wire::TessarineObject& object) {
    if (object.primaryKey() == nullptr) rejectSnapshot();
    SyncProtocol::TessarineObject result;
    result.primaryKey = readText(object.primaryKey());
    result.sortKey = readText(object.sortKey());
    result.blob = readBytes(object.blob());
    return result;
}

}  // namespace

wire::ChangeType convertDeltaType(SyncProtocol::DeltaType type) {
    switch (type) {
        case SyncProtocol::DeltaType::SAVE:
            return wire::ChangeType_SAVE;
        case SyncProtocol::DeltaType::DELETE:
            return wire::ChangeType_DELETE;
    }
    throw std::runtime_error("Invalid SyncProtocol::DeltaType");
}

SyncProtocol::DeltaType convertChangeType(wire::ChangeType type) {
    switch (type) {
        case wire::ChangeType_SAVE:
            return SyncProtocol::DeltaType::SAVE;
        case wire::ChangeType_DELETE:
            return SyncProtocol::DeltaType::DELETE;
    }
    throw std::runtime_error("Invalid SyncProtocol::DeltaType");
}

SyncProtocol::PayloadType convertPayloadType(wire::PayloadType type) {
    switch (type) {
        case wire::PayloadType_DELTA_LIST:
            return SyncProtocol::PayloadType::DELTA_LIST;
        case wire::PayloadType_SNAPSHOT:
            return SyncProtocol::PayloadType::SNAPSHOT;
    }
    throw std::runtime_error("Invalid SyncProtocol::PayloadType");
}

SyncProtocol::Delta makeTessarineDelta(const wire::ServerDelta& serverDelta, uint64_t sequenceNumber) {
    if (serverDelta.collectionName() == nullptr || serverDelta.primaryKey() == nullptr) rejectServerDelta();
    SyncProtocol::Delta delta;
    delta.collectionName = readText(serverDelta.collectionName());
    delta.versionId = versionOf(serverDelta);
    delta.primaryKey = readText(serverDelta.primaryKey());
    delta.type = convertChangeType(serverDelta.type());
    delta.sortKey = readText(serverDelta.sortKey());
    delta.clientId = readText(serverDelta.clientId());
    delta.blob = readBytes(serverDelta.blob());
    delta.sequenceNumber = sequenceNumber;
    return delta;
}

SyncProtocol::Delta makeTessarineDelta(const std::string& buffer, uint64_t sequenceNumber) {
    // A string's bytes need not be aligned for the 8-byte scalars inside;
    // a vector's heap storage is.
    return makeTessarineDelta(std::vector<unsigned char>(buffer.begin(), buffer.end()), sequenceNumber);
}

SyncProtocol::Delta makeTessarineDelta(const std::vector<unsigned char>& buffer, uint64_t sequenceNumber) {
    const auto* serverDelta = verifiedRoot<wire::ServerDelta>(buffer);
    if (serverDelta == nullptr) rejectServerDelta();
    return makeTessarineDelta(*serverDelta, sequenceNumber);
}

uint64_t previousVersionIdOf(const std::vector<unsigned char>& buffer) {
    const auto* serverDelta = verifiedRoot<wire::ServerDelta>(buffer);
    if (serverDelta == nullptr) rejectServerDelta();
    return serverDelta->previousVersionId();
}

SyncProtocol::ServerPayload deserializeServerPayload(std::vector<unsigned char> bytes) {
    const char* logLine = "Error deserializing ServerPayload: invalid";
    const char* message = "Invalid ServerPayload flatbuffer.";
    const auto* payload = verifiedRoot<wire::ServerPayload>(bytes);
    if (payload == nullptr) rejectBuffer(logLine, message);
    SyncProtocol::ServerPayload result;
    result.type = convertPayloadType(payload->type());
    if (payload->data() == nullptr) rejectBuffer(logLine, message);
    result.data = readBytes(payload->data());
    return result;
}

std::vector<SyncProtocol::Delta> deserializeDeltaList(const std::vector<unsigned char>& bytes) {
    const auto* list = verifiedRoot<wire::ServerDeltaList>(bytes);
    if (list == nullptr) {
        rejectBuffer("Error deserializing ServerDeltaList: invalid", "Invalid ServerDeltaList flatbuffer.");
    }
    std::vector<SyncProtocol::Delta> deltas;
    if (list->deltas() == nullptr) return deltas;
    deltas.reserve(list->deltas()->size());
    for (const wire::ServerDeltaWrapper* wrapper : *list->deltas()) {
        if (wrapper->data() == nullptr) {
            rejectBuffer("Error deserializing ServerDeltaWrapper: no data", "Invalid ServerDeltaWrapper flatbuffer.");
        }
        // The nested buffer sits wherever the outer one put its bytes, only
        // 4-byte aligned; its own copy is aligned for its 8-byte scalars.
        deltas.push_back(makeTessarineDelta(readBytes(wrapper->data()), list->sequenceNumber()));
    }
    return deltas;
}

SyncProtocol::Snapshot deserializeSnapshot(const std::vector<unsigned char>& bytes) {
    const auto* snapshot = verifiedRoot<wire::Snapshot>(bytes);
    if (snapshot == nullptr || snapshot->collectionName() == nullptr) rejectSnapshot();
    SyncProtocol::Snapshot result;
    result.collectionName = readText(snapshot->collectionName());
    result.sequenceNumber = snapshot->sequenceNumber();
    result.versionId = snapshot->versionId();
    if (snapshot->objects() != nullptr) {
        result.objects.reserve(snapshot->objects()->size());
        for (const wire::TessarineObject* object : *snapshot->objects()) {
            result.objects.push_back(makeTessarineObject(*object));
        }
    }
    return result;
}

std::vector<unsigned char> makePayloadForSubscription(const SyncProtocol::SubscriptionRequest& request) {
    flatbuffers::FlatBufferBuilder builder(kInitialBuilderSize);
    auto clientId = builder.CreateString(request.clientId);
    auto version = builder.CreateString(request.version);
    auto collectionName = builder.CreateString(request.collectionName);
    wire::SubscriptionRequestBuilder table(builder);
    table.add_clientId(clientId);
    table.add_version(version);
    table.add_sequenceNumber(request.sequenceNumber);
    table.add_collectionName(collectionName);
    builder.Finish(table.Finish());
    return finishedBytes(builder);
}

std::vector<unsigned char> makePayloadForSendDelta(const SyncProtocol::Delta& delta) {
    return makePayloadForSendDelta(delta, 0);
}

std::vector<unsigned char> makePayloadForSendDelta(const SyncProtocol::Delta& delta, uint64_t previousVersionId) {
    const wire::ChangeType type = convertDeltaType(delta.type);
    flatbuffers::FlatBufferBuilder builder(kInitialBuilderSize);

    auto writer = builder.CreateString(delta.clientId);
    wire::VersionMapBuilder entry(builder);
    entry.add_key(writer);
    entry.add_value(delta.versionId);
    std::vector<flatbuffers::Offset<wire::VersionMap>> entries{entry.Finish()};
    auto versionVector = builder.CreateVectorOfSortedTables(&entries);

    auto collectionName = builder.CreateString(delta.collectionName);
    auto primaryKey = builder.CreateString(delta.primaryKey);
    auto sortKey = builder.CreateString(delta.sortKey);
    auto blob = builder.CreateVector(delta.blob);
    auto clientId = builder.CreateString(delta.clientId);

    wire::ServerDeltaBuilder table(builder);
    table.add_type(type);
    table.add_collectionName(collectionName);
    table.add_primaryKey(primaryKey);
    table.add_sortKey(sortKey);
    table.add_versionVector(versionVector);
    table.add_blob(blob);
    table.add_clientId(clientId);
    table.add_previousVersionId(previousVersionId);
    builder.Finish(table.Finish());
    return finishedBytes(builder);
}

std::vector<unsigned char> makePayloadForSnapshotRequest(const std::string& collectionName,
                                                         const std::string& clientId) {
    flatbuffers::FlatBufferBuilder builder(kInitialBuilderSize);
    auto first = builder.CreateString(collectionName);
    auto second = builder.CreateString(clientId);
    wire::SnapshotRequestBuilder table(builder);
    table.add_collectionName(first);
    table.add_clientId(second);
    builder.Finish(table.Finish());
    return finishedBytes(builder);
}

}  // namespace protocol
}  // namespace tessarine
}  // namespace lumivale
