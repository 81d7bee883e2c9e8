// The low-level FlatBuffers rules shared by both ends of the wire (the
// store's tessarine/Protocol.cpp and the server's server/ServerProtocol.cpp):
// the limits a received buffer is verified against, how strings and byte
// vectors are read out of a table, and how a finished buffer is copied out of
// its builder. Internal to this source tree: it needs the generated schema
// header and is not installed.
//
// Threads: pure functions, callable from any thread. Nothing here throws or
// logs; callers decide what a rejected buffer means.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include "tessarine/schema/tessarine_generated.h"

namespace lumivale {
namespace tessarine {
namespace wireformat {

// A received buffer may nest tables this deep and hold this many of them.
constexpr flatbuffers::uoffset_t kMaxDepth = 64;
constexpr flatbuffers::uoffset_t kMaxTables = 1000000;
// What a builder starts with; it grows as needed.
constexpr size_t kInitialBuilderSize = 1024;

// The root table of a whole buffer whose root is Root, or nullptr when the
// buffer does not verify. The data must start at an address aligned for the
// buffer's widest scalar (8 bytes), as heap memory is: the verifier checks
// alignment relative to the buffer's start only, and the tables are then read
// in place.
template <typename Root>
const Root* verifiedRoot(const unsigned char* data, size_t size) {
    // The verifier refuses (by assertion) to look at anything this large.
    if (size >= FLATBUFFERS_MAX_BUFFER_SIZE) return nullptr;
    flatbuffers::Verifier verifier(data, size, kMaxDepth, kMaxTables);
    if (!verifier.VerifyBuffer<Root>(nullptr)) return nullptr;
    return flatbuffers::GetRoot<Root>(data);
}

template <typename Root>
const Root* verifiedRoot(const std::vector<unsigned char>& bytes) {
    return verifiedRoot<Root>(bytes.data(), bytes.size());
}

// Strings travel as counted bytes but are read as C text: the copy ends at
// the first zero byte. An absent string reads as empty.
inline std::string readText(const flatbuffers::String* text) {
    return text == nullptr ? std::string() : std::string(text->c_str());
}

// Present and non-empty once read as text.
inline bool hasText(const flatbuffers::String* text) { return text != nullptr && text->c_str()[0] != '\0'; }

// A byte vector copied whole; an absent one reads as empty.
inline std::vector<unsigned char> readBytes(const flatbuffers::Vector<uint8_t>* bytes) {
    return bytes == nullptr ? std::vector<unsigned char>() : std::vector<unsigned char>(bytes->begin(), bytes->end());
}

// A copy of the builder's finished buffer.
inline std::vector<unsigned char> finishedBytes(const flatbuffers::FlatBufferBuilder& builder) {
    const uint8_t* start = builder.GetBufferPointer();
    return std::vector<unsigned char>(start, start + builder.GetSize());
}

}  // namespace wireformat
}  // namespace tessarine
}  // namespace lumivale
