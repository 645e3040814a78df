#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/date.h"
#include "platform/foundation/error.h"

namespace yomber {

/// Operations on the names of the disk.
///
/// Every operation answers false (or nothing) and stores an error when it fails. Errors are in the
/// POSIX domain, except for the two that callers tell apart: a missing source is Cocoa error 4, a
/// taken destination Cocoa error 516. Both name the path. A final symbolic link is itself the
/// object of an operation unless said otherwise.
///
/// Thread-safety: stateless; every operation may be called on any thread.
class NSFileManager {
 public:
  static NSFileManager& defaultManager();

  enum class Intermediates { Make, Require };

  /// Follows symbolic links: a dangling one does not exist.
  [[nodiscard]] bool fileExistsAtPath(const std::string& path) const;
  [[nodiscard]] bool isDirectoryAtPath(const std::string& path) const;

  /// With Intermediates::Make a directory that exists already is no failure.
  bool createDirectoryAtPath(const std::string& path, Intermediates intermediates,
                             NSErrorRef* error = nullptr, unsigned mode = 0777) const;
  /// Removes a file, or a directory with all that is in it; stops at the first failure. Never
  /// leaves the directory through a symbolic link, also not one that is put there meanwhile.
  bool removeItemAtPath(const std::string& path, NSErrorRef* error = nullptr) const;
  /// Moves within one file system; never replaces anything.
  bool moveItemAtPath(const std::string& source, const std::string& destination,
                      NSErrorRef* error = nullptr) const;
  /// The names in the directory, in byte order, without "." and "..".
  [[nodiscard]] std::optional<std::vector<std::string>> contentsOfDirectoryAtPath(
      const std::string& path, NSErrorRef* error = nullptr) const;

  bool setPermissions(const std::string& path, unsigned mode, NSErrorRef* error = nullptr) const;
  bool setModificationDate(const std::string& path, NSDate date, NSErrorRef* error = nullptr) const;

  /// The attribute's bytes; nothing and no error when the attribute is not there.
  [[nodiscard]] std::optional<std::string> extendedAttribute(const std::string& path,
                                                             const std::string& name,
                                                             NSErrorRef* error = nullptr) const;
  bool setExtendedAttribute(const std::string& path, const std::string& name,
                            const std::string& value, NSErrorRef* error = nullptr) const;
  /// An attribute that is not there is no failure.
  bool removeExtendedAttribute(const std::string& path, const std::string& name,
                               NSErrorRef* error = nullptr) const;

 private:
  NSFileManager() = default;
};

}  // namespace yomber
