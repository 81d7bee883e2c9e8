#include "tessarine/Collection.h"

#include <exception>

#include "platform/Log.h"
#include "tessarine/DeltaHandler.h"
#include "tessarine/StoreLog.h"

namespace lumivale {
namespace tessarine {

namespace {

bool isNameByte(unsigned char c) {
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '_';
}

const char* const kQueryError = "Error while querying collection: %s";

}  // namespace

Collection::Collection(std::shared_ptr<CollectionStorage> theCollectionStorage,
                       std::shared_ptr<DeltaHandler> theDeltaHandler,
                       std::shared_ptr<SnapshotGenerator> theSnapshotGenerator, const std::string& theCollectionName)
    : collectionStorage(std::move(theCollectionStorage)),
      deltaHandler(std::move(theDeltaHandler)),
      snapshotGenerator(std::move(theSnapshotGenerator)),
      collectionName(theCollectionName) {
    this->collectionStorage->ensureTableExistsForCollection(theCollectionName);
}

bool Collection::isValidCollectionName(const std::string& name) {
    size_t colon = 0;
    while (colon < name.size() && isNameByte(static_cast<unsigned char>(name[colon]))) ++colon;
    if (colon == name.size() || colon == 0 || colon == name.size() - 1 || name[colon] != ':') return false;
    for (size_t i = colon + 1; i < name.size(); ++i) {
        if (!isNameByte(static_cast<unsigned char>(name[i]))) return false;
    }
    return true;
}

std::unique_ptr<Cursor> Collection::query(const std::string& sortKey, int limit,
                                          CollectionStorage::SortDirection direction) noexcept {
    try {
        return collectionStorage->query(collectionName, sortKey, limit,
                                        direction == CollectionStorage::SortDirection::ASCENDING);
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, kQueryError, e.what());
        return nullptr;
    }
}

std::unique_ptr<Cursor> Collection::queryWithIndex(const std::string& indexQuery,
                                                   const std::vector<std::string>& indexQueryArgs, int limit) {
    try {
        return collectionStorage->queryWithIndex(collectionName, indexQuery, indexQueryArgs, limit);
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, kQueryError, e.what());
        return nullptr;
    }
}

std::unique_ptr<Cursor> Collection::queryWithIndexSorted(const std::string& indexQuery,
                                                         const std::vector<std::string>& indexQueryArgs,
                                                         const std::string& sortFieldName,
                                                         CollectionStorage::SortDirection direction, int limit) {
    try {
        return collectionStorage->queryWithIndexSorted(collectionName, indexQuery, indexQueryArgs, sortFieldName,
                                                       direction, limit);
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, kQueryError, e.what());
        return nullptr;
    }
}

std::unique_ptr<Cursor> Collection::getObject(const std::string& primaryKey) noexcept {
    try {
        return collectionStorage->getObject(collectionName, primaryKey);
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, "Error while getting object from collection: %s", e.what());
        return nullptr;
    }
}

bool Collection::saveObject(const std::string& primaryKey, const std::string& sortKey, const unsigned char* blob,
                            unsigned int blobSize) noexcept {
    const char* const error = "Error while updating object: %s";
    if (blob == nullptr && blobSize != 0) {
        lv_printLog(LogPriority::kError, kStoreLogTag, error, "the blob has a size but no data");
        return false;
    }
    return write(SyncProtocol::DeltaType::SAVE, primaryKey, sortKey, blob, blobSize, error);
}

bool Collection::saveObject(const std::string& primaryKey, const std::string& sortKey,
                            const std::vector<unsigned char>& blob) noexcept {
    return saveObject(primaryKey, sortKey, blob.data(), static_cast<unsigned int>(blob.size()));
}

bool Collection::deleteObject(const std::string& primaryKey) noexcept {
    return write(SyncProtocol::DeltaType::DELETE, primaryKey, std::string(), nullptr, 0,
                 "Error while deleting object: %s");
}

// Hands the change to the delta handler, which numbers it with the
// collection's next version id (committed on its own first) and queues it.
bool Collection::write(SyncProtocol::DeltaType type, const std::string& primaryKey, const std::string& sortKey,
                       const unsigned char* blob, unsigned int blobSize, const char* errorFormat) noexcept {
    try {
        SyncProtocol::Delta delta;
        delta.collectionName = collectionName;
        delta.type = type;
        delta.primaryKey = primaryKey;
        delta.sortKey = sortKey;
        if (blobSize != 0) delta.blob.assign(blob, blob + blobSize);
        deltaHandler->addLocalDeltaWithNextVersionId(std::move(delta));
        return true;
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, errorFormat, e.what());
        return false;
    }
}

}  // namespace tessarine
}  // namespace lumivale
