#include "zarn/tree_walker.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sched.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>

#include "platform/foundation/log.h"

namespace yomber {
namespace {

constexpr int kOpenFolderFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK;
/// Levels above the current one that keep their descriptor.
constexpr std::size_t kOpenLevels = 64;

std::shared_ptr<const FileDescriptor> shared(int descriptor) {
  if (descriptor < 0) return nullptr;
  return std::make_shared<const FileDescriptor>(descriptor);
}

int openBeneath(int base, const std::string& relative) {
  open_how how{};
  how.flags = kOpenFolderFlags;
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_XDEV;
  return static_cast<int>(syscall(SYS_openat2, base, relative.c_str(), &how, sizeof(how)));
}

/// Gives the calling thread a working directory of its own, so that it can name files relative to
/// the folder that it reads. False where the system does not allow it.
bool hasOwnWorkingDirectory() {
  thread_local const bool hasOwn = unshare(CLONE_FS) == 0;
  return hasOwn;
}

}  // namespace

std::shared_ptr<const FileDescriptor> openFolder(const std::string& path) {
  return shared(::open(path.c_str(), kOpenFolderFlags));
}

std::shared_ptr<const FileDescriptor> openFolderBelow(int base, std::string_view relative) {
  // Longer ones the kernel refuses.
  constexpr std::size_t kLongest = PATH_MAX - 1;
  auto at = shared(openat(base, ".", kOpenFolderFlags));
  while (at && !relative.empty()) {
    std::size_t length = relative.size();
    if (length > kLongest) length = relative.rfind('/', kLongest);
    if (length == std::string_view::npos || length == 0) {
      errno = ENAMETOOLONG;
      return nullptr;
    }
    at = shared(openBeneath(at->get(), std::string(relative.substr(0, length))));
    relative.remove_prefix(std::min(relative.size(), length + 1));
  }
  return at;
}

std::uint64_t TreeWalker::nextVisit() {
  static std::atomic<std::uint64_t> last{0};
  return ++last;
}

std::unique_ptr<FolderSnapshot> TreeWalker::read(std::shared_ptr<const FileDescriptor> folder,
                                                 std::uint64_t visit) {
  auto snapshot = std::make_unique<FolderSnapshot>();
  snapshot->visit = visit;
  if (!folder) return snapshot;
  if (const auto visitor = options_.visitor.lock()) visitor->willReadFolder(visit, folder->get());
  snapshot->rankBefore = options_.currentRank();
  snapshot->folder = std::move(folder);
  const int descriptor = snapshot->folder->get();
  if (!lookAtEntry(descriptor, "", snapshot->self)) return snapshot;
  if (const int failure = readFolderEntries(descriptor, *snapshot); failure != 0) {
    log_error(defaultLog(),
              "[ERROR] a folder cannot be read (inode %llu): %s; its items stay as known",
              snapshot->self.inode, std::strerror(failure));
    return snapshot;
  }
  for (FolderEntry& entry : snapshot->entries) {
    if (entry.type == EntryType::Folder) entry.visit = nextVisit();
  }
  if (options_.readsAttributes) readAttributes(*snapshot);
  snapshot->isReadable = true;
  return snapshot;
}

void TreeWalker::readAttributes(FolderSnapshot& snapshot) {
  const int folder = snapshot.folder->get();
  const bool isRelative = hasOwnWorkingDirectory() && fchdir(folder) == 0;
  for (std::size_t i = 0; i < snapshot.entries.size(); ++i) {
    const FolderEntry& entry = snapshot.entries[i];
    if (entry.type == EntryType::Symlink) continue;
    std::string name(snapshot.nameOf(entry));
    if (!isRelative) name = pathThroughDescriptor(folder, name);
    ItemAttributes attributes = readItemAttributes(name.c_str());
    if (!attributes.isEmpty()) snapshot.attributes.emplace_back(i, std::move(attributes));
  }
}

TreeWalker::Level TreeWalker::levelOf(const FolderSnapshot& snapshot) {
  Level level{snapshot.folder, snapshot.self.inode, {}};
  for (const FolderEntry& entry : snapshot.entries) {
    if (entry.type != EntryType::Folder) continue;
    level.children.push_back({std::string(snapshot.nameOf(entry)), entry.visit});
  }
  std::reverse(level.children.begin(), level.children.end());
  return level;
}

void TreeWalker::reopen(Level& level, const FileDescriptor& child) {
  if (level.folder) return;
  auto parent = shared(openat(child.get(), "..", kOpenFolderFlags));
  struct stat status{};
  const bool isTheSame =
      parent && fstat(parent->get(), &status) == 0 && status.st_ino == level.inode;
  if (isTheSame) level.folder = std::move(parent);
}

bool TreeWalker::walk(std::shared_ptr<const FileDescriptor> folder, std::uint64_t visit,
                      const Deliver& deliver) {
  std::vector<Level> levels;
  const auto enter = [&](std::shared_ptr<const FileDescriptor> next, std::uint64_t number) {
    auto snapshot = read(std::move(next), number);
    if (snapshot->isReadable) levels.push_back(levelOf(*snapshot));
    return deliver(std::move(snapshot));
  };
  if (!enter(std::move(folder), visit)) return false;
  while (!levels.empty()) {
    Level& level = levels.back();
    if (level.children.empty()) {
      if (levels.size() > 1 && level.folder) reopen(levels[levels.size() - 2], *level.folder);
      levels.pop_back();
      continue;
    }
    const Child child = std::move(level.children.back());
    level.children.pop_back();
    if (levels.size() > kOpenLevels) levels[levels.size() - kOpenLevels - 1].folder.reset();
    // A folder that has gone, or has been moved away while it was closed, is read as unreadable.
    auto next = level.folder
                    ? shared(openat(level.folder->get(), child.name.c_str(), kOpenFolderFlags))
                    : nullptr;
    if (!next && level.folder && errno != ENOENT) {
      log_error(defaultLog(), "[ERROR] the folder %@ cannot be opened: %s; its items stay as known",
                child.name, std::strerror(errno));
    }
    if (!enter(std::move(next), child.visit)) return false;
  }
  return true;
}

}  // namespace yomber
