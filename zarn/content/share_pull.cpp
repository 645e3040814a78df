#include "zarn/content/share_pull.h"

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

FaultPoint pullFetched("zarn.pull.fetched");
FaultPoint pullPlaced("zarn.pull.placed");
FaultPoint pullStored("zarn.pull.stored");
FaultPoint pullDisplaced("zarn.pull.displaced");

constexpr std::size_t kTogether = 1000;
/// No zone has that, so that what changed in it is asked for.
constexpr const char* kTagOfNone = "none";

const RZDesiredKeys& itemKeys() {
  static const auto* const keys = new RZDesiredKeys(
      std::vector<std::string>{kQSRecordKeyName, kQSRecordKeyParent, kQSRecordKeySize,
                               kQSRecordKeyModified, kQSRecordKeyCreated, kQSRecordKeyContent});
  return *keys;
}

std::string parentOf(const std::string& path) { return path.substr(0, path.rfind('/')); }
std::string lastOf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

}  // namespace

// --- What changed.

NSErrorRef SharePull::run() {
  for (bool hasMore = true; hasMore;) {
    RZChangePage page;
    NSErrorRef error = contentError(store_->engine()->fetchChanges(
        store_->databaseOf(share_.zone), share_.zone, share_.token, kTogether, itemKeys(), page));
    if (rz_isError(error, RZErrorChangeTokenExpired) && !share_.token.empty()) {
      error = startAgain();
      if (error) return error;
      continue;
    }
    if (!error && pullFetched.hit()) error = NSError::errorWithErrno(EIO);
    if (error) return error;
    Items items;
    std::vector<std::uint64_t> unreadable;
    for (const RZRecordChange& change : page.changes) {
      const auto id = itemOfRecord(change.recordID.recordName());
      if (!id) continue;
      if (change.error) {
        log_error(defaultLog(), "[ERROR] a record of a share cannot be read: %@", change.error);
        unreadable.push_back(*id);
        continue;
      }
      SharedItem item;
      item.id = *id;
      if (change.record) item.record = SharedRecord::read(*change.record);
      if (change.record && !item.record) continue;  // of a kind that is not known here
      items.push_back(std::move(item));
    }
    error = waitFor(unreadable);
    if (!error) error = applyPage(std::move(items), &page.token);
    if (error) return error;
    share_.token = page.token;
    hasMore = page.moreComing;
    if (hasMore && core_.queue->isEnding())  // or else what is missing would count as known
      return NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError);
  }
  isAtEnd_ = true;
  return takeOverWaiting();
}

/// One record keeps no other from coming, and comes when it can be read.
NSErrorRef SharePull::waitFor(const std::vector<std::uint64_t>& unreadable) {
  const auto postpone = [&](WriteTransaction& transaction) {
    for (const std::uint64_t id : unreadable)
      postponeWaitingRecord(transaction.connection(), share_.root, id, core_.now());
    return NSErrorRef();
  };
  return unreadable.empty() ? nullptr : core_.database().write(postpone);
}

/// What the zone has forgotten to tell is found by asking for everything that is known here.
NSErrorRef SharePull::startAgain() {
  share_.token.clear();
  return core_.database().write([&](WriteTransaction& transaction) {
    Statement statement(
        transaction.connection().database(),
        "INSERT OR REPLACE INTO share_waiting(root,record) "
        "SELECT ?1,id FROM content WHERE owner IS NOT NULL AND zone=?2 AND owner=?3");
    statement.bindID(1, share_.root);
    statement.bindBytes(2, share_.zone.zoneName());
    statement.bindBytes(3, share_.zone.ownerName());
    statement.run();
    storeShare(transaction.connection(), share_);
    return NSErrorRef();
  });
}

NSErrorRef SharePull::takeOverWaiting() {
  constexpr std::size_t kMost = 20'000;
  std::vector<std::uint64_t> ids;
  NSErrorRef error = core_.database().read([&](Connection& connection) {
    ids = findWaitingRecords(connection, share_.root, core_.now(), kMost);
  });
  if (error || ids.empty()) return error;
  return takeOver({ids.begin(), ids.end()}, false);
}

NSErrorRef SharePull::takeOver(const std::set<std::uint64_t>& wanted, bool refused) {
  const std::vector<std::uint64_t> ids(wanted.begin(), wanted.end());
  for (std::size_t begin = 0; begin < ids.size(); begin += kTogether) {
    std::vector<RZRecordID> names;
    for (std::size_t i = begin; i < std::min(begin + kTogether, ids.size()); ++i)
      names.emplace_back(std::to_string(ids[i]), share_.zone);
    std::vector<RZFetchedRecord> found;
    NSErrorRef error = contentError(
        store_->engine()->fetchRecords(store_->databaseOf(share_.zone), names, itemKeys(), found));
    if (error) return error;
    Items items;
    std::vector<std::uint64_t> unreadable;
    for (std::size_t i = 0; i < found.size(); ++i) {
      if (rz_isError(found[i].error, RZErrorStoreDamaged)) {
        unreadable.push_back(ids[begin + i]);
        continue;
      }
      const bool isGone = rz_isError(found[i].error, RZErrorUnknownItem);
      if (!found[i].record && !isGone) return found[i].error;
      SharedItem item;
      item.id = ids[begin + i];
      item.isRefused = refused;
      if (found[i].record) item.record = SharedRecord::read(*found[i].record);
      if (isGone || item.record) items.push_back(std::move(item));
    }
    error = waitFor(unreadable);
    if (!error) error = applyPage(std::move(items), nullptr);
    if (error) return error;
  }
  return nullptr;
}

void SharePull::locate(Connection& connection, SharedItem& item) const {
  item.row = findByID(connection, item.id);
  item.content = findContent(connection, item.id);
  if (item.record && !item.record->isFolder)
    item.saving = findSaving(connection, item.id, item.record->content);
  item.isBeingRemoved = !item.row && findJob(connection, item.id, JobKind::Upload).has_value();
  const auto chain = item.row ? findChain(connection, item.id) : std::nullopt;
  if (!chain) return;
  item.path = core_.items->physicalPath(*chain);
  const auto share = findShareAbove(connection, item.id);
  item.isInside = share && share->root == share_.root;
}

NSErrorRef SharePull::read(Items& items) const {
  return core_.database().read([&](Connection& connection) {
    const ReadTransaction transaction(connection);
    for (SharedItem& item : items) locate(connection, item);
  });
}

NSErrorRef SharePull::applyPage(Items items, const RZChangeToken* token) {
  newFolders_.clear();
  staged_.clear();
  waiting_.clear();
  busy_.clear();
  hasFolders_ = false;
  settled_.clear();
  forgotten_.clear();
  placed_.clear();
  dirty_.clear();
  inside_.clear();
  if (NSErrorRef error = read(items)) return error;
  makeRoom(items, token == nullptr ? Age::OfNow : Age::OfPage);
  NSErrorRef error = callOffRemovals(items);
  if (!error) error = addNew(items);
  if (!error) applyAll(items);
  if (!error && pullPlaced.hit()) error = NSError::errorWithErrno(EIO);
  // What counts as done and is not there, somebody has removed.
  if (!error && !placed_.empty()) error = tree_.sync();
  if (!error) error = storeContents(items, token, Step::Done);
  for (const auto& [id, path] : staged_) tree_.drop(path);
  NSErrorRef failure = scan();
  if (!failure) failure = noteUnseenRemovals();
  return error ? error : failure;
}

// --- New ones.

bool SharePull::isNew(const SharedItem& item) const {
  if (!item.record || item.row || waiting_.contains(item.id)) return false;
  // It went from here, and nobody has changed it since: the store is about to be told.
  const bool isPending = item.isBeingRemoved && !item.isRefused && item.content &&
                         item.content->zone == share_.zone &&
                         (item.isOwnSave() || saysTheSame(*item.record, *item.content));
  return !isPending;
}

/// What comes back is to be removed no longer: a job that found its new tag would do that.
NSErrorRef SharePull::callOffRemovals(const Items& items) {
  std::vector<std::uint64_t> ids;
  for (const SharedItem& item : items) {
    if (item.isBeingRemoved && isNew(item)) ids.push_back(item.id);
  }
  if (ids.empty()) return nullptr;
  return core_.database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    for (const std::uint64_t id : ids) {
      if (const auto job = findJob(connection, id, JobKind::Upload)) removeJob(connection, *job);
      addWaitingRecord(connection, share_.root, id);  // should we end before it is there
    }
    return NSErrorRef();
  });
}

void SharePull::wait(const SharedItem& item, const NSErrorRef& error) {
  waiting_.insert(item.id);
  const bool isBusy = error && error->domain() == NSPOSIXErrorDomain &&
                      (error->code() == EBUSY || error->code() == ENOTEMPTY ||
                       error->code() == ENOENT || error->code() == EAGAIN);
  if (isBusy) busy_.insert(item.id);
}

std::string SharePull::folderFor(const SharedItem& item) {
  if (item.isRoot(share_)) return folderBesideShare(core_, share_);
  const std::uint64_t parent = item.record->parent;
  const auto made = newFolders_.find(parent);
  if (made != newFolders_.end()) return made->second;
  auto known = inside_.find(parent);
  if (known == inside_.end()) {
    bool isInside = false;
    (void)core_.database().read([&](Connection& connection) {
      const auto row = findByID(connection, parent);
      const auto share = findShareAbove(connection, parent);
      isInside = row && row->isFolder() && share && share->root == share_.root;
    });
    known = inside_.emplace(parent, isInside).first;
  }
  return known->second ? core_.items->physicalPath(parent).value_or(std::string()) : std::string();
}

void SharePull::addFolder(SharedItem& item, const std::string& folder) {
  std::string staged;
  NSErrorRef error = tree_.stageFolder(item.id, share_.mayWrite, staged);
  if (error) {
    log_error(defaultLog(), "[ERROR] a shared folder cannot be made: %@", error);
    return wait(item, error);
  }
  staged_[item.id] = staged;
  placeNew(item, folder);
  if (!settled_.contains(item.id)) return;
  newFolders_[item.id] = item.path;
  hasFolders_ = true;
}

/// Those whose folder is known, until there are no more: they may come in any order.
void SharePull::addFolders(Items& items) {
  std::vector<SharedItem*> rest;
  for (SharedItem& item : items) {
    if (isNew(item) && item.record->isFolder) rest.push_back(&item);
  }
  for (bool isGoingOn = true; isGoingOn && !rest.empty();) {
    isGoingOn = false;
    std::vector<SharedItem*> later;
    for (SharedItem* const item : rest) {
      const std::string folder = folderFor(*item);
      if (folder.empty()) {
        later.push_back(item);
      } else {
        addFolder(*item, folder);
        isGoingOn = true;
      }
    }
    rest = std::move(later);
  }
  for (const SharedItem* const item : rest) wait(*item);
}

NSErrorRef SharePull::addNew(Items& items) {
  addFolders(items);
  std::vector<std::pair<SharedItem*, std::string>> documents;
  Items prepared;
  for (SharedItem& item : items) {
    if (!isNew(item) || item.record->isFolder) continue;
    std::string folder = folderFor(item);
    std::string staged;
    NSErrorRef error = folder.empty() ? nullptr
                                      : tree_.stage({.id = item.id,
                                                     .content = item.record->content,
                                                     .mtime = item.record->mtime,
                                                     .tag = item.record->tag,
                                                     .mayWrite = share_.mayWrite},
                                                    staged, item.stamp);
    if (error) log_error(defaultLog(), "[ERROR] a shared document waits: %@", error);
    if (staged.empty() || error) {
      wait(item, error);
      continue;
    }
    staged_[item.id] = staged;
    documents.emplace_back(&item, std::move(folder));
    prepared.push_back(item);
    prepared.back().path = staged;
    prepared.back().isFresh = true;
    settled_.insert(item.id);
  }
  if (documents.empty()) return nullptr;
  // What a loss of power takes away would be taken for a deletion.
  NSErrorRef error = tree_.sync();
  // Known before they are seen, so that nobody takes them for something new.
  if (!error) error = storeContents(prepared, nullptr, Step::Prepared);
  for (const SharedItem& item : prepared) settled_.erase(item.id);
  if (error) return error;
  for (auto& [item, folder] : documents) placeNew(*item, folder);
  return nullptr;
}

void SharePull::placeNew(SharedItem& item, const std::string& folder) {
  const std::string staged = staged_.at(item.id);
  std::string name = item.isRoot(share_) ? share_.title : item.record->name;
  if (item.isRoot(share_)) {
    if (NSErrorRef error = tree_.markShared(staged, true))
      log_error(defaultLog(), "[ERROR] an item cannot be marked as shared: %@", error);
  }
  if (NSErrorRef error = tree_.place(staged, folder, name)) {
    log_error(defaultLog(), "[ERROR] a shared item cannot be put into its folder: %@", error);
    return wait(item, error);
  }
  staged_.erase(item.id);
  item.path = folder + '/' + name;
  settled_.insert(item.id);
  item.isFresh = true;
  if (item.isRoot(share_)) {
    const auto parent = core_.items->itemAtPath(folder);
    if (parent) noteDirty(parent->id, item.path);
    rootPath_ = item.path;
    return;
  }
  placed_[item.id] = {.path = item.path, .folder = item.record->parent};
  if (!newFolders_.contains(item.record->parent)) noteDirty(item.record->parent, item.path);
}

// --- Known ones.

void SharePull::applyAll(Items& items) {
  for (SharedItem& item : items) {
    if (item.record && item.row && !item.isOwnEcho(share_)) applyKnown(item);
    // Its removal is refused unless it names the tag.
    if (item.record && !item.row && !isNew(item)) settled_.insert(item.id);
  }
  std::vector<SharedItem*> removed;
  for (SharedItem& item : items) {
    if (!item.record) removed.push_back(&item);
  }
  // What lies in a folder before the folder.
  std::stable_sort(removed.begin(), removed.end(), [](const SharedItem* a, const SharedItem* b) {
    return a->path.size() > b->path.size();
  });
  for (SharedItem* const item : removed) applyRemoval(*item);
}

void SharePull::applyKnown(SharedItem& item) {
  const bool isOfZone = item.content && item.content->zone == share_.zone;
  const bool isBack = share_.isOwn() && item.row->isTrashed() && !isOfZone;
  const bool isOurs = item.isInside || isOfZone || isBack;
  const bool isSameKind = item.row->isFolder() == item.record->isFolder;
  if (!isOurs || !isSameKind) return;  // an id that is another item's
  if (isBack) {
    if (NSErrorRef error = removeRecordElsewhere(item)) return wait(item, error);
  }
  settled_.insert(item.id);
  if (!item.record->isFolder) applyContent(item);
  // It takes along what others have changed; the store is about to be told that it has moved out.
  const bool isMovedOut = !item.isInside && !item.isRefused && !isBack;
  if (!isMovedOut && !item.isRoot(share_) && !waiting_.contains(item.id)) applyPlace(item);
}

/// What others had removed went to the owner's trash, and with it to a zone of his own.
NSErrorRef SharePull::removeRecordElsewhere(SharedItem& item) const {
  std::vector<NSErrorRef> refused;
  const bool hasRecord = item.content && item.content->hasRecord();
  NSErrorRef error =
      hasRecord ? store_->remove({{item.id, item.content->zone, {}}}, refused) : nullptr;
  if (!error && !refused.empty()) error = refused.front();
  if (!error) item.content.reset();
  return error;
}

std::string SharePull::folderForCopies(const SharedItem& item) const {
  if (!share_.mayWrite || item.isRoot(share_) || item.row->isTrashed())
    return folderBesideShare(core_, share_);
  return parentOf(item.path);
}

void SharePull::applyContent(SharedItem& item) {
  const bool isKnown = item.content && item.content->content == item.record->content;
  if (isKnown && !item.isRefused) return;
  ContentRow wanted;
  wanted.content = item.record->content;
  const FileStamp before = stampAt(item.path);
  if (before == FileStamp{})  // it has just gone elsewhere
    return wait(item, NSError::errorWithErrno(ENOENT, item.path));
  if (item.isOwnSave()) {  // what is in the file since is newer
    item.isFresh = true;
    item.stamp = *item.saving;
    return;
  }
  // They came to the same, or it came here before it was noted.
  item.isFresh = !isUnsaved(item.path, wanted, &item.stamp);
  if (item.isFresh) return;
  // What the account has elsewhere in the store goes from there when the item is of the share.
  const bool isOfZone = item.content && item.content->zone == share_.zone;
  const bool isHeld = isUnsaved(item.path, isOfZone ? item.content : std::nullopt);
  std::string staged;
  std::string displaced;
  const auto keep = [](bool isKept) {
    return isKept ? SharedTree::Kept::Yes : SharedTree::Kept::No;
  };
  bool isUntouched = false;
  NSErrorRef error = tree_.stage({.id = item.id,
                                  .content = item.record->content,
                                  .mtime = item.record->mtime,
                                  .tag = item.record->tag,
                                  .mayWrite = share_.mayWrite},
                                 staged, item.stamp);
  if (!error) error = tree_.replace(staged, item.path, keep(isHeld), displaced, isUntouched);
  if (error) {
    log_default(defaultLog(), "[NOTICE] a shared document waits for its change: %@", error);
    tree_.drop(staged);
    if (!displaced.empty()) tree_.drop(displaced);
    return wait(item, error);
  }
  (void)pullDisplaced.hit();
  // The row goes on with the new file, before the other one is seen.
  (void)core_.scanner->scanLocation(item.path, nullptr);
  item.isFresh = true;
  const FileStamp after = stampAt(displaced);
  if (!isHeld && isUntouched && after.hasSameContent(before)) return tree_.drop(displaced);
  std::string kept;
  error = tree_.keepCopy(displaced, folderForCopies(item), lastOf(item.path), kept);
  if (error) {
    log_error(defaultLog(), "[ERROR] %@ holds what was not saved: %@", displaced, error);
  } else {
    (void)core_.scanner->scanLocation(kept, nullptr);
  }
}

void SharePull::applyPlace(SharedItem& item) {
  const ItemRow& row = *item.row;
  const SharedRecord& record = *item.record;
  const bool isHereAsThere = row.name == record.name && row.parent == record.parent;
  const bool isRenamedHere =
      item.content && (row.name != item.content->name || row.parent != item.content->parent);
  // What was renamed here is about to be told to the store.
  if (isHereAsThere || (isRenamedHere && !item.isRefused)) return;
  const std::string folder = folderFor(item);
  if (folder.empty()) return wait(item);
  std::string name = record.name;
  if (NSErrorRef error = tree_.place(item.path, folder, name)) {
    log_error(defaultLog(), "[ERROR] a shared item cannot follow its move: %@", error);
    return wait(item, error);
  }
  hasFolders_ = hasFolders_ || row.isFolder();
  noteDirty(row.parent, item.path);
  item.path = folder + '/' + name;
  if (!newFolders_.contains(record.parent)) noteDirty(record.parent, item.path);
}

// --- Noting it.

ContentRow SharePull::contentOf(const SharedItem& item) const {
  const SharedRecord& record = *item.record;
  ContentRow row;
  if (item.content) row = *item.content;
  const bool isPlacedHere = item.isRoot(share_) || !share_.mayWrite;
  const std::string shown = lastOf(item.path);
  row.id = item.id;
  row.account = share_.account;
  row.zone = share_.zone;
  row.tag = record.tag;
  // A name that was taken here, where nobody may be told of another one, is ours alone.
  row.name = isPlacedHere && !item.path.empty() ? shown : record.name;
  row.parent = record.parent;
  if (item.isRoot(share_)) {
    const auto parent = core_.items->itemAtPath(parentOf(item.path));
    if (parent) row.parent = parent->id;
  }
  if (record.isFolder) {
    row.content.reset();
    return row;
  }
  row.content = record.content;
  // Not as the file is by now: somebody may have saved another one.
  if (item.isFresh) row.stamp = item.stamp;
  return row;
}

/// Until all of it is here nothing but this says that the shared item was: one that is missing then
/// has been removed.
void SharePull::noteRoot(Connection& connection) {
  const bool isHere = settled_.contains(share_.root) && !waiting_.contains(share_.root);
  if (!isHere || share_.isOwn() || !share_.zoneTag.empty()) return;
  auto stored = findShare(connection, share_.root);
  if (!stored) return;
  stored->zoneTag = kTagOfNone;
  storeShare(connection, *stored);
  share_.zoneTag = kTagOfNone;
}

NSErrorRef SharePull::storeContents(const Items& items, const RZChangeToken* token, Step step) {
  std::vector<ContentRow> contents;
  for (const SharedItem& item : items) {
    const bool isTaken = item.record && settled_.contains(item.id) && !waiting_.contains(item.id);
    // The owner's own folder has its record from an upload.
    if (isTaken) contents.push_back(contentOf(item));
  }
  NSErrorRef error = core_.database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    for (ContentRow& content : contents) {
      const auto now = findContent(connection, content.id);
      // It was known before it was put here: somebody has removed it, and the store was told.
      const bool isGone = !now && content.content && placed_.contains(content.id);
      if (isGone) continue;
      content.isPinned = now && now->isPinned;
      storeContent(connection, content);
      removeSavings(connection, content.id);
      if (findJob(connection, content.id, JobKind::Upload) || findByID(connection, content.id)) {
        const std::int64_t when = core_.now();
        addJob(connection, content.id, JobKind::Upload, content.account, when, when);
      }
    }
    for (const std::uint64_t id : forgotten_) {
      const auto now = findContent(connection, id);
      if (!now || now->zone != share_.zone) continue;
      removeContent(connection, id);
      // It may have been put back, and not been saved since it seemed to have a record.
      const std::int64_t when = core_.now();
      if (findByID(connection, id))
        addJob(connection, id, JobKind::Upload, now->account, when, when);
    }
    if (hasFolders_) makeWaitingRecordsDue(connection, share_.root);
    for (const SharedItem& item : items) {
      if (step == Step::Prepared) {  // should we end now, they are still to be taken over
        keepWaitingRecord(connection, share_.root, item.id);
      } else if (busy_.contains(item.id)) {
        addWaitingRecord(connection, share_.root, item.id);
      } else if (waiting_.contains(item.id)) {
        postponeWaitingRecord(connection, share_.root, item.id, core_.now());
      } else {
        removeWaitingRecord(connection, share_.root, item.id);
      }
    }
    if (step == Step::Done) noteRoot(connection);
    if (token == nullptr) return NSErrorRef();
    ShareRow stored = findShare(connection, share_.root).value_or(share_);
    stored.token = *token;
    storeShare(connection, stored);
    return NSErrorRef();
  });
  core_.queue->noteJobs(JobKind::Upload);
  (void)pullStored.hit();
  return error;
}

void SharePull::noteDirty(std::uint64_t folder, const std::string& path) {
  dirty_[folder].insert(lastOf(path));
}

NSErrorRef SharePull::scan() {
  std::vector<DirtyFolder> folders;
  for (auto& [id, names] : dirty_) {
    DirtyFolder& folder = folders.emplace_back();
    folder.id = id;
    folder.names.assign(names.begin(), names.end());
  }
  dirty_.clear();
  if (folders.empty()) return nullptr;
  std::vector<DirtyFolder> notFound;
  NSErrorRef error = core_.scanner->scanDirty(folders, notFound);
  forgetPlacedBelow(notFound);
  // Others may look at the same time, and leave it to each other.
  const std::string root = std::exchange(rootPath_, {});
  if (!error && !root.empty() && !core_.items->itemByID(share_.root))
    (void)core_.scanner->scanLocation(root, &error);
  return error;
}

}  // namespace yomber
