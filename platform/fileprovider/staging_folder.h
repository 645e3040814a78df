#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

#include "platform/foundation/file_descriptor.h"

namespace yomber {

/// A folder of one operation's own, in which something is made ready before it is renamed into
/// place, or is taken apart after it was renamed away. It goes with its object; what a crash left
/// is removed by whoever makes the next one beside it. Its name is one that never syncs.
///
/// Thread-safety: one thread at a time; any number of folders beside each other, also of several
/// processes.
class StagingFolder {
 public:
  /// A new one in `parent`. Nil and errno on failure.
  static std::unique_ptr<StagingFolder> make(const std::string& parent);
  ~StagingFolder();
  StagingFolder(const StagingFolder&) = delete;
  StagingFolder& operator=(const StagingFolder&) = delete;

  [[nodiscard]] const std::string& path() const { return path_; }
  /// Where the one thing in it belongs.
  [[nodiscard]] std::string content() const { return path_ + "/content"; }
  /// Of the file system.
  [[nodiscard]] dev_t device() const { return device_; }

 private:
  StagingFolder(std::string path, FileDescriptor lock, dev_t device);

  const std::string path_;
  const FileDescriptor lock_;  ///< locked for as long as the folder is in use
  const dev_t device_;
};

}  // namespace yomber
