#include "zarn/content/content_store.h"

#include <cerrno>
#include <map>
#include <utility>

#include "platform/ostrell/constants.h"
#include "zarn/content/share_rows.h"

namespace yomber {
namespace {

NSErrorRef cocoaError(std::int64_t code, const char* text, const NSErrorRef& cause) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, code,
      {{NSLocalizedDescriptionKey, std::string(text)}, {NSUnderlyingErrorKey, cause}});
}

bool isOwn(const RZRecordZoneID& zone) { return zone.ownerName() == RZCurrentUserDefaultName; }

RZRecordID recordIDOf(std::uint64_t item, const RZRecordZoneID& zone) {
  return {std::to_string(item), zone};
}

RZRecordRef recordOf(const StoredDocument& document) {
  auto record =
      std::make_shared<RZRecord>(document.isFolder ? kQSRecordTypeFolder : kQSRecordTypeDocument,
                                 recordIDOf(document.item, document.zone), RZValues(),
                                 RZRecord::Stamp{.changeTag = document.tag});
  if (!document.isPlacedByEach) {
    record->setObject(document.name, kQSRecordKeyName);
    record->setObject(static_cast<std::int64_t>(document.parent), kQSRecordKeyParent);
  }
  record->setObject(NSDate::fromNanoseconds(document.mtime), kQSRecordKeyModified);
  record->setObject(NSDate::fromNanoseconds(document.btime), kQSRecordKeyCreated);
  if (document.isFolder) return record;
  record->setObject(static_cast<std::int64_t>(document.content.size), kQSRecordKeySize);
  record->setObject(document.content, kQSRecordKeyContent);
  if (document.thumbnail) {
    record->setObject(*document.thumbnail, kQSRecordKeyThumbnail1024x1024);
  } else {
    record->removeObjectForKey(kQSRecordKeyThumbnail1024x1024);  // it was of other content
  }
  return record;
}

/// Whether a record says what would be saved: it was, by a process that ended before it knew.
bool isSavedAs(const RZRecordRef& record, const StoredDocument& document) {
  if (!record) return false;
  const auto* const name = record->valueForKey<std::string>(kQSRecordKeyName);
  const auto* const parent = record->valueForKey<std::int64_t>(kQSRecordKeyParent);
  const bool isPlaced =
      document.isPlacedByEach || (name != nullptr && *name == document.name && parent != nullptr &&
                                  static_cast<std::uint64_t>(*parent) == document.parent);
  if (document.isFolder) return isPlaced && record->recordType() == kQSRecordTypeFolder;
  const auto* const content = record->valueForKey<RZAsset>(kQSRecordKeyContent);
  return isPlaced && content != nullptr && *content == document.content;
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
      database_{.containerIdentifier = QSUbiquitousRozzelContainerIdentifier,
                .accountName = account} {}

NSErrorRef ContentStore::checkReachability() const {
  return contentError(engine_->checkReachability());
}

NSErrorRef ContentStore::checkRoom(const RZRecordZoneID& zone, std::uint64_t size,
                                   std::uint64_t replaced) const {
  RZQuota quota;
  if (NSErrorRef error =
          engine_->fetchQuota(isOwn(zone) ? database_.accountName : zone.ownerName(), quota)) {
    return contentError(std::move(error));
  }
  const std::uint64_t growth = size > replaced ? size - replaced : 0;
  if (growth == 0 || !quota.limit || quota.used + growth <= *quota.limit) return nullptr;
  return contentError(
      rz_error(RZErrorQuotaExceeded, "the save needs " + std::to_string(quota.used + growth) +
                                         " bytes of a quota of " + std::to_string(*quota.limit)));
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

NSErrorRef ContentStore::fetchShare(const RZRecordZoneID& zone, RZShareRef& share) const {
  return contentError(engine_->fetchShare(databaseOf(zone), zone, share));
}

NSErrorRef ContentStore::commit(RZAssetGroup& group) const { return contentError(group.commit()); }

NSErrorRef ContentStore::copy(const RZAsset& content, int file, const GoesOn& goesOn) const {
  return contentError(engine_->copyAsset(content, file, {.progress = goesOn}));
}

NSErrorRef ContentStore::verify(const RZAsset& content) const {
  return contentError(engine_->verifyAsset(content, {}));
}

NSErrorRef ContentStore::open(const RZAsset& content, FileDescriptor& descriptor) const {
  return contentError(engine_->openAsset(content, descriptor));
}

RZDatabaseID ContentStore::databaseOf(RZDatabaseScope scope) const {
  RZDatabaseID database = database_;
  database.scope = scope;
  return database;
}

RZDatabaseID ContentStore::databaseOf(const RZRecordZoneID& zone) const {
  return databaseOf(isOwn(zone) ? RZDatabaseScope::Private : RZDatabaseScope::Shared);
}

NSErrorRef ContentStore::makeZones(const RZRecordBatch& batch) {
  std::set<std::string> zones;
  const auto note = [&](const RZRecordZoneID& zone) {
    // A share's zone is made with the share; after that it is not to come back.
    if (!isSharedZone(zone)) zones.insert(zone.zoneName());
  };
  for (const RZRecordRef& record : batch.recordsToSave) note(record->recordID().zoneID());
  // One that never was has nothing to be removed from, which the store would refuse.
  for (const auto& removal : batch.recordsToDelete) note(removal.recordID.zoneID());
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

NSErrorRef ContentStore::modify(const RZDatabaseID& database, const RZRecordBatch& batch,
                                std::vector<RZRecordRef>& saved) {
  NSErrorRef error = makeZones(batch);
  if (!error) error = engine_->modifyRecords(database, batch, saved);
  if (!rz_isError(error, RZErrorZoneNotFound)) return error;
  {
    LockGuard guard(mutex_);
    zones_.clear();  // somebody has removed one
  }
  error = makeZones(batch);
  return error ? error : engine_->modifyRecords(database, batch, saved);
}

/// After the document was saved elsewhere.
NSErrorRef ContentStore::removePrevious(const StoredDocument& document, Saved& saved) {
  if (!document.previousZone || *document.previousZone == document.zone) return nullptr;
  std::vector<NSErrorRef> refused;
  NSErrorRef error =
      remove({{document.item, *document.previousZone, document.previousTag}}, refused);
  if (!error) error = refused.front();
  saved.isPreviousLeft = error != nullptr;
  return saved.error = std::move(error);
}

NSErrorRef ContentStore::saveBatch(const Part& part, std::size_t begin, std::size_t end) {
  const bool isShared = isSharedZone(part.documents[begin]->zone);
  const RZDatabaseID database = databaseOf(part.documents[begin]->zone);
  RZRecordBatch batch;
  batch.savePolicy =
      isShared ? RZRecordSavePolicy::IfServerRecordUnchanged : RZRecordSavePolicy::ChangedKeys;
  for (std::size_t i = begin; i < end; ++i) {
    const StoredDocument& document = *part.documents[i];
    batch.recordsToSave.push_back(recordOf(document));
    const auto& previous = document.previousZone;
    if (!previous || *previous == document.zone || databaseOf(*previous) != database) continue;
    batch.recordsToDelete.push_back({recordIDOf(document.item, *previous), document.previousTag});
  }
  std::vector<RZRecordRef> stored;
  NSErrorRef error = contentError(modify(database, batch, stored));
  if (!error) {
    for (std::size_t i = begin; i < end; ++i) {
      part.saved[i]->tag = stored.at(i - begin)->changeTag();
      // One batch cannot change two databases.
      const auto& previous = part.documents[i]->previousZone;
      if (!previous || databaseOf(*previous) == database) continue;
      const NSErrorRef failure = removePrevious(*part.documents[i], *part.saved[i]);
      if (isOutOfReach(failure)) error = failure;
    }
    return error;
  }
  if (!isOutOfReach(error) && end - begin == 1)
    return saveAlone(*part.documents[begin], std::move(error), *part.saved[begin]);
  if (isOutOfReach(error)) {
    for (std::size_t i = begin; i < end; ++i) part.saved[i]->error = error;
    return error;
  }
  // One that is refused must not keep the others.
  const std::size_t middle = begin + (end - begin) / 2;
  NSErrorRef first = saveBatch(part, begin, middle);
  NSErrorRef second = saveBatch(part, middle, end);
  return first ? first : second;
}

/// What becomes of a document that was refused with `error`.
NSErrorRef ContentStore::saveAlone(const StoredDocument& document, NSErrorRef error, Saved& saved) {
  // The zone may be the one that it comes from: a share that has ended.
  const bool mayBeSaved = rz_isError(error, RZErrorServerRecordChanged) ||
                          rz_isError(error, RZErrorPermissionFailure) ||
                          rz_isError(error, RZErrorZoneNotFound);
  if (mayBeSaved) {
    std::vector<RZFetchedRecord> found;
    const NSErrorRef failure = contentError(
        engine_->fetchRecords(databaseOf(document.zone), {recordIDOf(document.item, document.zone)},
                              std::nullopt, found));
    if (isOutOfReach(failure)) return saved.error = failure;
    if (!failure && isSavedAs(found.at(0).record, document)) {
      saved.tag = found.at(0).record->changeTag();
      return removePrevious(document, saved);
    }
    const bool isMoved = document.previousZone && *document.previousZone != document.zone &&
                         databaseOf(*document.previousZone) == databaseOf(document.zone);
    if (!isMoved) return saved.error = std::move(error);
    // Which of the two was refused?
    StoredDocument here = document;
    here.previousZone.reset();
    NSErrorRef again = saveBatch({.documents = {&here}, .saved = {&saved}}, 0, 1);
    return again || saved.error ? again : removePrevious(document, saved);
  }
  if (!document.thumbnail) return saved.error = std::move(error);
  // What there is no room for, or what is missing, may be the thumbnail alone.
  StoredDocument plain = document;
  plain.thumbnail.reset();
  return saveBatch({.documents = {&plain}, .saved = {&saved}}, 0, 1);
}

NSErrorRef ContentStore::save(const std::vector<StoredDocument>& documents,
                              std::vector<Saved>& saved) {
  saved.assign(documents.size(), {});
  // Records of one database, and saved under one policy, may come together.
  std::map<std::pair<RZDatabaseID, bool>, Part> parts;
  for (std::size_t i = 0; i < documents.size(); ++i) {
    const RZRecordZoneID& zone = documents[i].zone;
    Part& part = parts[{databaseOf(zone), isSharedZone(zone)}];
    part.documents.push_back(&documents[i]);
    part.saved.push_back(&saved[i]);
  }
  NSErrorRef result;
  for (const auto& [key, part] : parts) {
    const NSErrorRef error = saveBatch(part, 0, part.documents.size());
    if (isOutOfReach(error)) result = error;
  }
  return result;
}

NSErrorRef ContentStore::saveThumbnail(const RZRecordRef& record, const RecordThumbnail& wanted,
                                       Saved& saved) {
  const RZAsset* const content =
      record ? record->valueForKey<RZAsset>(kQSRecordKeyContent) : nullptr;
  if (content == nullptr || *content != wanted.content) return nullptr;
  // Somebody else's was of this content too: a save of another content takes it away.
  if (record->valueForKey<RZAsset>(kQSRecordKeyThumbnail1024x1024) != nullptr) return nullptr;
  auto changed = std::make_shared<RZRecord>(*record);
  changed->setObject(wanted.thumbnail, kQSRecordKeyThumbnail1024x1024);
  // Only while it is the record that was looked at.
  RZRecordBatch batch;
  batch.recordsToSave.push_back(std::move(changed));
  std::vector<RZRecordRef> stored;
  saved.error =
      contentError(engine_->modifyRecords(databaseOf(record->recordID().zoneID()), batch, stored));
  if (!saved.error) saved.tag = stored.at(0)->changeTag();
  return isOutOfReach(saved.error) ? saved.error : nullptr;
}

NSErrorRef ContentStore::saveThumbnails(const std::vector<RecordThumbnail>& thumbnails,
                                        std::vector<Saved>& saved) {
  saved.assign(thumbnails.size(), {});
  if (thumbnails.empty()) return nullptr;
  std::map<RZDatabaseID, std::vector<std::size_t>> places;
  for (std::size_t i = 0; i < thumbnails.size(); ++i)
    places[databaseOf(thumbnails[i].zone)].push_back(i);
  const RZDesiredKeys keys{{kQSRecordKeyContent, kQSRecordKeyThumbnail1024x1024}};
  for (const auto& [database, indices] : places) {
    std::vector<RZRecordID> ids;
    for (const std::size_t i : indices)
      ids.push_back(recordIDOf(thumbnails[i].item, thumbnails[i].zone));
    std::vector<RZFetchedRecord> records;
    NSErrorRef error = contentError(engine_->fetchRecords(database, ids, keys, records));
    for (std::size_t i = 0; i < indices.size() && !error; ++i)
      error = saveThumbnail(records.at(i).record, thumbnails[indices[i]], saved[indices[i]]);
    if (error) return error;
  }
  return nullptr;
}

NSErrorRef ContentStore::removeBatch(const std::vector<RemovedDocument>& removed, std::size_t begin,
                                     std::size_t end, std::vector<NSErrorRef>& refused) {
  RZRecordBatch batch;
  batch.savePolicy = RZRecordSavePolicy::ChangedKeys;
  for (std::size_t i = begin; i < end; ++i) {
    batch.recordsToDelete.push_back({recordIDOf(removed[i].item, removed[i].zone), removed[i].tag});
  }
  std::vector<RZRecordRef> stored;
  NSErrorRef error = contentError(modify(databaseOf(removed[begin].zone), batch, stored));
  if (!error) return nullptr;
  if (isOutOfReach(error) || end - begin <= 1) {
    // With the zone went all that was in it.
    const bool isGone = end - begin == 1 && rz_isError(error, RZErrorZoneNotFound) &&
                        isSharedZone(removed[begin].zone);
    if (isGone) return nullptr;
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
  std::map<RZDatabaseID, std::vector<std::size_t>> places;
  for (std::size_t i = 0; i < removed.size(); ++i) places[databaseOf(removed[i].zone)].push_back(i);
  NSErrorRef result;
  for (const auto& [database, indices] : places) {
    std::vector<RemovedDocument> part;
    part.reserve(indices.size());
    for (const std::size_t i : indices) part.push_back(removed[i]);
    std::vector<NSErrorRef> answers(part.size());
    const NSErrorRef error = removeBatch(part, 0, part.size(), answers);
    for (std::size_t i = 0; i < indices.size(); ++i) refused[indices[i]] = std::move(answers[i]);
    if (isOutOfReach(error)) result = error;
  }
  return result;
}

}  // namespace yomber
