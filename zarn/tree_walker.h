#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "zarn/folder_snapshot.h"
#include "zarn/scanner.h"

namespace yomber {

/// Opens the folder `relative` below an open one, component by component in as few calls as paths'
/// lengths allow, through no symbolic link. Null with errno set when it is not there.
[[nodiscard]] std::shared_ptr<const FileDescriptor> openFolderBelow(int base,
                                                                    std::string_view relative);
/// Opens a folder by its whole path. Null with errno set.
[[nodiscard]] std::shared_ptr<const FileDescriptor> openFolder(const std::string& path);

/// Reads folders, one or a whole subtree, parents before what is below them.
///
/// Goes down and up by descriptors, so that neither the length of a path nor its depth matters, and
/// holds a bounded number of them. For one thread at a time.
class TreeWalker {
 public:
  struct Options {
    std::weak_ptr<FolderVisitor> visitor;
    std::function<std::uint64_t()> currentRank;
    /// Reads every entry's attributes too.
    bool readsAttributes = false;
  };
  explicit TreeWalker(Options options) : options_(std::move(options)) {}

  /// A number for one reading of a folder; never the same twice in this process.
  [[nodiscard]] static std::uint64_t nextVisit();

  /// Reads one folder; tells the visitor before. What cannot be read is answered as unreadable.
  [[nodiscard]] std::unique_ptr<FolderSnapshot> read(std::shared_ptr<const FileDescriptor> folder,
                                                     std::uint64_t visit);

  /// Takes each snapshot as it is read; false ends the walk.
  using Deliver = std::function<bool(std::unique_ptr<FolderSnapshot>)>;
  /// Reads the folder and everything below it. False when `deliver` ended it.
  bool walk(std::shared_ptr<const FileDescriptor> folder, std::uint64_t visit,
            const Deliver& deliver);

 private:
  struct Child {
    std::string name;
    std::uint64_t visit = 0;
  };
  struct Level {
    std::shared_ptr<const FileDescriptor> folder;  // null while it is closed to save descriptors
    std::uint64_t inode = 0;
    std::vector<Child> children;  // still to be read, the next one last
  };
  void readAttributes(FolderSnapshot& snapshot);
  [[nodiscard]] static Level levelOf(const FolderSnapshot& snapshot);
  static void reopen(Level& level, const FileDescriptor& child);

  const Options options_;
};

}  // namespace yomber
