#include "zarn/trash_folder.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <ctime>

#include "platform/foundation/bounced_name.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/foundation/whole_transfer.h"
#include "zarn/file_descriptor.h"

namespace yomber {
namespace {

constexpr mode_t kPrivateFile = 0600;
constexpr std::size_t kLongestName = kMaximumNameLength - kTrashInfoSuffix.size();
constexpr std::time_t kOthersGrace = 60;  // seconds

}  // namespace

TrashFolder::TrashFolder(const TreeLayout& layout)
    : layout_(layout), files_(layout.trashFiles()), info_(layout.trashInfo()) {}

std::string TrashFolder::filePath(const std::string& name) const { return files_ + "/" + name; }

std::string TrashFolder::infoPath(const std::string& name) const {
  return info_ + "/" + name + std::string(kTrashInfoSuffix);
}

TrashFolder::Taken TrashFolder::take(int folder, const std::string& diskName,
                                     const std::string& wanted, const TrashInfo& info) {
  Taken taken;
  taken.failure = layout_.createFolders();  // somebody may have removed the trash itself
  if (taken.failure != 0) return taken;
  const std::string text = trashInfoText(info);
  taken.name = bouncedName(
      wanted,
      [&](const std::string& name) {
        return takeAs(folder, diskName, name, text, taken.failure) == Outcome::NameTaken;
      },
      kLongestName);
  return taken;
}

TrashFolder::Outcome TrashFolder::takeAs(int folder, const std::string& diskName,
                                         const std::string& name, const std::string& info,
                                         int& failure) {
  {
    LockGuard guard(mutex_);
    struct stat status{};
    const bool isTaken = lstat(filePath(name).c_str(), &status) == 0;
    failure = isTaken || errno == ENOENT ? 0 : errno;
    if (failure != 0) return Outcome::Failed;
    if (isTaken || !coming_.insert(name).second) return Outcome::NameTaken;
  }
  const std::string written = infoPath(name);
  Outcome outcome = Outcome::Done;
  failure = writeInfo(written, info);
  if (failure == EEXIST) {
    outcome = Outcome::NameTaken;
  } else if (failure != 0) {
    outcome = Outcome::Failed;
  } else {
    static FaultPoint afterInfo("zarn.trash.after-info");
    if (afterInfo.hit()) {
      failure = EIO;
    } else if (renameat2(folder, diskName.c_str(), AT_FDCWD, filePath(name).c_str(),
                         RENAME_NOREPLACE) != 0) {
      failure = errno;
    }
    if (failure != 0) {
      outcome = failure == EEXIST ? Outcome::NameTaken : Outcome::Failed;
      (void)unlink(written.c_str());
    }
  }
  LockGuard guard(mutex_);
  coming_.erase(name);
  return outcome;
}

int TrashFolder::writeInfo(const std::string& path, const std::string& text) const {
  const FileDescriptor file(
      open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, kPrivateFile));
  if (!file) return errno;
  int failure = writeWhole(file.get(), text);
  // The sync of a file that is new brings its name to the disk as well, wherever names are
  // journalled; an item's own move comes after it in that journal.
  if (failure == 0 && fsync(file.get()) != 0) failure = errno;
  if (failure != 0) (void)unlink(path.c_str());
  return failure;
}

std::optional<TrashInfo> TrashFolder::infoOf(const std::string& name) const {
  return readTrashInfo(infoPath(name));
}

bool TrashFolder::isInTrash(const std::string& name) const {
  struct stat status{};
  return lstat(filePath(name).c_str(), &status) == 0 || errno != ENOENT;
}

void TrashFolder::didLeave(const std::string& name) {
  LockGuard guard(mutex_);
  if (coming_.contains(name) || isInTrash(name)) return;
  (void)unlink(infoPath(name).c_str());
}

void TrashFolder::didRename(const std::string& before, const std::string& after) {
  LockGuard guard(mutex_);
  if (coming_.contains(before) || isInTrash(before)) return;
  const std::string from = infoPath(before);
  if (renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, infoPath(after).c_str(), RENAME_NOREPLACE) != 0) {
    (void)unlink(from.c_str());  // the name is too long for it, or has other information by now
  }
}

bool TrashFolder::isOrphan(const std::string& name) const {
  if (isInTrash(name)) return false;
  const auto info = infoOf(name);
  if (info && !info->containerID.empty()) return true;
  struct stat status{};
  if (lstat(infoPath(name).c_str(), &status) != 0) return false;
  return std::time(nullptr) - status.st_mtim.tv_sec >= kOthersGrace;
}

void TrashFolder::dropOrphans() {
  int failure = 0;
  for (const std::string& file : names(info_, failure)) {
    if (!file.ends_with(kTrashInfoSuffix)) continue;
    const std::string name = file.substr(0, file.size() - kTrashInfoSuffix.size());
    LockGuard guard(mutex_);
    if (coming_.contains(name) || !isOrphan(name)) continue;
    if (unlink(infoPath(name).c_str()) == 0) {
      log_default(defaultLog(), "[NOTICE] the trash knew of %@, which never came or has gone",
                  name);
    }
  }
  if (failure != 0) {
    log_error(defaultLog(), "[ERROR] the trash's information cannot be read: %@",
              NSError::errorWithErrno(failure));
  }
}

void TrashFolder::moveTo(int folder, const std::string& name, Emptied& result) const {
  const std::string there = std::to_string(result.names.size());
  if (renameat2(AT_FDCWD, filePath(name).c_str(), folder, there.c_str(), RENAME_NOREPLACE) == 0) {
    result.names.push_back(name);
  } else if (errno != ENOENT && result.failure == 0) {
    result.failure = errno;
  }
}

std::vector<std::string> TrashFolder::names(const std::string& folder, int& failure) {
  std::vector<std::string> result;
  DIR* const stream = opendir(folder.c_str());
  if (stream == nullptr) {
    failure = errno;
    return result;
  }
  while (const dirent* const entry = readdir(stream)) {
    const std::string_view name = entry->d_name;
    if (name != "." && name != "..") result.emplace_back(name);
  }
  closedir(stream);
  return result;
}

}  // namespace yomber
