// Following a share: what others have removed, and what may not stay.
#include <sys/stat.h>

#include <cerrno>

#include "platform/foundation/log.h"
#include "zarn/content/share_pull.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

constexpr std::int64_t kTimeToMove = 1'000'000'000;

std::string lastOf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

FileStamp stampAt(const std::string& path) {
  struct stat status{};
  return lstat(path.c_str(), &status) == 0 ? FileStamp::of(status) : FileStamp{};
}

}  // namespace

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

/// What somebody has removed between the moment in which it was put here and the first look at it
/// has never had a row, whose end would tell the store. It may have moved as well: then it gets a
/// row elsewhere before its job is due, which finds that.
NSErrorRef SharePull::noteUnseenRemovals() {
  std::vector<std::uint64_t> gone;
  struct stat status{};
  for (const auto& [id, path] : placed_) {
    if (lstat(path.c_str(), &status) != 0 && errno == ENOENT) gone.push_back(id);
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
