#include "platform/foundation/tree_copy.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <climits>
#include <ctime>
#include <string_view>
#include <utility>

#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/directory_stream.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/file_copy.h"
#include "platform/foundation/file_descriptor.h"

namespace yomber {
namespace {

using Identity = TreeCopy::Identity;

// What a copy answers beside errno values.
constexpr int kContentIsElsewhere = -1;
constexpr int kNeitherFileNorFolder = -2;
constexpr int kIntoItself = -3;

std::array<std::timespec, 2> timesOf(const struct stat& status) {
  return {status.st_atim, status.st_mtim};
}

mode_t modeOf(const struct stat& status) {
  constexpr mode_t kOthersMay = 01777;
  constexpr mode_t kAll = 07777;
  return status.st_mode & (status.st_uid == geteuid() ? kAll : kOthersMay);
}

/// Everything but the content, the dates last.
int copyProperties(int source, int destination, const struct stat& status, mode_t mode,
                   Identity identity) {
  constexpr std::string_view kOurs = "user.yomber.";
  const int failure = copyUserAttributes(source, destination, [&](std::string_view name) {
    return identity == Identity::Kept || !name.starts_with(kOurs);
  });
  if (failure != 0) return failure;
  if (fchmod(destination, mode) != 0) return errno;
  return futimens(destination, timesOf(status).data()) == 0 ? 0 : errno;
}

/// Without waiting for whoever might be at the other end of what has become a pipe; but for a
/// document whose content is just being filled in or given up.
FileDescriptor openSource(int folder, const char* name) {
  constexpr int kFlags = O_RDONLY | O_NOFOLLOW | O_CLOEXEC;
  FileDescriptor source(openat(folder, name, kFlags | O_NONBLOCK));
  if (source || errno != EWOULDBLOCK) return source;
  const FileDescriptor place(openat(folder, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
  struct stat status{};
  if (!place || fstat(place.get(), &status) != 0) return {};
  errno = EWOULDBLOCK;
  if (!S_ISREG(status.st_mode)) return {};
  const std::string path = pathOfDescriptor(place.get());
  return FileDescriptor(open(path.c_str(), O_RDONLY | O_CLOEXEC));
}

int copyRegularFile(int sourceFolder, const char* name, int destinationFolder, const char* copyName,
                    Identity identity, bool syncs) {
  const FileDescriptor source = openSource(sourceFolder, name);
  struct stat status{};
  if (!source || fstat(source.get(), &status) != 0) return errno;
  if (!S_ISREG(status.st_mode)) return kNeitherFileNorFolder;
  const bool needsContent = identity == Identity::New;
  if (needsContent && isFault(source.get())) return kContentIsElsewhere;
  const FileDescriptor copy(openat(destinationFolder, copyName,
                                   O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC,
                                   S_IRUSR | S_IWUSR));
  if (!copy) return errno;
  if (const int failure = copyFileContent(source.get(), copy.get()); failure != 0) return failure;
  // It may have been given up while it was read.
  if (needsContent && isFault(source.get())) return kContentIsElsewhere;
  const int failure = copyProperties(source.get(), copy.get(), status, modeOf(status), identity);
  if (failure != 0 || !syncs || status.st_size == 0) return failure;
  return fsync(copy.get()) == 0 ? 0 : errno;
}

int copyLink(int sourceFolder, const char* name, const struct stat& status, int destinationFolder,
             const char* copyName) {
  std::array<char, PATH_MAX> target{};
  const ssize_t length = readlinkat(sourceFolder, name, target.data(), target.size() - 1);
  if (length < 0) return errno;
  if (symlinkat(target.data(), destinationFolder, copyName) != 0) return errno;
  return utimensat(destinationFolder, copyName, timesOf(status).data(), AT_SYMLINK_NOFOLLOW) == 0
             ? 0
             : errno;
}

int listNames(int directory, std::vector<std::string>& names) {
  const auto stream =
      readDirectory(FileDescriptor(openat(directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC)));
  if (stream == nullptr) return errno;
  while (const char* const name = nextName(stream.get())) names.emplace_back(name);
  return errno;
}

NSErrorRef invalid(const std::string& path, const std::string& reason) {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, EINVAL,
      {{NSFilePathErrorKey, path}, {NSLocalizedDescriptionKey, path + " " + reason}});
}

NSErrorRef errorOf(int number, const std::string& path) {
  switch (number) {
    case 0:
      return nullptr;
    case kContentIsElsewhere:
      return NSError::errorWithDomain(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError,
                                      {{NSFilePathErrorKey, path}});
    case kNeitherFileNorFolder:
      return invalid(path, "is neither a file, a folder nor a link");
    case kIntoItself:
      return invalid(path, "cannot be copied into itself");
    default:
      return NSError::errorWithErrno(number, path);
  }
}

}  // namespace

NSErrorRef TreeCopy::run(const std::string& source, const std::string& destination) {
  struct stat status{};
  if (lstat(source.c_str(), &status) != 0) return errorOf(errno, source);
  switch (status.st_mode & S_IFMT) {
    case S_IFREG:
      return errorOf(
          copyRegularFile(AT_FDCWD, source.c_str(), AT_FDCWD, destination.c_str(), identity_, true),
          source);
    case S_IFLNK:
      return errorOf(copyLink(AT_FDCWD, source.c_str(), status, AT_FDCWD, destination.c_str()),
                     source);
    case S_IFDIR:
      return copyFolder(source, destination);
    default:
      return errorOf(kNeitherFileNorFolder, source);
  }
}

NSErrorRef TreeCopy::failure(int number, const std::string& name) const {
  if (number == 0) return nullptr;
  return errorOf(number, name.empty() ? source_.path() : source_.path() + "/" + name);
}

NSErrorRef TreeCopy::copyFolder(const std::string& source, const std::string& destination) {
  folders_.clear();
  pendingMode_.reset();
  if (const int number = source_.open(source); number != 0) return errorOf(number, source);
  if (mkdir(destination.c_str(), S_IRWXU) != 0) return errorOf(errno, source);
  if (const int number = destination_.open(destination); number != 0) {
    return errorOf(number, source);
  }
  if (fstat(destination_.descriptor(), &root_) != 0) return errorOf(errno, source);
  if (NSErrorRef error = openFolder({})) return error;
  while (!folders_.empty()) {
    if (NSErrorRef error = copyNext()) return error;
  }
  return failure(syncfs(destination_.descriptor()) == 0 ? 0 : errno);
}

/// Begins with the folder at which both ways have arrived.
NSErrorRef TreeCopy::openFolder(const std::string& name) {
  Folder folder;
  if (fstat(source_.descriptor(), &folder.status) != 0) return failure(errno, name);
  const bool isTheCopy =
      folder.status.st_dev == root_.st_dev && folder.status.st_ino == root_.st_ino;
  if (isTheCopy) return failure(kIntoItself);
  if (const int number = listNames(source_.descriptor(), folder.names); number != 0) {
    return failure(number);
  }
  folders_.push_back(std::move(folder));
  return nullptr;
}

NSErrorRef TreeCopy::copyNext() {
  Folder& folder = folders_.back();
  if (folder.next == folder.names.size()) return finishFolder();
  const std::string& name = folder.names[folder.next++];
  const int from = source_.descriptor();
  const int to = destination_.descriptor();
  struct stat status{};
  if (fstatat(from, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
    return errno == ENOENT ? nullptr : failure(errno, name);
  }
  int number = kNeitherFileNorFolder;
  if (S_ISREG(status.st_mode)) {
    number = copyRegularFile(from, name.c_str(), to, name.c_str(), identity_, false);
  } else if (S_ISLNK(status.st_mode)) {
    number = copyLink(from, name.c_str(), status, to, name.c_str());
  } else if (S_ISDIR(status.st_mode)) {
    number = source_.descend(name);
    if (number == 0) {
      number = mkdirat(to, name.c_str(), S_IRWXU) == 0 ? destination_.descend(name) : errno;
      return number == 0 ? openFolder(name) : failure(number);
    }
  }
  return number == ENOENT ? nullptr : failure(number, name);
}

NSErrorRef TreeCopy::finishFolder() {
  const struct stat status = folders_.back().status;
  const bool isTop = folders_.size() == 1;
  mode_t mode = modeOf(status);
  if (isTop && (mode & S_IRWXU) != S_IRWXU) pendingMode_ = std::exchange(mode, mode | S_IRWXU);
  const int number =
      copyProperties(source_.descriptor(), destination_.descriptor(), status, mode, identity_);
  if (number != 0) return failure(number);
  folders_.pop_back();
  if (isTop) return nullptr;
  if (const int up = source_.ascend(); up != 0) return failure(up);
  return failure(destination_.ascend());
}

}  // namespace yomber
