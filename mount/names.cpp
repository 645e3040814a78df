// Making, linking, renaming and removing entries.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "mount/file_system.h"
#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {
namespace {

constexpr mode_t kSetID = S_ISUID | S_ISGID;

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
  const auto path = locationOf(node);
  if (!path || !isFaultAtPath(*path)) return makeLink(request, node, nodeOf(folder), name);
  // We know one name of each file: without that, nobody could say whose content is to come. What
  // has several names is not given up, so that it stays.
  auto source = std::make_shared<NodeUse>(nodes_.use(node));
  auto target = std::make_shared<NodeUse>(nodes_.use(nodeOf(folder)));
  waits_.wait(request, nodes_.use(node), *path,
              [this, request, source, target, entry = std::string(name)](int waited) {
                if (waited == 0 || waited == EBUSY)
                  return makeLink(request, *source->get(), *target->get(), entry.c_str());
                (void)fuse_reply_err(request, waited);
              });
}

void FileSystem::makeLink(fuse_req_t request, Node& node, Node& target, const char* name) {
  Descriptor source;
  const int failure = descriptorOf(node, source);
  if (failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const std::string path = pathOfDescriptor(source.number);
  int descriptor = 0;
  const SharedDescriptor opened = folders_.open(target, descriptor);
  if (!opened || isShownBase(target, name)) {
    (void)fuse_reply_err(request, opened ? EEXIST : descriptor);
    return;
  }
  if (linkat(AT_FDCWD, path.c_str(), opened->get(), name, AT_SYMLINK_FOLLOW) != 0) {
    (void)fuse_reply_err(request, errno);
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
  answerFound(request, folder, name, status, begun);
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
  SharedDescriptor remains = remainsOf(folder, descriptor->get(), onDisk);
  std::optional<NodeTable::Moving> moving(nodes_);
  if (unlinkat(descriptor->get(), onDisk.c_str(), flags) != 0) {
    (void)fuse_reply_err(request, errno);
    return;
  }
  if (const NodeUse gone = nodes_.inPlace(folder, onDisk)) {
    nodes_.noteTold(*gone.get(), 0);
    if (gone->isFolder()) folders_.forget(gone->identity);
  }
  nodes_.removed(folder, onDisk, std::move(remains));
  moving.reset();
  nodes_.noteTold(folder, 0);
  (void)fuse_reply_err(request, 0);
}

SharedDescriptor FileSystem::remainsOf(Node& folder, int descriptor, const std::string& name) {
  const NodeUse node = nodes_.inPlace(folder, name);
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
  const std::string from = nameOnDisk(folder, name);
  const std::string to = nameOnDisk(target, newName);
  if (askBeforeMove(request, folder, from, target, to, flags)) return;
  renameNow(request, folder, from, target, to, flags);
}

void FileSystem::renameNow(fuse_req_t request, Node& folder, const std::string& name,
                           Node& newFolder, const std::string& newName, unsigned flags) {
  int failure = 0;
  const SharedDescriptor from = folders_.open(folder, failure);
  const SharedDescriptor to = from ? folders_.open(newFolder, failure) : nullptr;
  if (!to) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const bool isExchange = (flags & RENAME_EXCHANGE) != 0;
  SharedDescriptor replaced;
  if (!isExchange) replaced = remainsOf(newFolder, to->get(), newName);
  std::optional<NodeTable::Moving> moving(nodes_);
  if (renameat2(from->get(), name.c_str(), to->get(), newName.c_str(), flags) != 0) {
    (void)fuse_reply_err(request, errno);
    return;
  }
  for (const auto& [place, moved] : {std::pair(&folder, &name), std::pair(&newFolder, &newName)}) {
    if (const NodeUse node = nodes_.inPlace(*place, *moved)) nodes_.noteTold(*node.get(), 0);
    nodes_.noteTold(*place, 0);
  }
  nodes_.moved(folder, name, newFolder, newName, isExchange, std::move(replaced));
  moving.reset();
  (void)fuse_reply_err(request, 0);
}

bool FileSystem::askBeforeMove(fuse_req_t request, Node& folder, const std::string& name,
                               Node& newFolder, const std::string& newName, unsigned flags) {
  const auto from = nodes_.wayTo(folder);
  const auto to = nodes_.wayTo(newFolder);
  const bool isWithin = !from || !to || from->base == to->base || from->base == Places::kTrash ||
                        to->base == Places::kTrash;
  const auto source = locationOf(folder);
  const auto target = locationOf(newFolder);
  if (isWithin || !source || !target) return false;
  const std::string path = *source + "/" + places_->shownName(folder.identity.inode, name);
  const std::string destination =
      *target + "/" + places_->shownName(newFolder.identity.inode, newName);
  ThreadPool::shared().async(
      [this, request, &folder, name, &newFolder, newName, flags, path, destination] {
        bool requiresProviding = false;
        const NSErrorRef error = requests_->movingItem(path, destination, requiresProviding);
        const NodeUse node = nodes_.inPlace(folder, name);
        if (error) {
          (void)fuse_reply_err(request, errnoOf(error));
        } else if (!requiresProviding || !node) {
          renameNow(request, folder, name, newFolder, newName, flags);
        } else {
          waits_.wait(request, nodes_.use(*node.get()), path,
                      [this, request, &folder, name, &newFolder, newName, flags](int failure) {
                        if (failure != 0) {
                          (void)fuse_reply_err(request, failure);
                        } else {
                          renameNow(request, folder, name, newFolder, newName, flags);
                        }
                      });
        }
      });
  return true;
}

}  // namespace yomber
