// The store's identity and data version, created once in "library_metadata"
// when a database is first opened and never replaced afterwards.
//
// The client id is 32 upper-case hexadecimal digits: the Unix time in seconds
// (low 32 bits), then three draws of generateRandom32, 8 digits each.
//
// Threads: any thread; the process-wide random source is guarded by a lock of
// its own, so stores may be opened on several threads at once. Errors:
// SQLiteException passes through; the getters throw KeyNotFoundError if the
// rows were removed.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "tessarine/LibraryMetadataStorage.h"

namespace lumivale {
namespace tessarine {

class LibraryMetadata {
public:
    static const std::string KEY_CLIENT_UUID;  // "client_id"
    static const std::string KEY_VERSION;      // "version"
    static constexpr uint32_t CURRENT_VERSION = 1;

    // Creates the table and whichever of the two rows is missing.
    explicit LibraryMetadata(std::shared_ptr<LibraryMetadataStorage> storage);
    virtual ~LibraryMetadata();

    std::string getClientUuid() const;  // read from the table at every call
    uint32_t getVersion() const;        // low 32 bits of the stored number
    bool needsUpdate() const;           // stored version below the current one

    // Builds a fresh client id; the store keeps only the first it makes.
    std::string generateClientUuid();

    // Next value of the process-wide random source (virtual so that a
    // subclass can supply fixed values).
    virtual uint32_t generateRandom32();

private:
    void init();
    void initClientUuid();
    void initVersion();

    std::shared_ptr<LibraryMetadataStorage> storage;
};

}  // namespace tessarine
}  // namespace lumivale
