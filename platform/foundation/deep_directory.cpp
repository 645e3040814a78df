#include "platform/foundation/deep_directory.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <utility>

namespace yomber {
namespace {

constexpr int kOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

}  // namespace

int openParentDirectory(int child, dev_t device, ino_t inode) {
  FileDescriptor parent(openat(child, "..", kOpenFlags));
  if (!parent) return -1;
  struct stat status{};
  if (fstat(parent.get(), &status) != 0) return -1;
  if (status.st_dev != device || status.st_ino != inode) {
    errno = ESTALE;
    return -1;
  }
  return parent.release();
}

int DeepDirectory::open(const std::string& path) {
  levels_.clear();
  return push(AT_FDCWD, path);
}

int DeepDirectory::descend(const std::string& name) {
  const int failure = push(descriptor(), name);
  if (failure != 0) return failure;
  if (levels_.size() > kOpenLevels) levels_[levels_.size() - 1 - kOpenLevels].descriptor = {};
  return 0;
}

int DeepDirectory::ascend() {
  Level& parent = levels_[levels_.size() - 2];
  if (!parent.descriptor) {
    parent.descriptor =
        FileDescriptor(openParentDirectory(descriptor(), parent.device, parent.inode));
    if (!parent.descriptor) return errno;
  }
  levels_.pop_back();
  return 0;
}

int DeepDirectory::push(int parent, const std::string& name) {
  Level level;
  level.descriptor = FileDescriptor(openat(parent, name.c_str(), kOpenFlags));
  if (!level.descriptor) return errno;
  struct stat status{};
  if (fstat(level.descriptor.get(), &status) != 0) return errno;
  level.name = name;
  level.device = status.st_dev;
  level.inode = status.st_ino;
  levels_.push_back(std::move(level));
  return 0;
}

std::string DeepDirectory::path() const {
  std::string out;
  for (const auto& level : levels_) out += out.empty() ? level.name : "/" + level.name;
  return out;
}

}  // namespace yomber
