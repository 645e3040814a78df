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
  for (const RZRecordRef& record : batch.recordsToSave) {
    const RZRecordZoneID& zone = record->recordID().zoneID();
    {
      LockGuard guard(mutex_);
      if (zones_.contains(zone.zoneName())) continue;
    }
    if (NSErrorRef error = engine_->createZone(database_, zone)) return error;
    LockGuard guard(mutex_);
    zones_.insert(zone.zoneName());
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
                                   std::size_t end, const std::vector<RemovedDocument>& removed,
                                   std::vector<Saved>& saved) {
  RZRecordBatch batch;
  batch.savePolicy = RZRecordSavePolicy::ChangedKeys;
  for (std::size_t i = begin; i < end; ++i) {
    const StoredDocument& document = documents[i];
    batch.recordsToSave.push_back(recordOf(document));
    if (document.previousZone.empty() || document.previousZone == document.zone) continue;
    batch.recordsToDelete.push_back({recordIDOf(document.item, document.previousZone)});
  }
  for (const auto& each : removed)
    batch.recordsToDelete.push_back({recordIDOf(each.item, each.zone)});
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
  NSErrorRef first = saveBatch(documents, begin, middle, removed, saved);
  NSErrorRef second = saveBatch(documents, middle, end, {}, saved);
  return first ? first : second;
}

NSErrorRef ContentStore::save(const std::vector<StoredDocument>& documents,
                              const std::vector<RemovedDocument>& removed,
                              std::vector<Saved>& saved) {
  saved.assign(documents.size(), {});
  if (documents.empty() && removed.empty()) return nullptr;
  // Apart: what is refused of the one must not keep the other.
  if (!removed.empty()) {
    if (NSErrorRef error = saveBatch({}, 0, 0, removed, saved)) return error;
  }
  if (documents.empty()) return nullptr;
  NSErrorRef error = saveBatch(documents, 0, documents.size(), {}, saved);
  return isOutOfReach(error) ? error : nullptr;
}

}  // namespace yomber
