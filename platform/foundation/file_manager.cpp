#include "platform/foundation/file_manager.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <utility>

#include "platform/foundation/directory_stream.h"
#include "platform/foundation/file_time.h"
#include "platform/foundation/tree_removal.h"

namespace yomber {
namespace {

bool fail(NSErrorRef* error, int number, const std::string& path) {
  if (number == ENOENT) {
    storeError(error,
               NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError,
                                        {{NSFilePathErrorKey, path},
                                         {NSUnderlyingErrorKey, NSError::errorWithErrno(number)}}));
  } else {
    storeError(error, NSError::errorWithErrno(number, path));
  }
  return false;
}

bool failTaken(NSErrorRef* error, const std::string& path) {
  storeError(error,
             NSError::errorWithDomain(NSCocoaErrorDomain, NSFileWriteFileExistsError,
                                      {{NSFilePathErrorKey, path},
                                       {NSUnderlyingErrorKey, NSError::errorWithErrno(EEXIST)}}));
  return false;
}

bool makeIntermediates(const std::string& path, unsigned mode) {
  for (std::size_t slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    const std::string parent = path.substr(0, slash);
    struct stat status{};
    if (stat(parent.c_str(), &status) == 0) continue;
    if (mkdir(parent.c_str(), mode) != 0 && errno != EEXIST) return false;
  }
  return true;
}

}  // namespace

NSFileManager& NSFileManager::defaultManager() {
  static NSFileManager manager;
  return manager;
}

bool NSFileManager::fileExistsAtPath(const std::string& path) const {
  struct stat status{};
  return stat(path.c_str(), &status) == 0;
}

bool NSFileManager::isDirectoryAtPath(const std::string& path) const {
  struct stat status{};
  return stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

bool NSFileManager::createDirectoryAtPath(const std::string& path, Intermediates intermediates,
                                          NSErrorRef* error, unsigned mode) const {
  const bool tolerant = intermediates == Intermediates::Make;
  if (tolerant && !makeIntermediates(path, mode)) return fail(error, errno, path);
  if (mkdir(path.c_str(), mode) == 0) return true;
  const int number = errno;
  if (number != EEXIST) return fail(error, number, path);
  if (tolerant && isDirectoryAtPath(path)) return true;
  return failTaken(error, path);
}

bool NSFileManager::removeItemAtPath(const std::string& path, NSErrorRef* error) const {
  TreeRemoval removal;
  if (removal.run(path)) return true;
  const int number = errno;
  return fail(error, number, removal.failedPath());
}

bool NSFileManager::moveItemAtPath(const std::string& source, const std::string& destination,
                                   NSErrorRef* error) const {
  if (renameat2(AT_FDCWD, source.c_str(), AT_FDCWD, destination.c_str(), RENAME_NOREPLACE) == 0) {
    return true;
  }
  const int number = errno;
  if (number == EEXIST) return failTaken(error, destination);
  struct stat status{};
  const bool sourceIsThere = lstat(source.c_str(), &status) == 0;
  return fail(error, number, number == ENOENT && sourceIsThere ? destination : source);
}

std::optional<std::vector<std::string>> NSFileManager::contentsOfDirectoryAtPath(
    const std::string& path, NSErrorRef* error) const {
  const DirectoryStream directory(opendir(path.c_str()));
  if (directory == nullptr) {
    fail(error, errno, path);
    return std::nullopt;
  }
  std::vector<std::string> names;
  while (const char* const name = nextName(directory.get())) names.emplace_back(name);
  if (errno != 0) {
    fail(error, errno, path);
    return std::nullopt;
  }
  std::sort(names.begin(), names.end());
  return names;
}

bool NSFileManager::setPermissions(const std::string& path, unsigned mode,
                                   NSErrorRef* error) const {
  return chmod(path.c_str(), mode) == 0 || fail(error, errno, path);
}

bool NSFileManager::setModificationDate(const std::string& path, NSDate date,
                                        NSErrorRef* error) const {
  const std::array<std::timespec, 2> times{std::timespec{0, UTIME_OMIT},
                                           timespecOf(date.nanoseconds())};
  return utimensat(AT_FDCWD, path.c_str(), times.data(), AT_SYMLINK_NOFOLLOW) == 0 ||
         fail(error, errno, path);
}

std::optional<std::string> NSFileManager::extendedAttribute(const std::string& path,
                                                            const std::string& name,
                                                            NSErrorRef* error) const {
  std::string value(256, '\0');
  while (true) {
    const ssize_t length = lgetxattr(path.c_str(), name.c_str(), value.data(), value.size());
    if (length >= 0) {
      value.resize(static_cast<std::size_t>(length));
      return value;
    }
    if (errno != ERANGE) break;
    const ssize_t needed = lgetxattr(path.c_str(), name.c_str(), nullptr, 0);
    if (needed < 0) break;
    value.resize(static_cast<std::size_t>(needed) + 1);  // never 0, which would only ask the size
  }
  if (errno != ENODATA) fail(error, errno, path);
  return std::nullopt;
}

bool NSFileManager::setExtendedAttribute(const std::string& path, const std::string& name,
                                         const std::string& value, NSErrorRef* error) const {
  return lsetxattr(path.c_str(), name.c_str(), value.data(), value.size(), 0) == 0 ||
         fail(error, errno, path);
}

bool NSFileManager::removeExtendedAttribute(const std::string& path, const std::string& name,
                                            NSErrorRef* error) const {
  return lremovexattr(path.c_str(), name.c_str()) == 0 || errno == ENODATA ||
         fail(error, errno, path);
}

}  // namespace yomber
