#include "zarn/content/share_remains.h"

#include <dirent.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <cerrno>
#include <memory>
#include <set>
#include <string_view>
#include <utility>

#include "platform/foundation/bounced_name.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "zarn/content/file_lease.h"
#include "zarn/content/share_rows.h"
#include "zarn/content/shared_item.h"
#include "zarn/item_attributes.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

FaultPoint leaveRemoving("zarn.leave.removing");

using Fate = GoingItems::Fate;

struct Found {
  ItemRow row;
  std::optional<ContentRow> content;
  bool isOtherShare = false;
};

/// Those above before those below; not into other shares.
std::vector<Found> findAll(Connection& connection, const ItemRow& root) {
  std::vector<Found> all;
  std::vector<ItemRow> rest{root};
  while (!rest.empty()) {
    Found found;
    found.row = std::move(rest.back());
    rest.pop_back();
    found.content = findContent(connection, found.row.id);
    found.isOtherShare = found.row.id != root.id && findShare(connection, found.row.id);
    if (found.row.isFolder() && !found.isOtherShare) {
      for (ItemRow& child : findChildren(connection, found.row.id))
        rest.push_back(std::move(child));
    }
    all.push_back(std::move(found));
  }
  return all;
}

/// The items that have a record in the zone, and the folders above them.
std::set<std::uint64_t> findShared(const std::vector<Found>& all, const RZRecordZoneID& zone) {
  std::set<std::uint64_t> shared;
  for (auto found = all.rbegin(); found != all.rend(); ++found) {
    const auto& content = found->content;
    const bool isRecorded = content && content->isRecorded() && content->zone == zone;
    if (!isRecorded && !shared.contains(found->row.id)) continue;
    if (found->isOtherShare) continue;
    shared.insert(found->row.id);
    shared.insert(found->row.parent);
  }
  return shared;
}

Fate fateOf(const Found& found, const RZRecordZoneID& zone, bool isShared) {
  if (found.isOtherShare) return Fate::Stays;
  if (found.row.isFolder()) return isShared ? Fate::Opened : Fate::Stays;
  if (found.row.kind != ItemKind::Document) return Fate::Stays;
  const bool isElsewhere =
      found.content && found.content->isRecorded() && found.content->zone != zone;
  return isElsewhere ? Fate::Stays : Fate::Goes;
}

bool isThere(const std::string& path) {
  struct stat status{};
  return lstat(path.c_str(), &status) == 0;
}

std::string lastOf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

NSErrorRef listFolder(const std::string& path, std::vector<std::string>& entries) {
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(opendir(path.c_str()), closedir);
  if (!stream) return NSError::errorWithErrno(errno, path);
  for (;;) {
    errno = 0;
    const dirent* const entry = readdir(stream.get());
    if (entry == nullptr) return errno == 0 ? nullptr : NSError::errorWithErrno(errno, path);
    const std::string_view name = entry->d_name;
    if (name != "." && name != "..") entries.push_back(path + '/' + std::string(name));
  }
}

/// Whether somebody has a document open for writing: what is yet to be written through that
/// descriptor would go with the file. One without content is open to be filled.
bool isBeingWritten(const std::string& path) {
  return !isFaultAtPath(path) && isOpenForWriting(path);
}

/// Takes away the marks of a share that could only be read.
void makeWritable(const SharedTree& tree, const std::string& top) {
  std::vector<std::string> rest{top};
  while (!rest.empty()) {
    const std::string path = std::move(rest.back());
    rest.pop_back();
    struct stat status{};
    if (lstat(path.c_str(), &status) != 0) continue;
    if (lgetxattr(path.c_str(), kOnlyReadableAttribute, nullptr, 0) >= 0)
      tree.setWritable(path, true);
    if (S_ISDIR(status.st_mode)) (void)listFolder(path, rest);
  }
}

}  // namespace

NSErrorRef GoingItems::read(const ContentCore& core, const ItemRow& root,
                            const RZRecordZoneID& zone, GoingItems& items) {
  items = {};
  return core.database().read([&](Connection& connection) {
    const ReadTransaction transaction(connection);
    const std::vector<Found> all = findAll(connection, root);
    std::set<std::uint64_t> shared = findShared(all, zone);
    shared.insert(root.id);
    std::set<std::uint64_t> staying;
    for (const Found& found : all) {
      const ItemRow& row = found.row;
      if (staying.contains(row.parent)) {
        staying.insert(row.id);
        continue;
      }
      Fate fate = fateOf(found, zone, shared.contains(row.id));
      std::optional<ContentRow> content = found.content;
      if (row.id == root.id && fate == Fate::Stays) {  // a document with its record elsewhere
        fate = Fate::Goes;
        content.reset();
      }
      if (fate == Fate::Stays) staying.insert(row.id);
      if (fate == Fate::Goes) items.documents.push_back(row.id);
      items.byInode[row.inode] = {.id = row.id,
                                  .parent = row.parent,
                                  .fate = fate,
                                  .isOtherShare = found.isOtherShare,
                                  .content = std::move(content)};
    }
  });
}

std::vector<std::uint64_t> GoingItems::foldersOfStaying() const {
  std::set<std::uint64_t> folders;
  for (const auto& [inode, item] : byInode) {
    if (item.fate == Fate::Stays) folders.insert(item.parent);
  }
  return {folders.begin(), folders.end()};
}

NSErrorRef ShareRemains::keep(const std::string& top) {
  std::vector<std::string> rest{top};
  while (!rest.empty()) {
    const std::string path = std::move(rest.back());
    rest.pop_back();
    if (NSErrorRef error = keepOne(path, path == top, rest)) return error;
  }
  return nullptr;
}

NSErrorRef ShareRemains::keepOne(const std::string& path, bool isTop,
                                 std::vector<std::string>& rest) {
  struct stat status{};
  if (lstat(path.c_str(), &status) != 0)
    return errno == ENOENT ? nullptr : NSError::errorWithErrno(errno, path);
  const GoingItems::Item* const known = find(status.st_ino);
  if (known == nullptr && !isTop) return keepUnseen(path, status);
  if (known != nullptr && !isTop && known->fate == Fate::Stays)
    return keepOwn(path, known->parent, lastOf(path), known->isOtherShare);
  if (S_ISDIR(status.st_mode)) return listFolder(path, rest);
  const std::optional<ContentRow> content = known != nullptr ? known->content : std::nullopt;
  if (!isUnsaved(path, content) && !isBeingWritten(path)) return nullptr;
  return keepCopy(path, isTop ? name_ : lastOf(path));
}

const GoingItems::Item* ShareRemains::find(std::uint64_t inode) const {
  const auto known = items_.byInode.find(inode);
  return known == items_.byInode.end() ? nullptr : &known->second;
}

NSErrorRef ShareRemains::remove(const std::string& top) {
  constexpr int kMostLooks = 100;
  struct Place {
    std::string path;
    int looks = 0;
  };
  std::vector<Place> rest{{.path = top}};
  while (!rest.empty()) {
    const std::string path = rest.back().path;
    if (!isThere(path)) {
      rest.pop_back();
      continue;
    }
    if (++rest.back().looks > kMostLooks) return NSError::errorWithErrno(EBUSY, path);
    std::vector<std::string> entries;
    if (NSErrorRef error = removeOne(path, path == top, entries)) return error;
    for (std::string& entry : entries) rest.push_back({.path = std::move(entry)});
  }
  return nullptr;
}

/// A folder goes when nothing is in it: who has it open may put something there until then, and
/// nothing after that.
NSErrorRef ShareRemains::removeOne(const std::string& path, bool isTop,
                                   std::vector<std::string>& entries) {
  struct stat status{};
  if (lstat(path.c_str(), &status) != 0)
    return errno == ENOENT ? nullptr : NSError::errorWithErrno(errno, path);
  const GoingItems::Item* const known = find(status.st_ino);
  const bool isToMove = !isTop && (known == nullptr || known->fate == Fate::Stays);
  if (isToMove) return keepOne(path, isTop, entries);
  if (!S_ISDIR(status.st_mode))
    return removeDocument(path, isTop ? name_ : lastOf(path),
                          known != nullptr ? known->content : std::nullopt);
  tree_.setWritable(path, true);
  NSErrorRef error = listFolder(path, entries);
  if (error || !entries.empty()) return error;
  if (leaveRemoving.hit()) return NSError::errorWithErrno(EIO, path);
  error = tree_.removeFolder(path);
  return error && error->is(NSPOSIXErrorDomain, ENOTEMPTY) ? nullptr : error;
}

/// Nobody may write to it between the look at it and its end.
NSErrorRef ShareRemains::removeDocument(const std::string& path, const std::string& name,
                                        const std::optional<ContentRow>& content) const {
  const FileStamp seen = stampAt(path);
  if (isUnsaved(path, content) || isBeingWritten(path)) return keepCopy(path, name);
  std::string taken;
  NSErrorRef error = tree_.takeAway(path, SharedTree::Kept::No, taken, &seen);
  // The latter is one that is being filled.
  const bool isOpen =
      error && (error->is(NSPOSIXErrorDomain, EBUSY) || error->is(NSPOSIXErrorDomain, EWOULDBLOCK));
  if (isOpen) {
    // Out of reach first: who has it open still can have written to it, but nobody else comes.
    error = tree_.takeAway(path, SharedTree::Kept::Yes, taken);
    if (error) return error;
    if (isBeingWritten(taken) || isUnsaved(taken, content)) return bringBack(taken, name);
  }
  if (!error) tree_.drop(taken);
  return error;
}

NSErrorRef ShareRemains::keepCopy(const std::string& path, const std::string& name) const {
  std::string taken;
  if (NSErrorRef error = tree_.takeAway(path, SharedTree::Kept::Yes, taken)) return error;
  (void)core_.scanner->scanLocation(path, nullptr);
  return bringBack(taken, name);
}

NSErrorRef ShareRemains::bringBack(const std::string& taken, const std::string& name) const {
  std::string kept;
  NSErrorRef error = tree_.keepCopy(taken, folder_, name, kept);
  if (!error) (void)core_.scanner->scanLocation(kept, nullptr);
  return error;
}

NSErrorRef ShareRemains::keepOwn(const std::string& path, std::uint64_t parent,
                                 const std::string& nameThere, bool isOtherShare) const {
  const auto folder = core_.items->itemAtPath(folder_);
  if (!folder) return NSError::errorWithErrno(EAGAIN, folder_);
  std::string name = lastOf(path);
  if (NSErrorRef error = tree_.place(path, folder_, name)) return error;
  const std::string place = folder_ + '/' + name;
  if (!isOtherShare) makeWritable(tree_, place);
  log_default(defaultLog(), "[NOTICE] what was this account's own is now %@", place);
  // Both ends as one change: it is the same item.
  std::vector<DirtyFolder> dirty(2);
  dirty[0].id = parent;
  dirty[0].names = {nameThere};
  dirty[1].id = folder->id;
  dirty[1].names = {name};
  std::vector<DirtyFolder> notFound;
  return core_.scanner->scanDirty(dirty, notFound);
}

/// What was moved in before anybody saw that has its row where it was.
NSErrorRef ShareRemains::keepUnseen(const std::string& path, const struct stat& status) {
  std::optional<ItemRow> elsewhere;
  bool isOtherShare = false;
  NSErrorRef error = core_.database().read([&](Connection& connection) {
    for (ItemRow& row : findByInode(connection, status.st_ino)) {
      if (row.isFolder() != S_ISDIR(status.st_mode)) continue;
      isOtherShare = findShare(connection, row.id).has_value();
      elsewhere = std::move(row);
    }
  });
  if (error) return error;
  if (!elsewhere) return keepUnknown(path);
  return keepOwn(path, elsewhere->parent, elsewhere->nameOnDisk(), isOtherShare);
}

NSErrorRef ShareRemains::keepUnknown(const std::string& path) {
  if (unknownFolder_.empty()) {
    int number = 0;
    const std::string made = bouncedName(keptCopyName(name_), [&](const std::string& each) {
      number = mkdir((folder_ + '/' + each).c_str(), 0700) == 0 ? 0 : errno;
      return number == EEXIST;
    });
    if (number != 0) return NSError::errorWithErrno(number, folder_ + '/' + made);
    unknownFolder_ = folder_ + '/' + made;
  }
  std::string name = lastOf(path);
  if (NSErrorRef error = tree_.place(path, unknownFolder_, name)) return error;
  log_default(defaultLog(), "[NOTICE] what was never saved in the store is kept in %@",
              unknownFolder_);
  (void)core_.scanner->scanLocation(path, nullptr);
  (void)core_.scanner->scanLocation(unknownFolder_ + '/' + name, nullptr);
  return nullptr;
}

}  // namespace yomber
