#include <gtest/gtest.h>

#include <functional>
#include <optional>
#include <random>
#include <set>
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
using DeltaType = SyncProtocol::DeltaType;

namespace {

// The finished buffer whose root table make(builder) creates.
template <typename Make>
Bytes build(Make make) {
    FlatBufferBuilder b;
    b.Finish(make(b));
    return Bytes(b.GetBufferPointer(), b.GetBufferPointer() + b.GetSize());
}

// A ServerDelta as another writer might send it: a null string is left out,
// and so is the version vector when there are no versions.
Bytes serverDelta(const char* collection, const char* primaryKey, int8_t type = 0, const char* writer = nullptr,
                  const std::vector<std::pair<std::string, uint64_t>>& versions = {}) {
    return build([&](FlatBufferBuilder& b) {
        std::vector<Offset<wire::VersionMap>> entries;
        for (auto& [key, value] : versions) entries.push_back(wire::CreateVersionMapDirect(b, key.c_str(), value));
        return wire::CreateServerDeltaDirect(b, wire::ChangeType(type), collection, primaryKey, nullptr,
                                             versions.empty() ? nullptr : &entries, nullptr, writer);
    });
}

// A ServerDeltaList of wrappers around the buffers; nullopt: a wrapper without data.
Bytes deltaList(const std::vector<std::optional<Bytes>>& deltas, uint64_t sequenceNumber = 0) {
    return build([&](FlatBufferBuilder& b) {
        std::vector<Offset<wire::ServerDeltaWrapper>> wrappers;
        for (auto& data : deltas) wrappers.push_back(wire::CreateServerDeltaWrapperDirect(b, data ? &*data : nullptr));
        return wire::CreateServerDeltaListDirect(b, &wrappers, sequenceNumber);
    });
}

Bytes payload(int8_t type, const std::optional<Bytes>& data) {
    return build(
        [&](auto& b) { return wire::CreateServerPayloadDirect(b, wire::PayloadType(type), data ? &*data : nullptr); });
}

using Object = std::tuple<const char*, const char*, Bytes>;  // primary key (null: left out), sort key, blob

Bytes snapshot(const char* name, const std::vector<Object>& objects, uint64_t sequence = 0, uint64_t version = 0) {
    return build([&](FlatBufferBuilder& b) {
        std::vector<Offset<wire::TessarineObject>> tables;
        for (auto& [key, sortKey, blob] : objects)
            tables.push_back(wire::CreateTessarineObjectDirect(b, key, sortKey, &blob));
        return wire::CreateSnapshotDirect(b, name, &tables, sequence, version);
    });
}

const flatbuffers::Table& rootTable(const Bytes& b) { return *flatbuffers::GetRoot<flatbuffers::Table>(b.data()); }

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
    std::string outcome = "no exception";
    try {
        call();
    } catch (const std::runtime_error& error) {
        outcome = error.what();
    }
    for (const auto& line : capture.lines())
        outcome += " | " + std::to_string(line.priority) + "/" + line.tag + ": " + line.message;
    EXPECT_EQ(expected.message + (expected.logLine.empty() ? "" : " | 6/tessarine: " + expected.logLine), outcome);
}

const SyncProtocol::Delta kSample{"0123456789ABCDEF0123456789ABCDEF", "app:notes", 42, "note-1", "2024-01-01",
                                  DeltaType::DELETE, {1, 0, 2, 0}, 0};

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
    Bytes delta = protocol::makePayloadForSendDelta(kSample);
    Bytes snap = snapshot("app:notes", {{"p", "s", {1}}, {"q", "", {}}}, 3, 4);
    return {
        {[](const Bytes& b) { protocol::deserializeServerPayload(b); }, payload(1, snap), kBadPayload},
        {[](const Bytes& b) { protocol::deserializeDeltaList(b); }, deltaList({delta, delta}, 1), kBadList},
        {[](const Bytes& b) { protocol::deserializeSnapshot(b); }, snap, kBadSnapshot},
        {[](const Bytes& b) { protocol::makeTessarineDelta(b, 1); }, delta, kBadDelta},
        {[](const Bytes& b) { protocol::makeTessarineDelta(std::string(b.begin(), b.end()), 1); }, delta, kBadDelta},
    };
}

}  // namespace

TEST(ProtocolTest, OutgoingPayloadsPutEveryFieldAtItsWireId) {
    SyncProtocol::Delta delta = kSample;
    delta.sequenceNumber = 99;  // never travels outward
    const Bytes sent = protocol::makePayloadForSendDelta(delta);
    SyncProtocol::SubscriptionRequest request{"\x01", "app:notes", "CLIENT", 0};
    const Bytes subscription = protocol::makePayloadForSubscription(request);
    const Bytes snapshotRequest = protocol::makePayloadForSnapshotRequest("app:notes", "CLIENT");
    // The vtable offset of field id n is 4 + 2n.
    for (const auto& [buffer, offset, expected] : std::vector<std::tuple<const Bytes*, int, std::string>>{
             {&sent, 6, "app:notes"}, {&sent, 8, "note-1"}, {&sent, 10, "2024-01-01"}, {&sent, 16, delta.clientId},
             {&subscription, 4, "CLIENT"}, {&subscription, 6, "\x01"}, {&subscription, 10, "app:notes"},
             {&snapshotRequest, 4, "app:notes"}, {&snapshotRequest, 6, "CLIENT"}}) {
        EXPECT_EQ(expected, rootTable(*buffer).GetPointer<const flatbuffers::String*>(offset)->str()) << offset;
    }
    EXPECT_FALSE(rootTable(sent).CheckField(18));  // no sequence number
    EXPECT_EQ(1, rootTable(sent).GetField<int8_t>(4, 0));  // DELETE
    const auto* blob = rootTable(sent).GetPointer<const flatbuffers::Vector<uint8_t>*>(14);
    EXPECT_EQ(delta.blob, Bytes(blob->begin(), blob->end()));
    const auto* versions = flatbuffers::GetRoot<wire::ServerDelta>(sent.data())->versionVector();
    ASSERT_EQ(1u, versions->size());
    EXPECT_EQ(delta.clientId, versions->Get(0)->key()->str());
    EXPECT_EQ(42u, versions->Get(0)->value());
    EXPECT_FALSE(rootTable(subscription).CheckField(8));  // sequence number 0 is not written
    request.sequenceNumber = 123456789012345ull;
    EXPECT_EQ(123456789012345ull, rootTable(protocol::makePayloadForSubscription(request)).GetField<uint64_t>(8, 0));
}

TEST(ProtocolTest, DeltasReadBackWithTheListsSequenceNumberStringsCutAtZeroAndTheWritersVersionFoundByKey) {
    const std::string zero("ab\0d", 4);
    SyncProtocol::Delta first = kSample, second{"", "app:notes", 3, zero, zero, DeltaType::SAVE, {}, 0};
    const Bytes secondBuffer = protocol::makePayloadForSendDelta(second);
    EXPECT_EQ(4u, flatbuffers::GetRoot<wire::ServerDelta>(secondBuffer.data())->primaryKey()->size());  // written whole
    std::vector<SyncProtocol::Delta> deltas =
        protocol::deserializeDeltaList(deltaList({protocol::makePayloadForSendDelta(first), secondBuffer}, 7));
    ASSERT_EQ(2u, deltas.size());
    first.sequenceNumber = second.sequenceNumber = 7;
    second.primaryKey = second.sortKey = "ab";  // read as text, cut at the first zero byte; blobs arrive whole
    EXPECT_EQ(fieldsOf(first), fieldsOf(deltas[0]));
    EXPECT_EQ(fieldsOf(second), fieldsOf(deltas[1]));
    EXPECT_TRUE(protocol::deserializeDeltaList(build([](auto& b) { return wire::CreateServerDeltaList(b); })).empty());

    SyncProtocol::Delta bare{"", "a:b", 0, "pk", "", DeltaType::SAVE, {}, 8};  // what other writers leave out is empty
    const Bytes bareBuffer = serverDelta("a:b", "pk");
    const std::string bareText(bareBuffer.begin(), bareBuffer.end());  // the overload for a string
    EXPECT_EQ(fieldsOf(bare), fieldsOf(protocol::makeTessarineDelta(bareText, 8)));
    const std::vector<std::pair<std::string, uint64_t>> versions{
        {"CLIENT_Z", 90}, {"CLIENT_A", 10}, {"CLIENT_C", 30}, {"CLIENT_B", 20}, {"CLIENT_D", 40}};
    for (const auto& [writer, version] : std::vector<std::pair<const char*, uint64_t>>{
             {"CLIENT_C", 30}, {"CLIENT_Z", 90}, {"CLIENT_E", 0}, {nullptr, 0}}) {
        EXPECT_EQ(version, protocol::makeTessarineDelta(serverDelta("a:b", "pk", 0, writer, versions), 0).versionId)
            << (writer ? writer : "no writer");
    }
    // 64 bits on every ABI: these fail where a value passes through a 32-bit
    // type (long or size_t on armeabi-v7a, the armhf configuration).
    for (uint64_t wide : std::vector<uint64_t>{1ull << 32, (0xFFFFFFFFull << 16) + 7, (1ull << 63) + 1, UINT64_MAX}) {
        SyncProtocol::Delta delta{"", "a:b", wide, "pk", "", DeltaType::SAVE, {}, 0};
        SyncProtocol::Delta read = protocol::makeTessarineDelta(protocol::makePayloadForSendDelta(delta), wide - 1);
        EXPECT_EQ(std::make_pair(wide, wide - 1), std::make_pair(read.versionId, read.sequenceNumber));
    }
}

TEST(ProtocolTest, SnapshotsAndPayloadsKeepObjectOrderAndBytesWhole) {
    const Bytes zeroBytes{'a', 'b', 0, 'd'};
    SyncProtocol::Snapshot read = protocol::deserializeSnapshot(
        snapshot("app:x", {{"k2", "b", zeroBytes}, {"k1", "", {}}, {"k3", "c", {3}}}, 77, 12));
    EXPECT_EQ(std::make_tuple(std::string("app:x"), uint64_t{77}, uint64_t{12}),
              std::make_tuple(read.collectionName, read.sequenceNumber, read.versionId));
    ASSERT_EQ(3u, read.objects.size());
    EXPECT_EQ(std::make_tuple(std::string("k2"), std::string("b"), zeroBytes),
              std::make_tuple(read.objects[0].primaryKey, read.objects[0].sortKey, read.objects[0].blob));
    EXPECT_EQ((Bytes{3}), read.objects[2].blob);
    read = protocol::deserializeSnapshot(build([](auto& b) { return wire::CreateSnapshotDirect(b, "app:notes"); }));
    EXPECT_EQ(std::make_tuple(std::string("app:notes"), size_t{0}, uint64_t{0}, uint64_t{0}),
              std::make_tuple(read.collectionName, read.objects.size(), read.sequenceNumber, read.versionId));

    SyncProtocol::ServerPayload list = protocol::deserializeServerPayload(payload(0, zeroBytes));
    EXPECT_EQ(SyncProtocol::PayloadType::DELTA_LIST, list.type);
    EXPECT_EQ(zeroBytes, list.data);
    EXPECT_EQ(SyncProtocol::PayloadType::SNAPSHOT, protocol::deserializeServerPayload(payload(1, zeroBytes)).type);
}

TEST(ProtocolTest, EveryBadInputFailsWholeWithItsOwnMessageAndLogLine) {
    const Bytes good = protocol::makePayloadForSendDelta(kSample);
    SyncProtocol::Delta badType = kSample;
    badType.type = static_cast<DeltaType>(3);
    const std::vector<std::pair<std::function<void()>, Failure>> cases{
        {[&] { protocol::deserializeDeltaList(deltaList({good, good, std::nullopt})); }, kNoData},
        // The list verifies; each nested delta is verified on its own.
        {[&] { protocol::deserializeDeltaList(deltaList({good, Bytes(good.begin(), good.end() - 8)})); }, kBadDelta},
        {[&] { protocol::deserializeDeltaList(deltaList({good, serverDelta("a:b", "pk", 2)})); }, kBadDeltaType},
        {[] { protocol::makeTessarineDelta(serverDelta(nullptr, "pk"), 0); }, kBadDelta},
        {[] { protocol::makeTessarineDelta(serverDelta("a:b", nullptr), 0); }, kBadDelta},
        {[] { protocol::deserializeSnapshot(snapshot(nullptr, {})); }, kBadSnapshot},
        {[] { protocol::deserializeSnapshot(snapshot("a:b", {{"a", "", {}}, {nullptr, "", {}}})); }, kBadSnapshot},
        {[] { protocol::deserializeServerPayload(payload(1, std::nullopt)); }, kBadPayload},
        {[] { protocol::deserializeServerPayload(payload(2, Bytes{1})); }, kBadPayloadType},
        {[&] { protocol::makePayloadForSendDelta(badType); }, kBadDeltaType},
    };
    for (size_t i = 0; i < cases.size(); ++i) {
        SCOPED_TRACE("case " + std::to_string(i));
        expectFailure(cases[i].first, cases[i].second);
    }
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
        return build([&](FlatBufferBuilder& b) {
            auto shared = wire::CreateServerDeltaWrapper(b);
            b.StartVector(wrappers, sizeof(flatbuffers::uoffset_t));
            for (size_t i = 0; i < wrappers; ++i) b.PushElement(shared);
            return wire::CreateServerDeltaList(b, b.EndVector(wrappers));
        });
    };
    expectFailure([&] { protocol::deserializeDeltaList(listOf(999999)); }, kNoData);
    expectFailure([&] { protocol::deserializeDeltaList(listOf(1000000)); }, kBadList);
}

TEST(ProtocolTest, RandomlyCorruptedBuffersOnlyEverThrowTheDocumentedErrors) {
    std::set<std::string> messages, logLines{""};
    for (const Failure& f : {kBadPayload, kBadList, kNoData, kBadDelta, kBadSnapshot, kBadDeltaType, kBadPayloadType}) {
        messages.insert(f.message);
        logLines.insert(f.logLine);
    }
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
                EXPECT_EQ(1u, messages.count(error.what())) << error.what();
            }
        }
    }
    for (const auto& line : capture.lines()) EXPECT_EQ(1u, logLines.count(line.message)) << line.message;
    EXPECT_GT(accepted, 0);
    EXPECT_GT(rejected, 0);
}
