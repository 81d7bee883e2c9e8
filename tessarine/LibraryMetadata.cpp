#include "tessarine/LibraryMetadata.h"

#include <chrono>
#include <cstdio>
#include <random>

#include "platform/ThreadAnnotations.h"

namespace lumivale {
namespace tessarine {

const std::string LibraryMetadata::KEY_CLIENT_UUID = "client_id";
const std::string LibraryMetadata::KEY_VERSION = "version";

namespace {

// Seeded from the C++ runtime's default random source. No token is named:
// its meaning belongs to the runtime (libstdc++ knows "default", libc++, as
// the Android NDK ships it, takes a device path and fails on that word).
struct RandomSource {
    RandomSource() : engine(std::random_device()()) {}
    Mutex mutex;
    std::mt19937 engine TS_GUARDED_BY(mutex);
    std::uniform_int_distribution<uint32_t> distribution TS_GUARDED_BY(mutex){0, 4294967295u};
};

RandomSource& processRandomSource() {
    static RandomSource source;
    return source;
}

void appendHex8(std::string& text, uint32_t value) {
    char digits[9];
    std::snprintf(digits, sizeof digits, "%08X", static_cast<unsigned>(value));
    text.append(digits, 8);
}

}  // namespace

LibraryMetadata::LibraryMetadata(std::shared_ptr<LibraryMetadataStorage> theStorage) : storage(std::move(theStorage)) {
    init();
}

LibraryMetadata::~LibraryMetadata() = default;

void LibraryMetadata::init() {
    storage->createDbTableIfNecessary();
    initClientUuid();
    initVersion();
}

void LibraryMetadata::initClientUuid() {
    try {
        storage->getString(KEY_CLIENT_UUID);
    } catch (const LibraryMetadataStorage::KeyNotFoundError&) {
        storage->setString(KEY_CLIENT_UUID, generateClientUuid());
    }
}

void LibraryMetadata::initVersion() {
    try {
        storage->getString(KEY_VERSION);
    } catch (const LibraryMetadataStorage::KeyNotFoundError&) {
        storage->setInt64(KEY_VERSION, CURRENT_VERSION);
    }
}

std::string LibraryMetadata::generateClientUuid() {
    auto nanoseconds = std::chrono::duration_cast<std::chrono::nanoseconds>(
        std::chrono::system_clock::now().time_since_epoch()).count();
    std::string id;
    id.reserve(32);
    appendHex8(id, static_cast<uint32_t>(nanoseconds / 1000000000));
    for (int i = 0; i < 3; ++i) appendHex8(id, generateRandom32());
    return id;
}

uint32_t LibraryMetadata::generateRandom32() {
    RandomSource& source = processRandomSource();
    MutexLock lock(source.mutex);
    return source.distribution(source.engine);
}

std::string LibraryMetadata::getClientUuid() const { return storage->getString(KEY_CLIENT_UUID); }

uint32_t LibraryMetadata::getVersion() const { return static_cast<uint32_t>(storage->getInt64(KEY_VERSION)); }

bool LibraryMetadata::needsUpdate() const { return getVersion() < CURRENT_VERSION; }

}  // namespace tessarine
}  // namespace lumivale
