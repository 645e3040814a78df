#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

#include "platform/foundation/directory_stream.h"
#include "platform/foundation/file_descriptor.h"

namespace yomber {

/// Removes a file, or a directory with all that is in it, of any depth and also while others put
/// things in. Never leaves the directory through a symbolic link, also not one that is put there
/// meanwhile. Needs neither stack nor descriptors in proportion to the depth.
///
/// Thread-safety: one thread at a time.
class TreeRemoval {
 public:
  /// What is done about directories of ours that forbid to remove what is in them.
  enum class Protection { Respect, Lift };

  explicit TreeRemoval(Protection protection = Protection::Respect) : protection_(protection) {}

  /// False at the first failure, with errno and `failedPath` set; the rest stays.
  bool run(const std::string& path);

  [[nodiscard]] const std::string& failedPath() const { return failedPath_; }

 private:
  struct Level {
    DirectoryStream directory;  ///< nil: let go
    std::string name;
    dev_t device = 0;
    ino_t inode = 0;
    bool mayHoldMore = false;  ///< something was removed since the reading began
  };

  [[nodiscard]] bool descend(int parent, const std::string& name);
  [[nodiscard]] bool step();
  [[nodiscard]] bool removeEntry(const std::string& name);
  [[nodiscard]] bool readAgainOrAscend();
  [[nodiscard]] bool ascend();
  [[nodiscard]] bool reopenParent();
  [[nodiscard]] bool failAt(const std::string& name);
  /// Whether a directory that was not as it was expected is to be looked at again.
  [[nodiscard]] bool mayLookAgain() { return ++refills_ <= kMaximumRefills; }
  [[nodiscard]] FileDescriptor openLevel(int parent, const char* name) const;

  /// Whoever fills a directory as fast as it is emptied wins in the end.
  static constexpr int kMaximumRefills = 1'000;

  const Protection protection_;
  std::vector<Level> levels_;
  int refills_ = 0;  ///< how often a directory that was emptied held something again
  std::string failedPath_;
};

}  // namespace yomber
