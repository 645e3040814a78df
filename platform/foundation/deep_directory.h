#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

#include "platform/foundation/file_descriptor.h"

namespace yomber {

/// A directory in a tree of any depth, reached step by step and never through a symbolic link.
/// Keeps a bounded number of descriptors: the way up is opened again where it was let go.
///
/// Operations answer 0 or an errno. Thread-safety: one thread at a time.
class DeepDirectory {
 public:
  [[nodiscard]] int open(const std::string& path);
  [[nodiscard]] int descend(const std::string& name);
  /// ESTALE when the directory was moved elsewhere meanwhile. REQUIRES: depth() > 1.
  [[nodiscard]] int ascend();

  /// How many directories the way has, the first one included.
  [[nodiscard]] std::size_t depth() const { return levels_.size(); }
  /// Of the directory at the end of the way.
  [[nodiscard]] int descriptor() const { return levels_.back().descriptor.get(); }
  /// The first directory's path and the names from there on.
  [[nodiscard]] std::string path() const;

 private:
  struct Level {
    FileDescriptor descriptor;  ///< none: let go
    std::string name;
    dev_t device = 0;
    ino_t inode = 0;
  };

  int push(int parent, const std::string& name);

  std::vector<Level> levels_;
};

/// Opens the parent of the directory `child`, if it is the one of that device and inode; -1 and
/// errno, ESTALE when it is another one.
[[nodiscard]] int openParentDirectory(int child, dev_t device, ino_t inode);

/// As many levels as are held open on the way to a directory.
inline constexpr std::size_t kOpenLevels = 32;

}  // namespace yomber
