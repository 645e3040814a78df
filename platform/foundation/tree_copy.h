#pragma once

#include <sys/stat.h>

#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/deep_directory.h"
#include "platform/foundation/error.h"

namespace yomber {

/// Copies a file, a symbolic link, or a folder of any depth with all that is in it: content with
/// its holes, permissions, dates to the nanosecond, user attributes. Links are copied as links; a
/// name of several is a file of its own. What is in the copy is on the disk when the copy is
/// answered.
///
/// What disappears from a folder meanwhile is left out. Sockets, pipes and devices are refused.
///
/// Thread-safety: one thread at a time.
class TreeCopy {
 public:
  enum class Identity {
    New,   ///< the copy is an item of its own: none of the drive's own attributes come along
    Kept,  ///< the copy takes its source's place, faults included
  };

  explicit TreeCopy(Identity identity) : identity_(identity) {}

  /// Nil, or the first failure, whose path is in the source: POSIX domain, or Cocoa 4354 for
  /// content that is not here. Nothing may be at `destination`; what is there after a failure is
  /// the caller's to remove.
  [[nodiscard]] NSErrorRef run(const std::string& source, const std::string& destination);
  /// The permissions that a folder's copy still has to get: without those of its owner it could not
  /// be moved into another folder.
  [[nodiscard]] std::optional<mode_t> pendingMode() const { return pendingMode_; }

 private:
  struct Folder {
    std::vector<std::string> names;
    std::size_t next = 0;
    struct stat status{};
  };

  NSErrorRef copyFolder(const std::string& source, const std::string& destination);
  NSErrorRef openFolder(const std::string& name);
  NSErrorRef copyNext();
  NSErrorRef finishFolder();
  /// `number` 0 is no failure.
  [[nodiscard]] NSErrorRef failure(int number, const std::string& name = {}) const;

  const Identity identity_;
  DeepDirectory source_;
  DeepDirectory destination_;
  std::vector<Folder> folders_;
  struct stat root_{};  ///< of the copy
  std::optional<mode_t> pendingMode_;
};

}  // namespace yomber
