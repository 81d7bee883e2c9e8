#include "FloorWrites.h"

namespace bench {

FloorWrites::FloorWrites(RawDatabase& database, CountingTransport& theTransport, bool prepareEachUse)
    : transport(theTransport),
      begin(database, sql::kBegin, prepareEachUse),
      commit(database, sql::kCommit, prepareEachUse),
      incrementVersionId(database, sql::kIncrementVersionId, prepareEachUse),
      queryVersionId(database, sql::kQueryVersionId, prepareEachUse),
      insertDelta(database, sql::kInsertDelta, prepareEachUse),
      saveObject(database, sql::kSaveObject, prepareEachUse),
      deleteIndexRows(database, sql::kDeleteIndexRows, prepareEachUse),
      saveIndexRow(database, sql::kSaveIndexRow, prepareEachUse),
      updateSequenceNumber(database, sql::kUpdateSequenceNumber, prepareEachUse),
      getVersionVector(database, sql::kGetVersionVector, prepareEachUse),
      setVersionVector(database, sql::kSetVersionVector, prepareEachUse),
      getDeltaStatuses(database, sql::kGetDeltaStatuses, prepareEachUse) {
    RawStatement metadata(database, sql::kGetMetadata);
    metadata.start().bind(1, std::string("client_id"));
    if (metadata.step()) clientId = metadata.columnText(0);
    metadata.done();
}

void FloorWrites::save(const std::string& primaryKey, const std::string& sortKey,
                       const std::vector<unsigned char>& blob) {
    begin.start().run();
    incrementVersionId.start().bind(1, kCollection).run();
    queryVersionId.start().bind(1, kCollection);
    long long versionId = queryVersionId.step() ? queryVersionId.columnInt64(0) : 0;
    queryVersionId.done();
    commit.start().run();

    begin.start().run();
    insertDelta.start()
        .bind(1, kCollection)
        .bind(2, versionId)
        .bind(3, 1LL)
        .bind(4, primaryKey)
        .bind(5, sortKey)
        .bindBlob(6, blob.data(), blob.size())
        .bind(7, 1LL)
        .run();
    SyncProtocol::Delta delta;
    delta.clientId = clientId;
    delta.collectionName = kCollection;
    delta.versionId = static_cast<uint64_t>(versionId);
    delta.primaryKey = primaryKey;
    delta.sortKey = sortKey;
    delta.blob = blob;
    transport.sendDelta(delta);
    writeObject(primaryKey, sortKey, blob, 1);
    commit.start().run();
}

void FloorWrites::applyRemote(const std::vector<SyncProtocol::Delta>& deltas) {
    begin.start().run();
    for (const SyncProtocol::Delta& delta : deltas) {
        updateSequenceNumber.start().bind(1, static_cast<long long>(delta.sequenceNumber)).bind(2, kCollection).run();
        getVersionVector.start().bind(1, delta.collectionName).bind(2, delta.clientId);
        long long known = getVersionVector.step() ? getVersionVector.columnInt64(0) : 0;
        getVersionVector.done();
        if (static_cast<long long>(delta.versionId) > known) {
            setVersionVector.start()
                .bind(1, delta.collectionName)
                .bind(2, delta.clientId)
                .bind(3, static_cast<long long>(delta.versionId))
                .run();
        }
        getDeltaStatuses.start().bind(1, delta.collectionName).bind(2, delta.primaryKey);
        bool queued = false;
        while (getDeltaStatuses.step()) queued = true;
        getDeltaStatuses.done();
        if (!queued) writeObject(delta.primaryKey, delta.sortKey, delta.blob, 3);
    }
    commit.start().run();
}

void FloorWrites::writeObject(const std::string& primaryKey, const std::string& sortKey,
                              const std::vector<unsigned char>& blob, long long status) {
    saveObject.start().bind(1, primaryKey).bind(2, sortKey).bindBlob(3, blob.data(), blob.size()).bind(4, status).run();
    Fields fields = indexObject(kCollection, primaryKey, sortKey, blob);
    deleteIndexRows.start().bind(1, primaryKey).run();
    saveIndexRow.start();
    for (const auto& field : fields) {
        saveIndexRow.bind(1, primaryKey).bind(2, field.first).bind(3, field.second);
        while (saveIndexRow.step()) {
        }
        saveIndexRow.reset();
    }
    saveIndexRow.done();
}

}  // namespace bench
