#include "platform/foundation/tree_removal.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/foundation/deep_directory.h"
#include "platform/foundation/descriptor_path.h"

namespace yomber {
namespace {

constexpr int kOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
bool isOccupied(int number) { return number == ENOTEMPTY || number == EEXIST; }

/// What is mounted in a tree is not part of it.
bool isMountedThere(int directory) {
  struct statx status{};
  return statx(directory, "", AT_EMPTY_PATH, 0, &status) == 0 &&
         (status.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0;
}

/// Lets the owner into the directory `name` of `parent`.
bool liftProtection(int parent, const char* name) {
  const FileDescriptor directory(
      openat(parent, name, O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!directory) return false;
  return chmod(pathOfDescriptor(directory.get()).c_str(), S_IRWXU) == 0;
}

}  // namespace

bool TreeRemoval::run(const std::string& path) {
  levels_.clear();
  failedPath_ = path;
  while (true) {
    if (unlink(path.c_str()) == 0) return true;
    if (errno != EISDIR && errno != EPERM) return false;
    if (!descend(AT_FDCWD, path)) return false;
    while (!levels_.empty()) {
      if (!step()) return false;
    }
    failedPath_ = path;
    if (rmdir(path.c_str()) == 0) return true;
    if (!isOccupied(errno) || !mayLookAgain()) return false;
  }
}

FileDescriptor TreeRemoval::openLevel(int parent, const char* name) const {
  FileDescriptor directory(openat(parent, name, kOpenFlags));
  if (protection_ == Protection::Respect) return directory;
  if (!directory && errno == EACCES && liftProtection(parent, name)) {
    directory = FileDescriptor(openat(parent, name, kOpenFlags));
  }
  if (directory) (void)fchmod(directory.get(), S_IRWXU);
  return directory;
}

bool TreeRemoval::descend(int parent, const std::string& name) {
  FileDescriptor descriptor = openLevel(parent, name.c_str());
  struct stat status{};
  if (!descriptor || fstat(descriptor.get(), &status) != 0) return false;
  if (!levels_.empty() && isMountedThere(descriptor.get())) {
    errno = EBUSY;
    return false;
  }
  auto directory = readDirectory(std::move(descriptor));
  if (directory == nullptr) return false;
  levels_.push_back({std::move(directory), name, status.st_dev, status.st_ino, false});
  if (levels_.size() > kOpenLevels) levels_[levels_.size() - 1 - kOpenLevels].directory = nullptr;
  return true;
}

bool TreeRemoval::failAt(const std::string& name) {
  const int number = errno;
  failedPath_.clear();
  for (const auto& level : levels_) failedPath_ += level.name + "/";
  failedPath_ += name;
  errno = number;
  return false;
}

bool TreeRemoval::step() {
  const char* const name = nextName(levels_.back().directory.get());
  if (name == nullptr && errno != 0) return failAt("");
  if (name == nullptr) return readAgainOrAscend();
  levels_.back().mayHoldMore = true;
  return removeEntry(name);
}

bool TreeRemoval::removeEntry(const std::string& name) {
  const int parent = dirfd(levels_.back().directory.get());
  if (unlinkat(parent, name.c_str(), 0) == 0 || errno == ENOENT) return true;
  const int refusal = errno;
  if (refusal != EISDIR && refusal != EPERM) return failAt(name);
  if (unlinkat(parent, name.c_str(), AT_REMOVEDIR) == 0 || errno == ENOENT) return true;
  if (errno == ENOTDIR && refusal == EPERM) errno = refusal;
  if (!isOccupied(errno)) return failAt(name);
  if (descend(parent, name)) return true;
  const bool isOtherwiseNow = errno == ENOENT || errno == ENOTDIR;
  return (isOtherwiseNow && mayLookAgain()) || failAt(name);
}

/// Reading a directory while names go may skip some: it is done when a reading finds none.
bool TreeRemoval::readAgainOrAscend() {
  if (!std::exchange(levels_.back().mayHoldMore, false)) return ascend();
  rewinddir(levels_.back().directory.get());
  return true;
}

bool TreeRemoval::reopenParent() {
  const Level& child = levels_.back();
  Level& parent = levels_[levels_.size() - 2];
  if (parent.directory != nullptr) return true;
  parent.directory = readDirectory(FileDescriptor(
      openParentDirectory(dirfd(child.directory.get()), parent.device, parent.inode)));
  return parent.directory != nullptr;
}

bool TreeRemoval::ascend() {
  if (levels_.size() == 1) {
    levels_.pop_back();
    return true;  // the top is the caller's
  }
  if (!reopenParent()) return failAt("");
  const std::string name = std::move(levels_.back().name);
  levels_.pop_back();
  levels_.back().mayHoldMore = true;
  const int parent = dirfd(levels_.back().directory.get());
  if (unlinkat(parent, name.c_str(), AT_REMOVEDIR) == 0 || errno == ENOENT) return true;
  return (isOccupied(errno) && mayLookAgain()) || failAt(name);
}

}  // namespace yomber
