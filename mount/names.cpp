// Making, linking, renaming and removing entries.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "mount/file_system.h"
#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/thread_pool.h"
#include "platform/foundation/tree_faults.h"
#include "platform/ostrell/exclusions.h"

namespace yomber {
namespace {

FaultPoint moveDone("mount.move.done");

constexpr mode_t kSetID = S_ISUID | S_ISGID;

/// Once the file has lost the name to which the descriptor was opened.
Remains remainsAt(SharedDescriptor descriptor) {
  struct stat status{};
  const bool hasOtherNames = descriptor && fstat(descriptor->get(), &status) == 0 &&
                             !S_ISDIR(status.st_mode) && status.st_nlink > 0;
  return {.descriptor = std::move(descriptor), .hasOtherNames = hasOtherNames};
}

}  // namespace

void FileSystem::mknod(fuse_req_t request, Node& folder, const char* name, mode_t mode,
                       dev_t device) {
  makeEntry(request, folder, name, mode,
            [device](int descriptor, const char* onDisk, mode_t first) {
              return mknodat(descriptor, onDisk, first, device);
            });
}

void FileSystem::mkdir(fuse_req_t request, Node& folder, const char* name, mode_t mode) {
  makeEntry(request, folder, name, mode | S_IFDIR,
            [](int descriptor, const char* onDisk, mode_t first) {
              return mkdirat(descriptor, onDisk, first & ALLPERMS);
            });
}

void FileSystem::symlink(fuse_req_t request, const char* target, fuse_ino_t folder,
                         const char* name) {
  makeEntry(request, nodeOf(folder), name, 0, [target](int descriptor, const char* onDisk, mode_t) {
    return symlinkat(target, descriptor, onDisk);
  });
}

void FileSystem::link(fuse_req_t request, Node& node, fuse_ino_t folder, const char* name) {
  Node& target = nodeOf(folder);
  Descriptor source;
  int failure = descriptorOf(node, source);
  // We know one name of each file: without that, nobody could say whose content is to come. Nor is
  // it waited for here, with the folder locked; whoever is refused copies.
  if (failure == 0 && isFault(source.number)) failure = EPERM;
  const SharedDescriptor opened = failure == 0 ? folders_.open(target, failure) : nullptr;
  if (opened && isShownBase(target, name)) failure = EEXIST;
  if (failure == 0) {
    const std::string path = pathOfDescriptor(source.number);
    if (linkat(AT_FDCWD, path.c_str(), opened->get(), name, AT_SYMLINK_FOLLOW) != 0)
      failure = errno;
  }
  if (failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  nodes_.noteTold(target, 0);
  nodes_.noteTold(node, 0);
  answerMade(request, target, opened->get(), name);
}

void FileSystem::makeEntry(fuse_req_t request, Node& folder, const char* name, mode_t mode,
                           const std::function<int(int, const char*, mode_t)>& make) {
  int failure = 0;
  const SharedDescriptor descriptor = folders_.open(folder, failure);
  if (!descriptor || isShownBase(folder, name)) {
    (void)fuse_reply_err(request, descriptor ? EEXIST : failure);
    return;
  }
  if (make(descriptor->get(), name, firstMode(request, mode)) != 0) {
    (void)fuse_reply_err(request, errno);
    return;
  }
  failure = giveToCaller(request, descriptor->get(), name, mode);
  if (failure != 0) {
    (void)unlinkat(descriptor->get(), name, S_ISDIR(mode) ? AT_REMOVEDIR : 0);
    (void)fuse_reply_err(request, failure);
    return;
  }
  nodes_.noteTold(folder, 0);
  answerMade(request, folder, descriptor->get(), name);
}

/// Until it is the caller's, nobody may run it as us.
mode_t FileSystem::firstMode(fuse_req_t request, mode_t mode) {
  const fuse_ctx* const caller = fuse_req_ctx(request);
  const bool isOurs = caller->uid == geteuid() && caller->gid == getegid();
  return isOurs || S_ISDIR(mode) ? mode : mode & ~kSetID;
}

/// Nobody else sees it before: the kernel keeps the folder locked.
int FileSystem::giveToCaller(fuse_req_t request, int folder, const char* name, mode_t mode) const {
  const fuse_ctx* const caller = fuse_req_ctx(request);
  if (caller->uid == geteuid() && caller->gid == getegid()) return 0;
  struct stat above{};
  if (fstat(folder, &above) != 0) return errno;
  // A folder may say that what is made in it belongs to its group.
  const bool isInherited = (above.st_mode & S_ISGID) != 0;
  const gid_t group = isInherited ? static_cast<gid_t>(-1) : caller->gid;
  if (fchownat(folder, name, caller->uid, group, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if ((mode & kSetID) == 0 || S_ISDIR(mode)) return 0;
  return fchmodat(folder, name, mode & ALLPERMS, 0) == 0 ? 0 : errno;
}

void FileSystem::answerMade(fuse_req_t request, Node& folder, int descriptor,
                            const std::string& name) {
  const EntryGate::Moment begun = gate_.now(folder.identity.inode);
  struct statx status{};
  const int failure = lookAt(descriptor, name.c_str(), status);
  if (failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  answerFound(request, folder, name, status,
              EntryGate::Telling(gate_, folder.identity.inode, begun));
}

void FileSystem::unlink(fuse_req_t request, Node& folder, const char* name) {
  removeEntry(request, folder, name, 0);
}

void FileSystem::rmdir(fuse_req_t request, Node& folder, const char* name) {
  removeEntry(request, folder, name, AT_REMOVEDIR);
}

void FileSystem::removeEntry(fuse_req_t request, Node& folder, const char* name, int flags) {
  int failure = 0;
  const SharedDescriptor descriptor = folders_.open(folder, failure);
  if (descriptor && isShownBase(folder, name)) failure = EBUSY;
  if (!descriptor || failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const std::string onDisk = nameOnDisk(folder, name);
  const NodeUse gone = nodes_.inPlace(folder, onDisk);
  SharedDescriptor remains = remainsOf(gone, descriptor->get(), onDisk);
  std::optional<NodeTable::Moving> moving(nodes_);
  if (unlinkat(descriptor->get(), onDisk.c_str(), flags) != 0) {
    (void)fuse_reply_err(request, errno);
    return;
  }
  gate_.change(folder.identity.inode);
  if (gone) nodes_.noteTold(*gone.get(), 0);
  if (gone && gone->isFolder()) folders_.forget(gone->identity);
  nodes_.removed({.folder = folder, .name = onDisk, .node = gone.get()},
                 remainsAt(std::move(remains)));
  moving.reset();
  nodes_.noteTold(folder, 0);
  (void)fuse_reply_err(request, 0);
}

SharedDescriptor FileSystem::remainsOf(const NodeUse& node, int descriptor,
                                       const std::string& name) {
  if (!node) return nullptr;
  FileDescriptor opened(openat(descriptor, name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  struct statx status{};
  const bool isIt =
      opened && lookAt(opened.get(), "", status) == 0 && FileIdentity::of(status) == node->identity;
  return isIt ? std::make_shared<const FileDescriptor>(std::move(opened)) : nullptr;
}

void FileSystem::rename(fuse_req_t request, Node& folder, const char* name, fuse_ino_t newFolder,
                        const char* newName, unsigned flags) {
  Node& target = nodeOf(newFolder);
  if (isShownBase(folder, name) || isShownBase(target, newName)) {
    (void)fuse_reply_err(request, EBUSY);
    return;
  }
  Move move{.folder = &folder,
            .name = nameOnDisk(folder, name),
            .newFolder = &target,
            .newName = nameOnDisk(target, newName),
            .flags = flags,
            .hold = nullptr};
  std::vector<Move> toAsk;
  std::vector<Move> departures;
  for (const Move& way : bothWays(move)) {
    if (isToBeAsked(way)) toAsk.push_back(way);
    if (takesFolderOut(way)) departures.push_back(way);
  }
  if (toAsk.empty() && departures.empty()) return renameNow(request, move);
  move.hold = std::make_shared<EntryNotices::Hold>(entryNotices_, folder, target);
  ThreadPool::shared().async([this, request, move, departures, toAsk = std::move(toAsk)] {
    const auto hasFaults = [this](const Move& way) { return holdsFaults(way); };
    // Whoever moves it copies it then, and so brings what is away.
    if (std::ranges::any_of(departures, hasFaults)) return (void)fuse_reply_err(request, EXDEV);
    askThenRename(request, move, toAsk);
  });
}

std::vector<FileSystem::Move> FileSystem::bothWays(const Move& move) {
  if ((move.flags & RENAME_EXCHANGE) == 0) return {move};
  const Move back{.folder = move.newFolder,
                  .name = move.newName,
                  .newFolder = move.folder,
                  .newName = move.name,
                  .flags = move.flags,
                  .hold = nullptr};
  return {move, back};
}

/// Nobody brings what is away any more where the drive leaves things alone.
bool FileSystem::takesFolderOut(const Move& move) {
  const bool comes = move.newFolder->isUnwatched || qs_isExcludedName(move.newName);
  if (!comes || move.folder->isUnwatched || qs_isExcludedName(move.name)) return false;
  const NodeUse node = nodes_.inPlace(*move.folder, move.name);
  return node && node->isFolder();
}

bool FileSystem::holdsFaults(const Move& move) {
  int failure = 0;
  const SharedDescriptor folder = folders_.open(*move.folder, failure);
  return folder && holdsFault(pathOfDescriptor(folder->get()) + "/" + move.name);
}

void FileSystem::renameNow(fuse_req_t request, const Move& move) {
  const auto& [folder, name, newFolder, newName, flags, hold] = move;
  int failure = 0;
  const SharedDescriptor from = folders_.open(*folder, failure);
  const SharedDescriptor to = from ? folders_.open(*newFolder, failure) : nullptr;
  if (!to) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const bool isExchange = (flags & RENAME_EXCHANGE) != 0;
  const NodeUse node = nodes_.inPlace(*folder, name);
  const NodeUse other = nodes_.inPlace(*newFolder, newName);
  SharedDescriptor replaced = isExchange ? nullptr : remainsOf(other, to->get(), newName);
  std::optional<NodeTable::Moving> moving(nodes_);
  if (renameat2(from->get(), name.c_str(), to->get(), newName.c_str(), flags) != 0) {
    (void)fuse_reply_err(request, errno);
    return;
  }
  (void)moveDone.hit();
  for (Node* const place : {folder, newFolder}) {
    gate_.change(place->identity.inode);
    nodes_.noteTold(*place, 0);
  }
  for (const NodeUse* const each : {&node, &other}) {
    if (*each) nodes_.noteTold(*each->get(), 0);
  }
  nodes_.moved({.folder = *folder, .name = name, .node = node.get()},
               {.folder = *newFolder, .name = newName, .node = other.get()}, isExchange,
               remainsAt(std::move(replaced)));
  moving.reset();
  (void)fuse_reply_err(request, 0);
}

/// Which folders are shared, the daemon knows: any move to another folder may be one into a share,
/// or out of one. One to a name that the drive leaves alone takes it out of the drive. That matters
/// for a document that is away; of what is in a folder nothing would be brought.
bool FileSystem::isToBeAsked(const Move& move) {
  const auto from = nodes_.wayTo(*move.folder);
  const auto to = nodes_.wayTo(*move.newFolder);
  // The trash keeps an item where it belongs.
  if (!from || !to || to->base == Places::kTrash) return false;
  if (from->base == Places::kTrash) return lacksContent(*move.folder, move.name);
  if (from->base != to->base) return true;
  if (move.folder->isUnwatched || qs_isExcludedName(move.name)) return false;
  const bool isElsewhere = move.folder != move.newFolder || qs_isExcludedName(move.newName);
  return isElsewhere && lacksContent(*move.folder, move.name);
}

bool FileSystem::lacksContent(const Node& folder, const std::string& name) {
  int failure = 0;
  const SharedDescriptor descriptor = folders_.open(folder, failure);
  struct statx status{};
  if (!descriptor || lookAt(descriptor->get(), name.c_str(), status) != 0) return false;
  return S_ISREG(status.stx_mode) &&
         isFaultAtPath(pathOfDescriptor(descriptor->get()) + "/" + name);
}

void FileSystem::askThenRename(fuse_req_t request, const Move& move, std::vector<Move> toAsk) {
  if (toAsk.empty()) return renameNow(request, move);
  const Move asked = std::move(toAsk.back());
  toAsk.pop_back();
  const auto source = locationOf(*asked.folder);
  const auto target = locationOf(*asked.newFolder);
  const NodeUse node = nodes_.inPlace(*asked.folder, asked.name);
  if (!source || !target || !node) {
    (void)fuse_reply_err(request, ESTALE);
    return;
  }
  const auto shown = [&](const Node& folder, const std::string& name) {
    return "/" + places_->shownName(folder.identity.inode, name);
  };
  const std::string path = *source + shown(*asked.folder, asked.name);
  const std::string destination = *target + shown(*asked.newFolder, asked.newName);
  bool requiresProviding = false;
  const int failure = errnoOf(requests_->movingItem(path, destination, requiresProviding));
  // What the drive does not know, it has not away either.
  if (failure != 0 && failure != ENOENT) {
    (void)fuse_reply_err(request, failure);
  } else if (!requiresProviding) {
    askThenRename(request, move, std::move(toAsk));
  } else {
    waits_.wait(request, nodes_.use(*node.get()), path,
                [this, request, move, toAsk = std::move(toAsk)](int waited) {
                  if (waited == 0) return askThenRename(request, move, toAsk);
                  (void)fuse_reply_err(request, waited);
                });
  }
}

}  // namespace yomber
