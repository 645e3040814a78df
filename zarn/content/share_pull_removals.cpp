// Following a share: what others have removed, and what may not stay.
#include <sys/stat.h>

#include <cerrno>
#include <map>
#include <utility>

#include "platform/foundation/log.h"
#include "zarn/content/new_identity.h"
#include "zarn/content/share_pull.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

constexpr std::int64_t kTimeToMove = 1'000'000'000;

std::string lastOf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

/// Whether all that a folder holds can be seen, so that what is not seen in it is not there.
bool isReadable(const ContentCore& core, std::uint64_t folder) {
  const auto path = core.items->physicalPath(folder);
  std::vector<std::string> names;
  return path && !SharedTree::list(*path, names);
}

/// Items that have a record but are not here, by whether their folder says that they have gone.
struct LostItems {
  std::vector<ContentRow> gone;
  std::vector<std::uint64_t> unknown;
};

LostItems sortLost(const ContentCore& core, std::map<std::uint64_t, ContentRow> lost) {
  LostItems items;
  std::map<std::uint64_t, bool> readable;
  for (const auto& [id, content] : lost) {
    std::uint64_t folder = content.parent;
    std::size_t steps = 0;
    // With a folder has gone what is in it.
    for (auto above = lost.find(folder); above != lost.end() && steps < lost.size(); ++steps) {
      folder = above->second.parent;
      above = lost.find(folder);
    }
    const auto [known, isNew] = readable.try_emplace(folder);
    if (isNew) known->second = isReadable(core, folder);
    if (known->second) {
      items.gone.push_back(content);
    } else {
      items.unknown.push_back(id);
    }
  }
  return items;
}

}  // namespace

std::string folderBesideShare(const ContentCore& core, const ShareRow& share) {
  const auto row = core.items->itemByID(share.root);
  const bool isElsewhere = !row || row->isTrashed() || row->parent == kNoParent;
  const auto path = isElsewhere ? std::nullopt : core.items->physicalPath(row->parent);
  return path.value_or(core.items->layout().root());
}

NSErrorRef noteRemovalsBeforeStart(ContentCore& core, const ShareRow& share) {
  std::map<std::uint64_t, ContentRow> lost;
  NSErrorRef error = core.database().read([&](Connection& connection) {
    const ReadTransaction transaction(connection);
    // With the shared item goes what is in it: that is leaving the share.
    if (share.isLeaving() || !findByID(connection, share.root)) return;
    for (const std::uint64_t id : findLostContent(connection, share)) {
      if (auto content = findContent(connection, id)) lost.emplace(id, std::move(*content));
    }
  });
  if (error || lost.empty()) return error;
  const LostItems items = sortLost(core, std::move(lost));
  error = core.database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    const std::int64_t now = core.now();
    for (const ContentRow& content : items.gone) {
      if (!findByID(connection, content.id))
        addJob(connection, content.id, JobKind::Upload, content.account, now, now);
    }
    for (const std::uint64_t id : items.unknown) keepWaitingRecord(connection, share.root, id);
    return NSErrorRef();
  });
  core.queue->noteJobs(JobKind::Upload);
  return error;
}

/// What was moved out of the share before, and is the account's own since.
bool SharePull::hasIDOfAnother(const SharedItem& item) const {
  const bool isOfZone = item.content && item.content->zone == share_.zone;
  if (!item.record || !item.row || item.isInside || isOfZone || item.isRoot(share_)) return false;
  if (share_.isOwn() && item.row->isTrashed()) return false;  // it comes back from there
  bool isShare = true;
  (void)core_.database().read(
      [&](Connection& connection) { isShare = findShare(connection, item.id).has_value(); });
  return !isShare && !item.row->isContainerFolder();
}

/// Records that come to have the id of an item of the account's own are new here, and that gets
/// another id.
void SharePull::makeRoom(Items& items, Age age) {
  for (SharedItem& item : items) {
    if (hasIDOfAnother(item)) {
      // It may have been on its way out when the page was made.
      const NSErrorRef error =
          age == Age::OfPage ? NSError::errorWithErrno(EAGAIN) : giveNewIdentity(core_, item.id);
      if (error) {
        wait(item, error);
        continue;
      }
      item.row.reset();
      item.path.clear();
      item.isBeingRemoved = true;
    }
    const bool isElsewhere = item.record && !item.row && item.content &&
                             item.content->hasRecord() && item.content->zone != share_.zone;
    // Whoever is to remove that record goes by what is known of it.
    if (isElsewhere && item.isBeingRemoved) wait(item, NSError::errorWithErrno(EAGAIN));
  }
}

/// Something that is new here, where nothing may be added.
void SharePull::moveOut(SharedItem& item) {
  const std::string folder = folderBesideShare(core_, share_);
  std::string name = lastOf(item.path);
  tree_.setWritable(item.path, true);
  if (NSErrorRef error = tree_.place(item.path, folder, name)) {
    log_error(defaultLog(), "[ERROR] %@ cannot be moved out of the share: %@", item.path, error);
    return wait(item, error);
  }
  noteDirty(item.row->parent, item.path);
  const auto parent = core_.items->itemAtPath(folder);
  if (parent) noteDirty(parent->id, folder + '/' + name);
}

void SharePull::applyRemoval(SharedItem& item) {
  if (item.isRoot(share_)) return;  // it goes with the share
  const bool isOfZone = item.content && item.content->zone == share_.zone;
  if (isOfZone) forgotten_.insert(item.id);
  if (!item.row || !item.isInside) return;
  if (!isOfZone) {
    if (item.isRefused) moveOut(item);
    return;
  }
  if (item.row->isFolder()) return removeFolder(item);
  const FileStamp seen = stampAt(item.path);
  const bool isHeld = isUnsaved(item.path, item.content);
  if (share_.isOwn() && !isHeld && core_.trash) return moveToTrash(item, seen);
  std::string taken;
  NSErrorRef error = tree_.takeAway(
      item.path, isHeld ? SharedTree::Kept::Yes : SharedTree::Kept::No, taken, &seen);
  if (error) {
    forgotten_.erase(item.id);
    return wait(item, error);
  }
  forget(item);
  (void)core_.scanner->scanLocation(item.path, nullptr);
  if (!isHeld) return tree_.drop(taken);
  std::string kept;
  error = tree_.keepCopy(taken, folderForCopies(item), lastOf(item.path), kept);
  if (error) return log_error(defaultLog(), "[ERROR] %@ was not saved: %@", taken, error);
  (void)core_.scanner->scanLocation(kept, nullptr);
}

/// Before anybody looks: whoever finds out that it is gone would have the store told, where it may
/// have been put back.
void SharePull::forget(const SharedItem& item) {
  const NSErrorRef error = core_.database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    const auto content = findContent(connection, item.id);
    if (content && content->zone == share_.zone) removeContent(connection, item.id);
    const auto job = findJob(connection, item.id, JobKind::Upload);
    if (job && !findByID(connection, item.id)) removeJob(connection, *job);
    return NSErrorRef();
  });
  if (!error) forgotten_.erase(item.id);
}

/// What somebody else has removed from the account's own share can be put back.
void SharePull::moveToTrash(const SharedItem& item, const FileStamp& seen) {
  NSErrorRef error = SharedTree::checkUnused(item.path, seen);
  if (!error) error = core_.trash(item.path);
  if (!error) {
    return log_default(defaultLog(), "[NOTICE] %@ was removed by others, and is in the trash",
                       item.path);
  }
  forgotten_.erase(item.id);
  wait(item, error);
}

/// Only what is empty goes. What is in it goes before, or with the next changes; what is left when
/// there are no more was put there by somebody who did not know.
void SharePull::removeFolder(SharedItem& item) {
  NSErrorRef error = tree_.removeFolder(item.path);
  const bool isFull = error && error->is(NSPOSIXErrorDomain, ENOTEMPTY);
  if (isFull && isAtEnd_) {
    error = clearOut(item);
    if (!error) error = tree_.removeFolder(item.path);
  }
  if (error) {
    forgotten_.erase(item.id);
    return wait(item, error);
  }
  forget(item);
  noteDirty(item.row->parent, item.path);
}

/// Brings all that a folder holds to the shared item itself; what others are to move, stays.
NSErrorRef SharePull::clearOut(const SharedItem& item) {
  bool isWaiting = false;
  NSErrorRef error = core_.database().read([&](Connection& connection) {
    for (const std::uint64_t child : findChildIDs(connection, item.id)) {
      const auto content = findContent(connection, child);
      isWaiting = isWaiting || (content && content->isRecorded() && content->zone == share_.zone);
    }
  });
  std::vector<std::string> names;
  if (!error) error = SharedTree::list(item.path, names);
  const auto root = error ? std::nullopt : core_.items->physicalPath(share_.root, &error);
  if (error) return error;
  if (!root || (isWaiting && !share_.mayWrite)) return NSError::errorWithErrno(EBUSY, item.path);
  const std::string folder = share_.mayWrite ? *root : folderBesideShare(core_, share_);
  const auto parent = core_.items->itemAtPath(folder);
  for (const std::string& each : names) {
    const std::string path = item.path + '/' + each;
    std::string name = each;
    if (!share_.mayWrite) tree_.setWritable(path, true);
    error = tree_.place(path, folder, name);
    if (error) return error;
    noteDirty(item.id, path);
    if (parent) noteDirty(parent->id, folder + '/' + name);
  }
  return nullptr;
}

/// Of folders that are not where they were nothing can be said: they may be on their way, with all
/// that was put into them.
void SharePull::forgetPlacedBelow(const std::vector<DirtyFolder>& folders) {
  std::vector<std::uint64_t> rest;
  for (const DirtyFolder& folder : folders) rest.push_back(folder.id);
  while (!rest.empty()) {
    const std::uint64_t folder = rest.back();
    rest.pop_back();
    std::erase_if(placed_, [&](const auto& each) {
      const bool isIn = each.second.folder == folder;
      if (isIn) rest.push_back(each.first);
      return isIn;
    });
  }
}

/// What somebody has removed between the moment in which it was put here and the first look at it
/// has never had a row, whose end would tell the store. It may have moved as well: then it gets a
/// row elsewhere before its job is due, which finds that.
NSErrorRef SharePull::noteUnseenRemovals() {
  std::vector<std::uint64_t> gone;
  struct stat status{};
  for (const auto& [id, placed] : placed_) {
    if (lstat(placed.path.c_str(), &status) != 0 && errno == ENOENT) gone.push_back(id);
  }
  if (gone.empty()) return nullptr;
  NSErrorRef error = core_.database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    const std::int64_t now = core_.now();
    for (const std::uint64_t id : gone) {
      const auto content = findContent(connection, id);
      const bool isKnown = findByID(connection, id) || findJob(connection, id, JobKind::Upload);
      if (!content || content->zone != share_.zone || isKnown) continue;
      addJob(connection, id, JobKind::Upload, content->account, now + kTimeToMove, now);
    }
    return NSErrorRef();
  });
  core_.queue->noteJobs(JobKind::Upload);
  return error;
}

}  // namespace yomber
