#include "mount/folder_descriptors.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <climits>

namespace yomber {
namespace {

/// As often as a way may change while it is followed.
constexpr int kAttempts = 8;

int openFolderBelow(int folder, const std::string& path) {
  open_how how{};
  how.flags = O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  return static_cast<int>(syscall(SYS_openat2, folder, path.c_str(), &how, sizeof how));
}

}  // namespace

SharedDescriptor FolderDescriptors::open(const Node& folder, int& failure) {
  if (folder.base) {
    // Bases stay, and so do their descriptors.
    const FileDescriptor& descriptor = places_.base(*folder.base).folder;
    return {SharedDescriptor(), &descriptor};
  }
  if (auto descriptor = kept(folder.identity)) return descriptor;
  failure = ESTALE;
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    const auto way = nodes_.wayTo(folder);
    if (!way) {
      if (auto remains = nodes_.remains(folder)) return remains;
      nodes_.waitForMoves();  // what it changes places with may have been seen in its place
      continue;
    }
    FileDescriptor found = follow(*way, failure);
    struct statx status{};
    if (!found || lookAt(found.get(), "", status) != 0) {
      if (failure != ENOENT && failure != EXDEV && failure != ENOTDIR && failure != ELOOP) break;
      failure = ESTALE;
    } else if (FileIdentity::of(status) == folder.identity) {
      auto result = std::make_shared<const FileDescriptor>(std::move(found));
      keep(folder.identity, result);
      failure = 0;
      return result;
    }
    failure = ESTALE;
    nodes_.waitForMoves();
  }
  return nullptr;
}

/// In steps, each as long as a path may be.
FileDescriptor FolderDescriptors::follow(const NodeTable::Way& way, int& failure) const {
  FileDescriptor reached;
  int from = places_.base(way.base).folder.get();
  std::string path;
  for (std::size_t i = 0; i <= way.steps.size(); ++i) {
    const bool isEnd = i == way.steps.size();
    if (!path.empty() && (isEnd || path.size() + 1 + way.steps[i].name.size() >= PATH_MAX)) {
      FileDescriptor next(openFolderBelow(from, path));
      if (!next) {
        failure = errno;
        return {};
      }
      reached = std::move(next);
      from = reached.get();
      path.clear();
    }
    if (isEnd) break;
    if (!path.empty()) path += '/';
    path += way.steps[i].name;
  }
  return reached;
}

void FolderDescriptors::forget(const FileIdentity& folder) {
  LockGuard guard(mutex_);
  const auto found = byInode_.find(folder.inode);
  if (found == byInode_.end()) return;
  byUse_.erase(found->second);
  byInode_.erase(found);
}

SharedDescriptor FolderDescriptors::kept(const FileIdentity& identity) {
  LockGuard guard(mutex_);
  const auto found = byInode_.find(identity.inode);
  if (found == byInode_.end() || found->second->identity != identity) return nullptr;
  byUse_.splice(byUse_.begin(), byUse_, found->second);
  return found->second->descriptor;
}

void FolderDescriptors::keep(const FileIdentity& identity, const SharedDescriptor& descriptor) {
  LockGuard guard(mutex_);
  if (const auto before = byInode_.find(identity.inode); before != byInode_.end()) {
    byUse_.erase(before->second);
    byInode_.erase(before);
  }
  byUse_.push_front({identity, descriptor});
  byInode_[identity.inode] = byUse_.begin();
  if (byUse_.size() <= kKept) return;
  byInode_.erase(byUse_.back().identity.inode);
  byUse_.pop_back();
}

}  // namespace yomber
