#include "zarn/content/content_store.h"

#include <cerrno>
#include <map>
#include <utility>

#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

constexpr const char* kDocumentType = "Document";

NSErrorRef cocoaError(std::int64_t code, const char* text, const NSErrorRef& cause) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, code,
      {{NSLocalizedDescriptionKey, std::string(text)}, {NSUnderlyingErrorKey, cause}});
}

RZRecordID recordIDOf(std::uint64_t item, const std::string& zone) {
  return {std::to_string(item), RZRecordZoneID(zone)};
}

RZRecordRef recordOf(const StoredDocument& document) {
  auto record = std::make_shared<RZRecord>(kDocumentType, recordIDOf(document.item, document.zone));
  record->setObject(document.name, "name");
  record->setObject(static_cast<std::int64_t>(document.parent), "parent");
  record->setObject(static_cast<std::int64_t>(document.content.size), "size");
  record->setObject(NSDate::fromNanoseconds(document.mtime), "modified");
  record->setObject(NSDate::fromNanoseconds(document.btime), "created");
  record->setObject(document.content, "content");
  return record;
}

}  // namespace

NSErrorRef contentError(NSErrorRef error) {
  if (!error || error->domain() != RZErrorDomain) return error;
  switch (error->code()) {
    case RZErrorNetworkUnavailable:
    case RZErrorStoreBusy:
      return cocoaError(NSUbiquitousFileUnavailableError,
                        "The store is out of reach; it is tried again by itself.", error);
    case RZErrorQuotaExceeded:
      return cocoaError(NSUbiquitousFileNotUploadedDueToQuotaError,
                        "The store's quota is used up; remove something or raise it.", error);
    case RZErrorAssetMissing:
    case RZErrorAssetDamaged:
      return cocoaError(NSFileReadCorruptFileError,
                        "What the store has is not the content that was put there.", error);
    case RZErrorStoreFull:
      return NSError::errorWithDomain(
          NSPOSIXErrorDomain, ENOSPC,
          {{NSLocalizedDescriptionKey, std::string("The disk is full; make room, then try again.")},
           {NSUnderlyingErrorKey, error}});
    default:
      return error;
  }
}

bool isOutOfReach(const NSErrorRef& error) {
  return error && error->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError);
}

bool isOverQuota(const NSErrorRef& error) {
  return error && error->is(NSCocoaErrorDomain, NSUbiquitousFileNotUploadedDueToQuotaError);
}

ContentStore::ContentStore(RZEngineRef engine, const std::string& account)
    : engine_(std::move(engine)),
      database_{.containerIdentifier = QSUbiquitousDefaultContainerID, .accountName = account} {}

NSErrorRef ContentStore::checkReachability() const {
  return contentError(engine_->checkReachability());
}

std::unique_ptr<RZAssetGroup> ContentStore::newGroup(NSErrorRef* error) const {
  NSErrorRef failure;
  auto group = engine_->newAssetGroup(&failure);
  if (!group) storeError(error, contentError(std::move(failure)));
  return group;
}

NSErrorRef ContentStore::take(RZAssetGroup& group, int file, const GoesOn& goesOn,
                              RZAsset& content) const {
  return contentError(group.importAsset(file, {.progress = goesOn}, content));
}

NSErrorRef ContentStore::commit(RZAssetGroup& group) const { return contentError(group.commit()); }

NSErrorRef ContentStore::copy(const RZAsset& content, int file, const GoesOn& goesOn) const {
  return contentError(engine_->copyAsset(content, file, {.progress = goesOn}));
}

NSErrorRef ContentStore::open(const RZAsset& content, FileDescriptor& descriptor) const {
  return contentError(engine_->openAsset(content, descriptor));
}

NSErrorRef ContentStore::makeZones(const RZRecordBatch& batch) {
  std::set<std::string> zones;
  for (const RZRecordRef& record : batch.recordsToSave) {
    zones.insert(record->recordID().zoneID().zoneName());
  }
  // One that never was has nothing to be removed from, which the store would refuse.
  for (const auto& removal : batch.recordsToDelete) {
    zones.insert(removal.recordID.zoneID().zoneName());
  }
  for (const std::string& zone : zones) {
    {
      LockGuard guard(mutex_);
      if (zones_.contains(zone)) continue;
    }
    if (NSErrorRef error = engine_->createZone(database_, RZRecordZoneID(zone))) return error;
    LockGuard guard(mutex_);
    zones_.insert(zone);
  }
  return nullptr;
}

NSErrorRef ContentStore::modify(const RZRecordBatch& batch, std::vector<RZRecordRef>& saved) {
  NSErrorRef error = makeZones(batch);
  if (!error) error = engine_->modifyRecords(database_, batch, saved);
  if (!rz_isError(error, RZErrorZoneNotFound)) return error;
  {
    LockGuard guard(mutex_);
    zones_.clear();  // somebody has removed one
  }
  error = makeZones(batch);
  return error ? error : engine_->modifyRecords(database_, batch, saved);
}

NSErrorRef ContentStore::saveBatch(const std::vector<StoredDocument>& documents, std::size_t begin,
                                   std::size_t end, std::vector<Saved>& saved) {
  RZRecordBatch batch;
  batch.savePolicy = RZRecordSavePolicy::ChangedKeys;
  for (std::size_t i = begin; i < end; ++i) {
    const StoredDocument& document = documents[i];
    batch.recordsToSave.push_back(recordOf(document));
    if (document.previousZone.empty() || document.previousZone == document.zone) continue;
    batch.recordsToDelete.push_back({recordIDOf(document.item, document.previousZone)});
  }
  std::vector<RZRecordRef> stored;
  NSErrorRef error = contentError(modify(batch, stored));
  if (!error) {
    for (std::size_t i = begin; i < end; ++i) saved[i].tag = stored.at(i - begin)->changeTag();
    return nullptr;
  }
  if (isOutOfReach(error) || end - begin <= 1) {
    for (std::size_t i = begin; i < end; ++i) saved[i].error = error;
    return error;
  }
  // One that is refused must not keep the others.
  const std::size_t middle = begin + (end - begin) / 2;
  NSErrorRef first = saveBatch(documents, begin, middle, saved);
  NSErrorRef second = saveBatch(documents, middle, end, saved);
  return first ? first : second;
}

NSErrorRef ContentStore::save(const std::vector<StoredDocument>& documents,
                              std::vector<Saved>& saved) {
  saved.assign(documents.size(), {});
  if (documents.empty()) return nullptr;
  NSErrorRef error = saveBatch(documents, 0, documents.size(), saved);
  return isOutOfReach(error) ? error : nullptr;
}

NSErrorRef ContentStore::removeBatch(const std::vector<RemovedDocument>& removed, std::size_t begin,
                                     std::size_t end, std::vector<NSErrorRef>& refused) {
  RZRecordBatch batch;
  batch.savePolicy = RZRecordSavePolicy::ChangedKeys;
  for (std::size_t i = begin; i < end; ++i) {
    batch.recordsToDelete.push_back({recordIDOf(removed[i].item, removed[i].zone)});
  }
  std::vector<RZRecordRef> stored;
  NSErrorRef error = contentError(modify(batch, stored));
  if (!error) return nullptr;
  if (isOutOfReach(error) || end - begin <= 1) {
    for (std::size_t i = begin; i < end; ++i) refused[i] = error;
    return error;
  }
  const std::size_t middle = begin + (end - begin) / 2;
  NSErrorRef first = removeBatch(removed, begin, middle, refused);
  NSErrorRef second = removeBatch(removed, middle, end, refused);
  return first ? first : second;
}

NSErrorRef ContentStore::remove(const std::vector<RemovedDocument>& removed,
                                std::vector<NSErrorRef>& refused) {
  refused.assign(removed.size(), nullptr);
  if (removed.empty()) return nullptr;
  NSErrorRef error = removeBatch(removed, 0, removed.size(), refused);
  return isOutOfReach(error) ? error : nullptr;
}

}  // namespace yomber
