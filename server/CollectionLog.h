// The sync server's record of one collection: the log of accepted changes,
// numbered with sequence numbers 1, 2, 3, ..., the objects as those changes
// left them, and for each client the highest version id accepted from it.
//
// A change is accepted once per (client id, version id): offering it again
// changes nothing and returns the change as first logged, so that the server
// can echo it. A save replaces the object, a delete removes it (a delete of an
// object that does not exist is still a change in the log).
//
// Threads: none of its own, no lock; the SyncServer guards it.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

class CollectionLog {
public:
    struct Acceptance {
        // False when the change had been accepted before; nothing changed.
        bool isNew = false;
        // The change as logged, with its sequence number.
        SyncProtocol::Delta change;
    };

    explicit CollectionLog(std::string collectionName);

    // Accepts the change (its collection name is this log's) unless its
    // (clientId, versionId) was accepted before.
    Acceptance accept(const SyncProtocol::Delta& change);

    // The logged changes with sequence numbers above sequenceNumber that a
    // client needs to catch up, in sequence order: the last change of each
    // object, and every change of clientId itself. Other clients' changes
    // that a later change of the same object supersedes are left out.
    //
    // Why: a store may ask from a number older than what it has applied (its
    // deliveries were still being applied when it reconnected). It would
    // then apply an older change of another client over its own newer one,
    // which the echo of its own change, already retired, does not restore.
    // Its own changes stay in: until a store sees the echo of a change, it
    // keeps its local version over the changes of others.
    std::vector<SyncProtocol::Delta> catchUpAfter(uint64_t sequenceNumber, const std::string& clientId) const;

    // The current objects, the last sequence number and clientId's highest
    // accepted version id.
    SyncProtocol::Snapshot snapshotFor(const std::string& clientId) const;

    // 0 before the first change.
    uint64_t lastSequenceNumber() const;
    // 0 for a client none of whose changes was accepted.
    uint64_t highestVersionId(const std::string& clientId) const;
    // True once a change of clientId has been accepted.
    bool hasChangesFrom(const std::string& clientId) const;
    // Ascending by sort key, objects with equal sort keys by primary key.
    std::vector<SyncProtocol::TessarineObject> objects() const;

private:
    void apply(const SyncProtocol::Delta& change);

    std::string collectionName;
    std::vector<SyncProtocol::Delta> log;  // log[i] has sequence number i + 1
    std::map<std::string, SyncProtocol::TessarineObject> currentObjects;  // by primary key
    std::map<std::string, uint64_t> highestVersionIds;                    // by client id
    std::map<std::pair<std::string, uint64_t>, uint64_t> acceptedAt;      // (client, version) -> sequence
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
