// The floor of the two write paths: the statements the store issues for a
// local save and for applying a delivery of other clients' deltas, issued
// with raw sqlite3 calls in the same order and the same transactions.
//
// The application's indexer is called where the store calls it, and a local
// save is handed to the same transport, so that only the store's own work
// differs between the two sides. One thread at a time.
#pragma once

#include <string>
#include <vector>

#include "BenchSupport.h"

namespace bench {

class FloorWrites {
public:
    FloorWrites(RawDatabase& database, CountingTransport& transport, bool prepareEachUse);

    // A local save: the version id transaction, then the delta queue insert,
    // the hand-over to the transport, the object upsert and the object's
    // index rows in a second transaction.
    void save(const std::string& primaryKey, const std::string& sortKey, const std::vector<unsigned char>& blob);

    // One delivery of other clients' save deltas, in one transaction: per
    // delta the sequence number, the version vector, the queued statuses of
    // the object and, with nothing queued, the object and its index rows.
    void applyRemote(const std::vector<SyncProtocol::Delta>& deltas);

private:
    void writeObject(const std::string& primaryKey, const std::string& sortKey, const std::vector<unsigned char>& blob,
                     long long status);

    CountingTransport& transport;
    std::string clientId;
    RawStatement begin;
    RawStatement commit;
    RawStatement incrementVersionId;
    RawStatement queryVersionId;
    RawStatement insertDelta;
    RawStatement saveObject;
    RawStatement deleteIndexRows;
    RawStatement saveIndexRow;
    RawStatement updateSequenceNumber;
    RawStatement getVersionVector;
    RawStatement setVersionVector;
    RawStatement getDeltaStatuses;
};

}  // namespace bench
