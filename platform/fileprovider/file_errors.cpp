#include "platform/fileprovider/file_errors.h"

#include <cerrno>
#include <utility>

#include "platform/fileprovider/file_operations.h"
#include "platform/foundation/bounced_name.h"

namespace yomber {
namespace {

std::int64_t codeOf(int number, FileAccess access) {
  const bool isRead = access == FileAccess::Read;
  switch (number) {
    case ENOENT:
      return NSFileNoSuchFileError;
    case EACCES:
    case EPERM:
    case EROFS:
      return isRead ? NSFileReadNoPermissionError : NSFileWriteNoPermissionError;
    case ENOSPC:
    case EDQUOT:
      return NSFileWriteOutOfSpaceError;
    case ENAMETOOLONG:
      return NSFileWriteInvalidFileNameError;
    default:
      return isRead ? NSFileReadUnknownError : NSFileWriteUnknownError;
  }
}

std::string textOf(int number, const std::string& path) {
  const std::string reason = NSError::errorWithErrno(number)->localizedDescription();
  switch (number) {
    case ENOENT:
      return "there is nothing at " + path;
    case ENOSPC:
      return "the disk is full: make room on it and try again (" + path + ")";
    case EDQUOT:
      return "your quota on the disk is used up: make room and try again (" + path + ")";
    case ENAMETOOLONG:
      return "the name is too long: " + path;
    default:
      return path + ": " + reason;
  }
}

NSErrorRef invalidName(const std::string& name, int number, const std::string& reason) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileWriteInvalidFileNameError,
                                  {{NSFilePathErrorKey, name},
                                   {NSLocalizedDescriptionKey, reason},
                                   {NSUnderlyingErrorKey, NSError::errorWithErrno(number)}});
}

}  // namespace

NSErrorRef fileError(int number, const std::string& path, FileAccess access) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, codeOf(number, access),
                                  {{NSFilePathErrorKey, path},
                                   {NSLocalizedDescriptionKey, textOf(number, path)},
                                   {NSUnderlyingErrorKey, NSError::errorWithErrno(number, path)}});
}

NSErrorRef fileErrorFrom(const NSErrorRef& error, FileAccess access) {
  if (error == nullptr || error->domain() != NSPOSIXErrorDomain) return error;
  const auto path = error->userInfo().find(NSFilePathErrorKey);
  const auto* const text =
      path == error->userInfo().end() ? nullptr : std::get_if<std::string>(&path->second);
  const std::string named = text == nullptr ? std::string() : *text;
  const auto number = static_cast<int>(error->code());
  const auto reason = error->userInfo().find(NSLocalizedDescriptionKey);
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, codeOf(number, access),
      {{NSFilePathErrorKey, named},
       {NSLocalizedDescriptionKey,
        reason == error->userInfo().end() ? NSErrorValue(textOf(number, named)) : reason->second},
       {NSUnderlyingErrorKey, error}});
}

NSErrorRef fileExistsError(const NSURLRef& inTheWay) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileWriteFileExistsError,
      {{NSFilePathErrorKey, inTheWay->path()},
       {FPCollidingURLKey, inTheWay},
       {NSLocalizedDescriptionKey, "\"" + inTheWay->lastPathComponent() + "\" is already there"},
       {NSUnderlyingErrorKey, NSError::errorWithErrno(EEXIST, inTheWay->path())}});
}

NSErrorRef noSuchFileError(const std::string& path) { return fileError(ENOENT, path); }

NSErrorRef checkFileName(const std::string& name) {
  if (name.empty()) return invalidName(name, EINVAL, "a name cannot be empty");
  if (name == "." || name == "..") {
    return invalidName(name, EINVAL, "\"" + name + "\" cannot be a name");
  }
  if (name.find('/') != std::string::npos) {
    return invalidName(name, EINVAL, "a name cannot contain a slash");
  }
  if (name.find('\0') != std::string::npos) {
    return invalidName(name, EINVAL, "a name cannot contain a NUL byte");
  }
  if (name.size() > kMaximumNameLength) {
    return invalidName(name, ENAMETOOLONG,
                       "a name cannot be longer than " + std::to_string(kMaximumNameLength) +
                           " bytes; this one has " + std::to_string(name.size()));
  }
  return nullptr;
}

}  // namespace yomber
