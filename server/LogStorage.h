// Where a sync server keeps what it has accepted, per collection: the log of
// changes numbered 1, 2, 3, ... without gaps, the objects as those changes
// left them, and which (client id, version id) pairs it holds. SyncServer
// applies the wire rules on top (accept once, catch-up, snapshots); a storage
// only records and answers, so that every storage serves the same rules.
//
// A save replaces its object and a delete removes it (a delete of an object
// that does not exist is still a change in the log).
//
// Errors: a storage that cannot do what is asked throws (std::exception);
// append either records the whole change or nothing.
//
// Threads: no lock of its own; its owner (SyncServer) calls it under its own
// mutex, from one thread at a time.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {
namespace server {

class LogStorage {
public:
    virtual ~LogStorage() = default;

    // The change logged for (change.collectionName, change.clientId,
    // change.versionId), with its sequence number, if there is one.
    virtual std::optional<SyncProtocol::Delta> findAccepted(const SyncProtocol::Delta& change) = 0;

    // Logs the change under the collection's next sequence number and
    // applies it to the objects; returns it with that number. When append
    // returns, the change is as durable as the storage can make it. Empty
    // when the change turns out to be logged already (a storage shared by
    // several servers: another one logged it since findAccepted looked).
    virtual std::optional<SyncProtocol::Delta> append(const SyncProtocol::Delta& change) = 0;

    // The logged changes with sequence numbers above sequenceNumber, in order.
    virtual std::vector<SyncProtocol::Delta> changesAfter(const std::string& collectionName,
                                                          uint64_t sequenceNumber) = 0;

    // 0 before the first change.
    virtual uint64_t lastSequenceNumber(const std::string& collectionName) = 0;

    // The highest version id logged for the client; empty when none of its
    // changes is in the collection's log.
    virtual std::optional<uint64_t> highestVersionId(const std::string& collectionName,
                                                     const std::string& clientId) = 0;

    // The current objects, ascending by sort key, equal sort keys by primary key.
    virtual std::vector<SyncProtocol::TessarineObject> objects(const std::string& collectionName) = 0;

    // The objects with the last sequence number and the client's highest
    // version id, as of one moment. A storage that others write at the same
    // time reads them in one transaction.
    virtual SyncProtocol::Snapshot snapshot(const std::string& collectionName, const std::string& clientId) {
        SyncProtocol::Snapshot result;
        result.collectionName = collectionName;
        result.objects = objects(collectionName);
        result.sequenceNumber = lastSequenceNumber(collectionName);
        result.versionId = highestVersionId(collectionName, clientId).value_or(0);
        return result;
    }
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
