#include <gtest/gtest.h>

#include <algorithm>
#include <functional>
#include <optional>
#include <random>
#include <stdexcept>
#include <string>
#include <tuple>
#include <vector>

#include "TestSupport.h"
#include "tessarine/Protocol.h"
#include "tessarine/schema/tessarine_generated.h"

namespace protocol = lumivale::tessarine::protocol;
namespace wire = ::tessarine::wire;
using lumivale::tessarine::SyncProtocol;
using Bytes = std::vector<unsigned char>;
using flatbuffers::FlatBufferBuilder;
using flatbuffers::Offset;
using Text = std::optional<std::string>;

namespace {

Bytes finished(FlatBufferBuilder& builder) {
    return Bytes(builder.GetBufferPointer(), builder.GetBufferPointer() + builder.GetSize());
}

Offset<flatbuffers::String> text(FlatBufferBuilder& builder, const Text& value) {
    return value ? builder.CreateString(*value) : 0;
}

// A ServerDelta buffer holding exactly the fields that are set.
struct DeltaFields {
    Text collectionName = std::string("app:notes"), primaryKey = std::string("pk"), sortKey, clientId;
    std::optional<std::vector<std::pair<std::string, uint64_t>>> versions;
    std::optional<Bytes> blob;
    int8_t type = 0;
};

Bytes serverDeltaBuffer(const DeltaFields& f) {
    FlatBufferBuilder b;
    Offset<flatbuffers::Vector<Offset<wire::VersionMap>>> versions;
    if (f.versions) {
        std::vector<Offset<wire::VersionMap>> entries;
        for (const auto& [key, value] : *f.versions)
            entries.push_back(wire::CreateVersionMap(b, b.CreateString(key), value));
        versions = b.CreateVectorOfSortedTables(&entries);
    }
    auto blob = f.blob ? b.CreateVector(*f.blob) : 0;
    b.Finish(wire::CreateServerDelta(b, static_cast<wire::ChangeType>(f.type), text(b, f.collectionName),
                                     text(b, f.primaryKey), text(b, f.sortKey), versions, blob, text(b, f.clientId)));
    return finished(b);
}

// A ServerDeltaList of wrappers around the given buffers; nullopt makes a
// wrapper without data.
Bytes deltaListBuffer(const std::vector<std::optional<Bytes>>& deltas, uint64_t sequenceNumber) {
    FlatBufferBuilder b;
    std::vector<Offset<wire::ServerDeltaWrapper>> wrappers;
    for (const auto& data : deltas)
        wrappers.push_back(wire::CreateServerDeltaWrapper(b, data ? b.CreateVector(*data) : 0));
    b.Finish(wire::CreateServerDeltaList(b, b.CreateVector(wrappers), sequenceNumber));
    return finished(b);
}

Bytes payloadBuffer(int8_t type, const std::optional<Bytes>& data) {
    FlatBufferBuilder b;
    auto vector = data ? b.CreateVector(*data) : 0;
    b.Finish(wire::CreateServerPayload(b, static_cast<wire::PayloadType>(type), vector));
    return finished(b);
}

struct ObjectFields {
    Text primaryKey;
    std::string sortKey;
    Bytes blob;
};

Bytes snapshotBuffer(const Text& name, const std::vector<ObjectFields>& objects, uint64_t sequence, uint64_t version) {
    FlatBufferBuilder b;
    std::vector<Offset<wire::TessarineObject>> tables;
    for (const auto& o : objects) {
        tables.push_back(
            wire::CreateTessarineObject(b, text(b, o.primaryKey), b.CreateString(o.sortKey), b.CreateVector(o.blob)));
    }
    b.Finish(wire::CreateSnapshot(b, text(b, name), b.CreateVector(tables), sequence, version));
    return finished(b);
}

const flatbuffers::Table& rootTable(const Bytes& buffer) {
    return *flatbuffers::GetRoot<flatbuffers::Table>(buffer.data());
}

std::string stringAt(const flatbuffers::Table& table, flatbuffers::voffset_t offset) {
    return table.GetPointer<const flatbuffers::String*>(offset)->str();
}

// The documented errors: the exception's message and the line logged before it.
struct Failure {
    std::string message, logLine;
};
const Failure kBadPayload{"Invalid ServerPayload flatbuffer.", "Error deserializing ServerPayload: invalid"};
const Failure kBadList{"Invalid ServerDeltaList flatbuffer.", "Error deserializing ServerDeltaList: invalid"};
const Failure kNoData{"Invalid ServerDeltaWrapper flatbuffer.", "Error deserializing ServerDeltaWrapper: no data"};
const Failure kBadDelta{"Invalid ServerDelta flatbuffer.", "Error deserializing ServerDelta: invalid"};
const Failure kBadSnapshot{"Invalid Snapshot flatbuffer.", "Error deserializing Snapshot: invalid"};
const Failure kBadDeltaType{"Invalid SyncProtocol::DeltaType", ""};  // enum errors log nothing
const Failure kBadPayloadType{"Invalid SyncProtocol::PayloadType", ""};

// call must throw std::runtime_error(expected.message) after logging exactly
// expected.logLine at priority 6 under "tessarine" (or nothing at all).
void expectFailure(const std::function<void()>& call, const Failure& expected) {
    testsupport::LogCapture capture;
    try {
        call();
        ADD_FAILURE() << "no exception, expected: " << expected.message;
    } catch (const std::runtime_error& error) {
        EXPECT_EQ(expected.message, error.what());
    }
    auto lines = capture.lines();
    ASSERT_EQ(expected.logLine.empty() ? 0u : 1u, lines.size());
    if (lines.empty()) return;
    EXPECT_EQ(6, lines[0].priority);
    EXPECT_EQ("tessarine", lines[0].tag);
    EXPECT_EQ(expected.logLine, lines[0].message);
}

SyncProtocol::Delta sampleDelta() {
    SyncProtocol::Delta delta;
    delta.clientId = "0123456789ABCDEF0123456789ABCDEF";
    delta.collectionName = "app:notes";
    delta.versionId = 42;
    delta.primaryKey = "note-1";
    delta.sortKey = "2024-01-01";
    delta.type = SyncProtocol::DeltaType::DELETE;
    delta.blob = {1, 0, 2, 0};
    return delta;
}

auto fieldsOf(const SyncProtocol::Delta& d) {
    return std::make_tuple(d.clientId, d.collectionName, d.versionId, d.primaryKey, d.sortKey, static_cast<int>(d.type),
                           d.blob, d.sequenceNumber);
}

// Every reader with a valid buffer for it and the error it gives for a bad one.
struct Reader {
    std::function<void(const Bytes&)> read;
    Bytes valid;
    Failure failure;
};

std::vector<Reader> allReaders() {
    Bytes delta = protocol::makePayloadForSendDelta(sampleDelta());
    Bytes snapshot =
        snapshotBuffer(std::string("app:notes"), {{std::string("p"), "s", {1}}, {std::string("q"), "", {}}}, 3, 4);
    return {
        {[](const Bytes& b) { protocol::deserializeServerPayload(b); }, payloadBuffer(1, snapshot), kBadPayload},
        {[](const Bytes& b) { protocol::deserializeDeltaList(b); }, deltaListBuffer({delta, delta}, 1), kBadList},
        {[](const Bytes& b) { protocol::deserializeSnapshot(b); }, snapshot, kBadSnapshot},
        {[](const Bytes& b) { protocol::makeTessarineDelta(b, 1); }, delta, kBadDelta},
        {[](const Bytes& b) { protocol::makeTessarineDelta(std::string(b.begin(), b.end()), 1); }, delta, kBadDelta},
    };
}

}  // namespace

TEST(ProtocolTest, SendDeltaWritesEveryFieldAtItsVtableOffsetAndLeavesDefaultsOut) {
    SyncProtocol::Delta delta = sampleDelta();
    delta.sequenceNumber = 99;  // never travels outward
    Bytes buffer = protocol::makePayloadForSendDelta(delta);
    const flatbuffers::Table& table = rootTable(buffer);
    EXPECT_EQ(1, table.GetField<int8_t>(4, 0));
    EXPECT_EQ("app:notes", stringAt(table, 6));
    EXPECT_EQ("note-1", stringAt(table, 8));
    EXPECT_EQ("2024-01-01", stringAt(table, 10));
    const auto* blob = table.GetPointer<const flatbuffers::Vector<uint8_t>*>(14);
    EXPECT_EQ(delta.blob, Bytes(blob->begin(), blob->end()));
    EXPECT_EQ(delta.clientId, stringAt(table, 16));
    EXPECT_FALSE(table.CheckField(18));
    const auto* versions = flatbuffers::GetRoot<wire::ServerDelta>(buffer.data())->versionVector();
    ASSERT_EQ(1u, versions->size());
    EXPECT_EQ(delta.clientId, versions->Get(0)->key()->str());
    EXPECT_EQ(42u, versions->Get(0)->value());

    delta.type = SyncProtocol::DeltaType::SAVE;
    delta.versionId = 0;
    buffer = protocol::makePayloadForSendDelta(delta);
    EXPECT_FALSE(rootTable(buffer).CheckField(4));
    const auto* entry = flatbuffers::GetRoot<wire::ServerDelta>(buffer.data())->versionVector()->Get(0);
    EXPECT_FALSE(reinterpret_cast<const flatbuffers::Table*>(entry)->CheckField(6));
    SyncProtocol::Delta back = protocol::makeTessarineDelta(buffer, 5);
    EXPECT_EQ(SyncProtocol::DeltaType::SAVE, back.type);
    EXPECT_EQ(0u, back.versionId);
    EXPECT_EQ(5u, back.sequenceNumber);

    delta.type = static_cast<SyncProtocol::DeltaType>(3);
    expectFailure([&] { protocol::makePayloadForSendDelta(delta); }, kBadDeltaType);
}

TEST(ProtocolTest, SentDeltaWrappedInListReadsBackWholeWithListSequenceNumber) {
    SyncProtocol::Delta first = sampleDelta();
    SyncProtocol::Delta second;
    second.collectionName = "app:notes";
    second.primaryKey = "note-2";
    second.versionId = 3;
    Bytes firstBuffer = protocol::makePayloadForSendDelta(first);
    std::vector<SyncProtocol::Delta> deltas = protocol::deserializeDeltaList(
        deltaListBuffer({firstBuffer, protocol::makePayloadForSendDelta(second), firstBuffer}, 7));
    ASSERT_EQ(3u, deltas.size());
    first.sequenceNumber = second.sequenceNumber = 7;
    EXPECT_EQ(fieldsOf(first), fieldsOf(deltas[0]));
    EXPECT_EQ(fieldsOf(second), fieldsOf(deltas[1]));
    EXPECT_EQ(fieldsOf(first), fieldsOf(deltas[2]));

    FlatBufferBuilder builder;
    builder.Finish(wire::CreateServerDeltaList(builder));  // no deltas vector at all
    EXPECT_TRUE(protocol::deserializeDeltaList(finished(builder)).empty());
}

TEST(ProtocolTest, DeltaListFailsWholeOnWrapperWithoutDataBadNestedDeltaOrBadType) {
    Bytes good = protocol::makePayloadForSendDelta(sampleDelta());
    expectFailure([&] { protocol::deserializeDeltaList(deltaListBuffer({good, good, std::nullopt}, 1)); }, kNoData);
    // The list itself verifies; each nested delta is verified on its own.
    Bytes truncated(good.begin(), good.begin() + good.size() / 2);
    expectFailure([&] { protocol::deserializeDeltaList(deltaListBuffer({good, truncated}, 1)); }, kBadDelta);
    expectFailure([&] { protocol::deserializeDeltaList(deltaListBuffer({good, Bytes{}}, 1)); }, kBadDelta);
    DeltaFields typeTwo;
    typeTwo.type = 2;
    Bytes list = deltaListBuffer({good, serverDeltaBuffer(typeTwo)}, 1);
    expectFailure([&] { protocol::deserializeDeltaList(list); }, kBadDeltaType);
}

TEST(ProtocolTest, GarbageOrTruncatedBuffersFailWithTheirTablesMessage) {
    for (const Reader& reader : allReaders()) {
        ASSERT_NO_THROW(reader.read(reader.valid));
        const Bytes& valid = reader.valid;
        for (const Bytes& bytes : {Bytes{}, Bytes{0xff, 0xff, 0xff, 0x7f, 0, 0, 0, 0}, Bytes(64, 0xee),
                                   Bytes(valid.begin(), valid.begin() + 3),  // shorter than the root offset
                                   Bytes(valid.begin(), valid.begin() + valid.size() / 2)}) {
            SCOPED_TRACE(reader.failure.message + " " + std::to_string(bytes.size()) + " bytes");
            expectFailure([&] { reader.read(bytes); }, reader.failure);
        }
    }
}

TEST(ProtocolTest, TableLimitOfOneMillionIsEnforcedExactly) {
    // All wrapper offsets point at one wrapper without data: the list passes
    // verification (and fails on that wrapper) only while the list and its
    // wrappers are at most 1000000 tables.
    auto listOf = [](size_t wrappers) {
        FlatBufferBuilder builder;
        auto shared = wire::CreateServerDeltaWrapper(builder);
        builder.StartVector(wrappers, sizeof(flatbuffers::uoffset_t));
        for (size_t i = 0; i < wrappers; ++i) builder.PushElement(shared);
        builder.Finish(wire::CreateServerDeltaList(builder, builder.EndVector(wrappers)));
        return finished(builder);
    };
    expectFailure([&] { protocol::deserializeDeltaList(listOf(999999)); }, kNoData);
    expectFailure([&] { protocol::deserializeDeltaList(listOf(1000000)); }, kBadList);
}

TEST(ProtocolTest, WriterVersionIsFoundByKeyAmongSeveralClients) {
    DeltaFields fields;
    fields.versions = {{{"CLIENT_Z", 90}, {"CLIENT_A", 10}, {"CLIENT_C", 30}, {"CLIENT_B", 20}, {"CLIENT_D", 40}}};
    for (auto [writer, version] : std::vector<std::pair<Text, uint64_t>>{{std::string("CLIENT_C"), 30},
                                                                         {std::string("CLIENT_Z"), 90},
                                                                         {std::string("CLIENT_E"), 0},
                                                                         {std::nullopt, 0}}) {
        fields.clientId = writer;
        EXPECT_EQ(version, protocol::makeTessarineDelta(serverDeltaBuffer(fields), 0).versionId)
            << writer.value_or("-");
    }
}

TEST(ProtocolTest, AbsentFieldsAreRejectedOrReadAsEmpty) {
    DeltaFields fields;
    fields.collectionName.reset();
    expectFailure([&] { protocol::makeTessarineDelta(serverDeltaBuffer(fields), 0); }, kBadDelta);
    expectFailure([&] { protocol::deserializeDeltaList(deltaListBuffer({serverDeltaBuffer(fields)}, 0)); }, kBadDelta);
    fields = DeltaFields();
    fields.primaryKey.reset();
    expectFailure([&] { protocol::makeTessarineDelta(serverDeltaBuffer(fields), 0); }, kBadDelta);
    SyncProtocol::Delta expected;
    expected.collectionName = "app:notes";
    expected.primaryKey = "pk";
    expected.sequenceNumber = 8;
    EXPECT_EQ(fieldsOf(expected), fieldsOf(protocol::makeTessarineDelta(serverDeltaBuffer(DeltaFields()), 8)));

    expectFailure([&] { protocol::deserializeSnapshot(snapshotBuffer(std::nullopt, {}, 1, 1)); }, kBadSnapshot);
    Bytes keyless = snapshotBuffer(std::string("a:b"), {{std::string("a"), "", {}}, {std::nullopt, "", {}}}, 1, 1);
    expectFailure([&] { protocol::deserializeSnapshot(keyless); }, kBadSnapshot);
    FlatBufferBuilder builder;
    builder.Finish(wire::CreateSnapshot(builder, builder.CreateString("app:notes")));
    SyncProtocol::Snapshot empty = protocol::deserializeSnapshot(finished(builder));
    EXPECT_EQ(std::make_tuple(std::string("app:notes"), size_t{0}, uint64_t{0}, uint64_t{0}),
              std::make_tuple(empty.collectionName, empty.objects.size(), empty.sequenceNumber, empty.versionId));

    expectFailure([&] { protocol::deserializeServerPayload(payloadBuffer(1, std::nullopt)); }, kBadPayload);
}

TEST(ProtocolTest, SnapshotObjectsKeepOrderAndStringsArriveCutAtFirstZeroByte) {
    const std::string zero("ab\0d", 4);
    const Bytes zeroBytes(zero.begin(), zero.end());
    SyncProtocol::Snapshot snapshot = protocol::deserializeSnapshot(snapshotBuffer(
        zero, {{std::string("k2"), zero, zeroBytes}, {zero, "b", {}}, {std::string("k3"), "c", {3}}}, 77, 12));
    EXPECT_EQ("ab", snapshot.collectionName);
    EXPECT_EQ(77u, snapshot.sequenceNumber);
    EXPECT_EQ(12u, snapshot.versionId);
    ASSERT_EQ(3u, snapshot.objects.size());
    EXPECT_EQ(std::make_tuple(std::string("k2"), std::string("ab"), zeroBytes),
              std::make_tuple(snapshot.objects[0].primaryKey, snapshot.objects[0].sortKey, snapshot.objects[0].blob));
    EXPECT_EQ("ab", snapshot.objects[1].primaryKey);
    EXPECT_EQ((Bytes{3}), snapshot.objects[2].blob);

    SyncProtocol::Delta delta = sampleDelta();
    delta.primaryKey = delta.sortKey = zero;
    delta.blob = zeroBytes;
    Bytes buffer = protocol::makePayloadForSendDelta(delta);
    EXPECT_EQ(4u, flatbuffers::GetRoot<wire::ServerDelta>(buffer.data())->primaryKey()->size());  // written whole
    for (const SyncProtocol::Delta& back : {protocol::makeTessarineDelta(std::string(buffer.begin(), buffer.end()), 0),
                                            protocol::deserializeDeltaList(deltaListBuffer({buffer}, 0)).at(0)}) {
        EXPECT_EQ(std::make_tuple(std::string("ab"), std::string("ab"), zeroBytes),
                  std::make_tuple(back.primaryKey, back.sortKey, back.blob));
    }
}

TEST(ProtocolTest, PayloadAndChangeTypesConvertAndOthersAreRejectedWithoutLog) {
    Bytes inner = {9, 0, 8};
    SyncProtocol::ServerPayload payload = protocol::deserializeServerPayload(payloadBuffer(0, inner));
    EXPECT_EQ(SyncProtocol::PayloadType::DELTA_LIST, payload.type);
    EXPECT_EQ(inner, payload.data);
    EXPECT_EQ(SyncProtocol::PayloadType::SNAPSHOT, protocol::deserializeServerPayload(payloadBuffer(1, inner)).type);
    for (int8_t type : {5, 2, -1}) {
        expectFailure([&] { protocol::deserializeServerPayload(payloadBuffer(type, inner)); }, kBadPayloadType);
    }
    EXPECT_EQ(SyncProtocol::DeltaType::DELETE, protocol::convertChangeType(wire::ChangeType_DELETE));
    EXPECT_EQ(wire::ChangeType_DELETE, protocol::convertDeltaType(SyncProtocol::DeltaType::DELETE));
    expectFailure([] { protocol::convertChangeType(static_cast<wire::ChangeType>(-1)); }, kBadDeltaType);
}

TEST(ProtocolTest, RequestPayloadsCarryEveryFieldAtItsId) {
    SyncProtocol::SubscriptionRequest request;
    request.version = std::string(1, '\x01');
    request.collectionName = "app:notes";
    request.clientId = "0123456789ABCDEF0123456789ABCDEF";
    Bytes buffer = protocol::makePayloadForSubscription(request);
    EXPECT_EQ(request.clientId, stringAt(rootTable(buffer), 4));
    EXPECT_EQ(request.version, stringAt(rootTable(buffer), 6));
    EXPECT_FALSE(rootTable(buffer).CheckField(8));  // sequence number 0 is not written
    EXPECT_EQ(request.collectionName, stringAt(rootTable(buffer), 10));
    request.sequenceNumber = 123456789012345ull;
    buffer = protocol::makePayloadForSubscription(request);
    EXPECT_EQ(123456789012345ull, flatbuffers::GetRoot<wire::SubscriptionRequest>(buffer.data())->sequenceNumber());

    buffer = protocol::makePayloadForSnapshotRequest("app:notes", "CLIENT");
    EXPECT_EQ("app:notes", stringAt(rootTable(buffer), 4));
    EXPECT_EQ("CLIENT", stringAt(rootTable(buffer), 6));
    EXPECT_FALSE(rootTable(buffer).CheckField(8));
}

TEST(ProtocolTest, RandomlyCorruptedBuffersOnlyEverThrowTheDocumentedErrors) {
    const std::vector<Failure> documented = {kBadPayload,  kBadList,      kNoData,        kBadDelta,
                                             kBadSnapshot, kBadDeltaType, kBadPayloadType};
    auto isDocumented = [&](const std::string& text, std::string Failure::*field) {
        return std::any_of(documented.begin(), documented.end(), [&](const Failure& f) { return f.*field == text; });
    };
    std::vector<Reader> readers = allReaders();
    std::mt19937 rng(20240611);
    int accepted = 0, rejected = 0;
    testsupport::LogCapture capture;
    for (int round = 0; round < 3000; ++round) {
        Bytes bytes = readers[round % readers.size()].valid;
        for (int flips = 1 + rng() % 3; flips > 0; --flips) bytes[rng() % bytes.size()] = rng() & 0xff;
        if (rng() % 8 == 0) bytes.resize(rng() % bytes.size());
        for (const Reader& reader : readers) {
            try {
                reader.read(bytes);
                ++accepted;
            } catch (const std::runtime_error& error) {
                ++rejected;
                EXPECT_TRUE(isDocumented(error.what(), &Failure::message)) << error.what();
            }
        }
    }
    for (const auto& line : capture.lines()) EXPECT_TRUE(isDocumented(line.message, &Failure::logLine)) << line.message;
    EXPECT_GT(accepted, 0);
    EXPECT_GT(rejected, 0);
}
