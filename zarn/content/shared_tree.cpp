#include "zarn/content/shared_tree.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <ctime>
#include <memory>

#include "platform/foundation/bounced_name.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/file_copy.h"
#include "platform/foundation/log.h"
#include "zarn/content/file_lease.h"
#include "zarn/item_attributes.h"
#include "zarn/lent_mode.h"
#include "zarn/random_id.h"

namespace yomber {
namespace {

constexpr std::string_view kStagedPrefix = "new-";
constexpr std::string_view kTakenPrefix = "taken-";
/// Links and the like carry no attributes: they are always kept.
constexpr std::string_view kLinkPrefix = "link-";
constexpr const char* kKeptLinkName = "Kept link";
constexpr const char* kKeptFolderName = "Kept folder";
/// On what was taken away: the name under which it is to come back.
constexpr const char* kKeptNameAttribute = "user.yomber.kept";
constexpr std::string_view kOwnPrefix = "user.yomber.";
constexpr const char* kAccessListAttribute = "system.posix_acl_access";
constexpr std::size_t kLargestAttribute = 65'536;
constexpr std::int64_t kNanosecondsInSecond = 1'000'000'000;

std::string folderOf(const std::string& path) { return path.substr(0, path.rfind('/')); }
std::string nameOf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

FileDescriptor openPath(const std::string& path) {
  return FileDescriptor(open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
}

/// What is neither a file nor a folder.
bool isLinkAt(const std::string& path) {
  struct stat status{};
  return lstat(path.c_str(), &status) == 0 && !S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode);
}

bool isFilledFolder(const std::string& path) {
  std::vector<std::string> names;
  return !isLinkAt(path) && !SharedTree::list(path, names) && !names.empty();
}

bool setAttribute(int file, const char* name, const std::string& value) {
  return fsetxattr(file, name, value.data(), value.size(), 0) == 0;
}

/// Whether an attribute stays with an item when its content is another one.
bool staysHere(std::string_view name) {
  return !name.starts_with(kOwnPrefix) || name == kFavoriteAttribute ||
         name == kLastUsedAttribute || name == kSharedAttribute;
}

int copyAccessList(int from, int to) {
  std::string list(kLargestAttribute, '\0');
  const ssize_t length = fgetxattr(from, kAccessListAttribute, list.data(), list.size());
  if (length < 0) return errno == ENODATA || errno == EOPNOTSUPP ? 0 : errno;
  list.resize(static_cast<std::size_t>(length));
  return setAttribute(to, kAccessListAttribute, list) ? 0 : errno;
}

/// Renames between folders that may not be written to.
int renameBetween(const std::string& from, const std::string& to, unsigned flags) {
  const FileDescriptor source = openPath(folderOf(from));
  const FileDescriptor destination = openPath(folderOf(to));
  const FileDescriptor item = openPath(from);
  if (!source || !destination || !item) return errno;
  const auto move = [&] {
    return renameat2(source.get(), nameOf(from).c_str(), destination.get(), nameOf(to).c_str(),
                     flags) == 0
               ? 0
               : errno;
  };
  return withWritePermission(source.get(), [&] {
    return withWritePermission(destination.get(), [&] {
      struct stat status{};
      const bool isFolder = fstat(item.get(), &status) == 0 && S_ISDIR(status.st_mode);
      // A folder that comes to lie elsewhere has its ".." written.
      return isFolder ? withWritePermission(item.get(), move) : move();
    });
  });
}

/// The bytes of the content that its fault keeps.
NSErrorRef readKept(const ContentStore& store, const RZAsset& content, std::string& kept) {
  FileDescriptor source;
  if (content.size == 0) return nullptr;
  if (NSErrorRef error = store.open(content, source)) return error;
  kept = readHead(source.get());
  const bool isWhole = kept.size() == std::min<std::uint64_t>(content.size, kKeptBytes);
  return isWhole ? nullptr : NSError::errorWithErrno(EIO);
}

bool writeAll(int file, std::string_view bytes) {
  return pwrite(file, bytes.data(), bytes.size(), 0) == static_cast<ssize_t>(bytes.size());
}

}  // namespace

std::string keptCopyName(std::string_view name) {
  constexpr std::string_view kMark = " (kept copy)";
  const std::size_t dot = name.rfind('.');
  const std::size_t stem = dot == std::string_view::npos || dot == 0 ? name.size() : dot;
  std::string result(name.substr(0, stem));
  const std::size_t room = kMaximumNameLength - kMark.size();
  const std::size_t rest = name.size() - stem;
  std::size_t length = rest < room ? std::min(result.size(), room - rest) : 0;
  // Not in the middle of a character.
  while (length > 0 && length < result.size() &&
         (static_cast<unsigned char>(result[length]) & 0xc0U) == 0x80U)
    --length;
  result.resize(length);
  result += kMark;
  return result.append(rest < room ? name.substr(stem) : std::string_view());
}

bool isPossibleName(std::string_view name) {
  return !name.empty() && name.size() <= kMaximumNameLength && name != "." && name != ".." &&
         name.find('/') == std::string_view::npos && name.find('\0') == std::string_view::npos;
}

SharedTree::SharedTree(const ContentCore& core, const ContentStore& store)
    : core_(core), store_(store), folder_(core.items->layout().privateArea() + "/shares") {}

std::string SharedTree::newPlace(std::string_view prefix) const {
  (void)mkdir(folder_.c_str(), 0700);
  return folder_ + '/' + std::string(prefix) + std::to_string(randomID());
}

NSErrorRef SharedTree::stage(const SharedDocument& document, std::string& staged,
                             FileStamp& stamp) const {
  FaultRecord record{.item = document.id,
                     .content = document.content,
                     .mtime = document.mtime,
                     .tag = document.tag,
                     .account = store_.account()};
  std::string kept;
  if (NSErrorRef error = readKept(store_, document.content, kept)) return error;
  if (document.content.size > kKeptBytes) record.head = headChecksum(kept);
  staged = newPlace(kStagedPrefix);
  const FileDescriptor file(
      open(staged.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  const std::int64_t second =
      document.mtime / kNanosecondsInSecond - (document.mtime % kNanosecondsInSecond < 0 ? 1 : 0);
  const std::array<timespec, 2> times{
      timespec{.tv_sec = 0, .tv_nsec = UTIME_OMIT},
      timespec{.tv_sec = second, .tv_nsec = document.mtime - second * kNanosecondsInSecond}};
  const bool isMade =
      file && writeAll(file.get(), kept) &&
      ftruncate(file.get(), static_cast<off_t>(document.content.size)) == 0 &&
      setAttribute(file.get(), kIDAttribute, std::to_string(document.id)) &&
      setAttribute(file.get(), kFaultAttribute, record.encoded()) &&
      futimens(file.get(), times.data()) == 0 &&
      (document.mayWrite ||
       (setAttribute(file.get(), kOnlyReadableAttribute, "1") && fchmod(file.get(), 0400) == 0));
  struct stat status{};
  if (isMade && fstat(file.get(), &status) == 0) {
    stamp = FileStamp::of(status);
    return nullptr;
  }
  NSErrorRef error = NSError::errorWithErrno(errno, staged);
  (void)unlink(staged.c_str());
  return error;
}

NSErrorRef SharedTree::stageFolder(std::uint64_t id, bool mayWrite, std::string& staged) const {
  staged = newPlace(kStagedPrefix);
  if (mkdir(staged.c_str(), 0700) != 0) return NSError::errorWithErrno(errno, staged);
  const std::string value = std::to_string(id);
  const bool isMarked = lsetxattr(staged.c_str(), kIDAttribute, value.data(), value.size(), 0) == 0;
  const bool isReady =
      mayWrite || (lsetxattr(staged.c_str(), kOnlyReadableAttribute, "1", 1, 0) == 0 &&
                   chmod(staged.c_str(), 0500) == 0);
  if (isMarked && isReady) return nullptr;
  NSErrorRef error = NSError::errorWithErrno(errno, staged);
  (void)rmdir(staged.c_str());
  return error;
}

NSErrorRef SharedTree::sync() const {
  const FileDescriptor folder(open(folder_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return folder && syncfs(folder.get()) == 0 ? nullptr : NSError::errorWithErrno(errno, folder_);
}

NSErrorRef SharedTree::place(const std::string& from, const std::string& folder,
                             std::string& name) const {
  // Whoever asks: a name from the store must not lead out of the folder.
  if (!isPossibleName(name)) return NSError::errorWithErrno(EINVAL, folder);
  int number = 0;
  name = bouncedName(name, [&](const std::string& each) {
    number = 0;
    if (folder + '/' + each == from) return false;  // it is there
    number = renameBetween(from, folder + '/' + each, RENAME_NOREPLACE);
    return number == EEXIST;
  });
  return number == 0 ? nullptr : NSError::errorWithErrno(number, folder + '/' + name);
}

/// Who may do what with the file, and what was said about it here, is no part of its content.
void SharedTree::copyOwnProperties(int from, const std::string& staged) {
  const FileDescriptor to(open(staged.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  struct stat status{};
  struct stat stagedStatus{};
  if (!to || fstat(from, &status) != 0 || fstat(to.get(), &stagedStatus) != 0) return;
  const bool mayWrite = (stagedStatus.st_mode & S_IWUSR) != 0;
  // An attribute of a file that may not be written to could not be set.
  int failure = fchmod(to.get(), S_IRUSR | S_IWUSR) == 0 ? 0 : errno;
  if (failure == 0) failure = copyUserAttributes(from, to.get(), staysHere);
  const int aclFailure = copyAccessList(from, to.get());
  if (failure == 0) failure = aclFailure;
  // The last, as it limits the list. Others' content never runs as somebody else.
  const mode_t mode = status.st_mode & (mayWrite ? 01777U : 01555U);
  if (fchmod(to.get(), mode) != 0) failure = errno;
  if (failure != 0)
    log_error(defaultLog(), "[ERROR] a changed document keeps not all of its properties: %@",
              NSError::errorWithErrno(failure, staged));
}

NSErrorRef SharedTree::noteKept(const std::string& path, const std::string& name) {
  const FileDescriptor item = openPath(path);
  if (!item) return NSError::errorWithErrno(errno, path);
  const int number = withWritePermission(item.get(), [&] {
    return lsetxattr(path.c_str(), kKeptNameAttribute, name.data(), name.size(), 0) == 0 ? 0
                                                                                         : errno;
  });
  return number == 0 ? nullptr : NSError::errorWithErrno(number, path);
}

NSErrorRef SharedTree::replace(const std::string& staged, const std::string& path, Kept kept,
                               std::string& displaced, bool& isUntouched) const {
  const FileDescriptor file(
      open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  if (!file) return NSError::errorWithErrno(errno, path);
  const FileLease lease(file.get());
  if (!lease.isHeld()) return openElsewhereError(path);
  copyOwnProperties(file.get(), staged);
  if (kept == Kept::Yes) {
    if (NSErrorRef error = noteKept(path, keptCopyName(nameOf(path)))) return error;
  }
  displaced = newPlace(kTakenPrefix);
  if (rename(staged.c_str(), displaced.c_str()) != 0) return NSError::errorWithErrno(errno, staged);
  const int number = renameBetween(displaced, path, RENAME_EXCHANGE);
  isUntouched = lease.isHeld();
  return number == 0 ? nullptr : NSError::errorWithErrno(number, path);
}

NSErrorRef SharedTree::takeAway(const std::string& path, Kept kept, std::string& taken,
                                const FileStamp* seen) const {
  struct stat status{};
  if (lstat(path.c_str(), &status) != 0) return NSError::errorWithErrno(errno, path);
  const bool isFile = S_ISREG(status.st_mode);
  const bool isLink = !isFile && !S_ISDIR(status.st_mode);
  taken = newPlace(isLink ? kLinkPrefix : kTakenPrefix);
  if (isFile && kept == Kept::No) return takeUnused(path, taken, seen);
  if (!isLink && kept == Kept::Yes) {
    if (NSErrorRef error = noteKept(path, keptCopyName(nameOf(path)))) return error;
  }
  const int number = renameBetween(path, taken, RENAME_NOREPLACE);
  return number == 0 ? nullptr : NSError::errorWithErrno(number, path);
}

/// A file that is about to go for good: nobody may be writing to it.
NSErrorRef SharedTree::takeUnused(const std::string& path, const std::string& taken,
                                  const FileStamp* seen) const {
  const FileDescriptor file(
      open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  if (!file) return NSError::errorWithErrno(errno, path);
  const FileLease lease(file.get());
  struct stat status{};
  const bool isAsSeen = fstat(file.get(), &status) == 0 && S_ISREG(status.st_mode) &&
                        (seen == nullptr || FileStamp::of(status) == *seen);
  if (!isAsSeen || !lease.isHeld()) return openElsewhereError(path);
  const int number = renameBetween(path, taken, RENAME_NOREPLACE);
  if (number != 0) return NSError::errorWithErrno(number, path);
  if (lease.isHeld()) return nullptr;
  // Somebody waits to open it. Where it cannot go back, it comes back with the next start.
  if (renameBetween(taken, path, RENAME_NOREPLACE) != 0)
    (void)noteKept(taken, keptCopyName(nameOf(path)));
  return openElsewhereError(path);
}

NSErrorRef SharedTree::checkUnused(const std::string& path, const FileStamp& seen) {
  const FileDescriptor file(
      open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  if (!file) return NSError::errorWithErrno(errno, path);
  const FileLease lease(file.get());
  struct stat status{};
  const bool isAsSeen = fstat(file.get(), &status) == 0 && FileStamp::of(status) == seen;
  return isAsSeen && lease.isHeld() ? nullptr : openElsewhereError(path);
}

NSErrorRef SharedTree::removeFolder(const std::string& path) const {
  const FileDescriptor folder = openPath(folderOf(path));
  if (!folder) return NSError::errorWithErrno(errno, path);
  const int number = withWritePermission(folder.get(), [&] {
    return unlinkat(folder.get(), nameOf(path).c_str(), AT_REMOVEDIR) == 0 ? 0 : errno;
  });
  return number == 0 ? nullptr : NSError::errorWithErrno(number, path);
}

NSErrorRef SharedTree::list(const std::string& path, std::vector<std::string>& names) {
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(opendir(path.c_str()), closedir);
  if (!stream) return NSError::errorWithErrno(errno, path);
  errno = 0;
  while (const dirent* const entry = readdir(stream.get())) {
    const std::string name = entry->d_name;
    if (name != "." && name != "..") names.push_back(name);
    errno = 0;
  }
  return errno == 0 ? nullptr : NSError::errorWithErrno(errno, path);
}

NSErrorRef SharedTree::keepCopy(const std::string& taken, const std::string& folder,
                                std::string_view name, std::string& kept) const {
  const std::string id = std::to_string(randomID());
  kept = keptCopyName(name);
  setWritable(taken, true);
  // Another item from now on, however this process ends.
  const bool isMarked =
      isLinkAt(taken) ||
      (lsetxattr(taken.c_str(), kKeptNameAttribute, kept.data(), kept.size(), 0) == 0 &&
       lsetxattr(taken.c_str(), kIDAttribute, id.data(), id.size(), 0) == 0);
  if (!isMarked) return NSError::errorWithErrno(errno, taken);
  (void)lremovexattr(taken.c_str(), kSharedAttribute);
  NSErrorRef error = place(taken, folder, kept);
  if (error) return error;
  kept = folder + '/' + kept;
  (void)lremovexattr(kept.c_str(), kKeptNameAttribute);
  log_default(defaultLog(), "[NOTICE] what was not saved in the store is kept in %@", kept);
  return nullptr;
}

void SharedTree::drop(const std::string& taken) const {
  if (taken.empty() || unlink(taken.c_str()) == 0 || errno == ENOENT) return;
  if (rmdir(taken.c_str()) != 0)
    log_error(defaultLog(), "[ERROR] cannot remove %@: %@", taken, NSError::errorWithErrno(errno));
}

void SharedTree::recover() const {
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(opendir(folder_.c_str()), closedir);
  if (!stream) return;
  while (const dirent* const entry = readdir(stream.get())) {
    const std::string name = entry->d_name;
    const std::string path = folder_ + '/' + name;
    const bool isLink = name.starts_with(kLinkPrefix);
    if (!isLink && !name.starts_with(kStagedPrefix) && !name.starts_with(kTakenPrefix)) continue;
    std::array<char, kMaximumNameLength + 1> kept{};
    const ssize_t length = lgetxattr(path.c_str(), kKeptNameAttribute, kept.data(), kept.size());
    std::string wanted(kept.data(), length > 0 ? static_cast<std::size_t>(length) : 0);
    if (isLink) wanted = kKeptLinkName;
    if (wanted.empty() && isFilledFolder(path)) {
      wanted = kKeptFolderName;
      setWritable(path, true);
    }
    if (!isPossibleName(wanted)) {
      drop(path);
    } else if (!place(path, core_.items->layout().root(), wanted)) {
      (void)lremovexattr((core_.items->layout().root() + '/' + wanted).c_str(), kKeptNameAttribute);
    }
  }
}

void SharedTree::setWritable(const std::string& path, bool mayWrite) const {
  struct stat status{};
  if (lstat(path.c_str(), &status) != 0 || S_ISLNK(status.st_mode)) return;
  const mode_t bits = status.st_mode & 07777U;
  const mode_t wanted = mayWrite ? bits | 0200U : bits & ~mode_t{0222};
  if (wanted != bits && mayWrite) (void)chmod(path.c_str(), wanted);
  if (mayWrite) {
    (void)lremovexattr(path.c_str(), kOnlyReadableAttribute);
  } else {
    (void)lsetxattr(path.c_str(), kOnlyReadableAttribute, "1", 1, 0);
  }
  if (wanted != bits && !mayWrite) (void)chmod(path.c_str(), wanted);
}

NSErrorRef SharedTree::markShared(const std::string& path, bool isShared) const {
  const FileDescriptor item = openPath(path);
  if (!item) return NSError::errorWithErrno(errno, path);
  const int number = withWritePermission(item.get(), [&] {
    // Where the shared item itself lies, and how it is called, is each account's own business.
    (void)lremovexattr(path.c_str(), kOnlyReadableAttribute);
    if (isShared) return lsetxattr(path.c_str(), kSharedAttribute, "1", 1, 0) == 0 ? 0 : errno;
    return lremovexattr(path.c_str(), kSharedAttribute) == 0 || errno == ENODATA ? 0 : errno;
  });
  return number == 0 ? nullptr : NSError::errorWithErrno(number, path);
}

}  // namespace yomber
