#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace yomber {

/// Where things lie under a drive's home: the one place that knows the tree's layout. Looks at
/// paths only, never at the disk.
///
/// All paths are absolute, normalised, bytes. A path with a ".." component lies nowhere.
/// Thread-safety: immutable.
class DriveLocations {
 public:
  /// `home` is absolute and normalised, as `DrivePaths` gives it.
  explicit DriveLocations(std::string_view home);

  [[nodiscard]] const std::string& home() const { return home_; }
  /// The synced tree; all that follow lie in it.
  [[nodiscard]] const std::string& tree() const { return tree_; }
  /// The drive's root folder: the default container's Documents.
  [[nodiscard]] const std::string& root() const { return root_; }
  [[nodiscard]] const std::string& trash() const { return trash_; }
  [[nodiscard]] std::string trashFiles() const { return trash_ + "/files"; }
  [[nodiscard]] std::string trashInfo() const { return trash_ + "/info"; }
  [[nodiscard]] const std::string& promises() const { return promises_; }
  /// Staging; beside the tree.
  [[nodiscard]] const std::string& privateStorage() const { return private_; }
  /// Documents and Desktop are ordinary folders of the root; any other container has a folder of
  /// its own in the tree.
  [[nodiscard]] std::string containerDocuments(std::string_view containerID) const;

  [[nodiscard]] bool isInTree(std::string_view path) const;
  [[nodiscard]] bool isInTrash(std::string_view path) const;
  /// Whether the path is in storage that is never listed: staging, and what is in the tree but
  /// neither in a container's Documents nor in the trash's files (promises, trash information, the
  /// tree's own folders).
  [[nodiscard]] bool isPrivate(std::string_view path) const;
  /// Whether its name never syncs, or that of a folder above it in Documents or in the trash.
  [[nodiscard]] bool isExcluded(std::string_view path) const;
  /// The container whose Documents folder this path would be, whether or not there is such a
  /// container.
  [[nodiscard]] std::optional<std::string> containerOfDocuments(std::string_view path) const;

 private:
  /// What follows the Documents folder or the trash's files that the path is in; nothing when it is
  /// in neither.
  [[nodiscard]] std::optional<std::string_view> belowPlace(std::string_view path) const;

  const std::string home_;
  const std::string tree_;
  const std::string root_;
  const std::string trash_;
  const std::string promises_;
  const std::string private_;
};

}  // namespace yomber
