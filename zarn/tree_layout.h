#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace yomber {

/// Where things are below a drive's home, and which names the drive leaves alone.
///
/// The root folder is the Documents of the default container (QSUbiquitousDefaultContainerID).
/// All paths are absolute, normalised byte strings without a trailing slash.
/// Thread-safety: immutable.
class TreeLayout {
 public:
  explicit TreeLayout(std::string home);

  [[nodiscard]] const std::string& home() const { return home_; }
  [[nodiscard]] const std::string& tree() const { return tree_; }  ///< <home>/tree
  [[nodiscard]] const std::string& root() const { return root_; }  ///< default Documents
  [[nodiscard]] const std::string& trashFiles() const { return trashFiles_; }
  [[nodiscard]] const std::string& trashInfo() const { return trashInfo_; }
  [[nodiscard]] const std::string& promises() const { return promises_; }    ///< tree/.Promises
  [[nodiscard]] const std::string& privateArea() const { return private_; }  ///< <home>/private
  [[nodiscard]] const std::string& databasePath() const { return database_; }

  /// A container's folder `<tree>/<container id>` and its Documents in there.
  [[nodiscard]] std::string containerFolder(std::string_view containerID) const;
  [[nodiscard]] std::string documents(std::string_view containerID) const;

  /// Makes the folders that a drive needs, private to the user; answers errno, 0 when all are
  /// there.
  [[nodiscard]] int createFolders() const;

  /// A location inside the tree, split into the place it belongs to and the path below the place.
  struct Place {
    enum class Kind { Documents, Trash };
    Kind kind = Kind::Documents;
    std::string containerID;  ///< of Documents places
    std::string path;         ///< the place's own location
    std::string relative;     ///< below it; empty for the place itself
  };
  /// Nothing for locations outside every place: private ones, promises, trash information, what is
  /// not in the tree at all, and paths that no file can have or with "." or ".." components.
  [[nodiscard]] std::optional<Place> placeOf(std::string_view path) const;

  /// Whether a location lies in the tree but is the drive's own business (promises, trash
  /// information, a container's folder outside its Documents), or in `private`.
  [[nodiscard]] bool isPrivate(std::string_view path) const;
  /// Whether any component below the place is a name that never syncs.
  [[nodiscard]] bool isExcluded(std::string_view path) const;

 private:
  std::string home_;
  std::string tree_;
  std::string root_;
  std::string trashFiles_;
  std::string trashInfo_;
  std::string promises_;
  std::string private_;
  std::string database_;
};

/// Whether the drive leaves files of this name alone: editors' locks and swap files, partial
/// downloads, anything that ends in ".nosync".
[[nodiscard]] bool isExcludedName(std::string_view name);

}  // namespace yomber
