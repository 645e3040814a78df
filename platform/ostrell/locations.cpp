#include "platform/ostrell/locations.h"

#include <algorithm>

#include "platform/foundation/url.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/exclusions.h"

namespace yomber {
namespace {

constexpr std::string_view kDocuments = "/Documents";
constexpr std::string_view kTrash = "/.Trash";
constexpr std::string_view kTrashFiles = "/files";

bool isAtOrBelow(std::string_view path, std::string_view folder) {
  return path == folder || isPathBelow(path, folder);
}

bool climbs(std::string_view path) {
  for (auto at = path.find("/.."); at != std::string_view::npos; at = path.find("/..", at + 1)) {
    if (at + 3 == path.size() || path[at + 3] == '/') return true;
  }
  return false;
}

}  // namespace

DriveLocations::DriveLocations(std::string_view home)
    : home_(home),
      tree_(home_ + "/tree"),
      root_(tree_ + "/" + QSUbiquitousDefaultContainerID + std::string(kDocuments)),
      trash_(tree_ + "/.Trash"),
      promises_(tree_ + "/.Promises"),
      private_(home_ + "/private") {}

std::string DriveLocations::containerDocuments(std::string_view containerID) const {
  if (containerID == QSUbiquitousDocumentsContainerID)
    return root_ + "/" + QSUbiquitousDocumentsFolderName;
  if (containerID == QSUbiquitousDesktopContainerID)
    return root_ + "/" + QSUbiquitousDesktopFolderName;
  return tree_ + "/" + std::string(containerID) + std::string(kDocuments);
}

bool DriveLocations::isInTree(std::string_view path) const {
  return isPathBelow(path, tree_) && !climbs(path);
}

bool DriveLocations::isInTrash(std::string_view path) const {
  return isPathBelow(path, trash_) && !climbs(path);
}

std::optional<std::string_view> DriveLocations::belowPlace(std::string_view path) const {
  if (!isInTree(path)) return std::nullopt;
  const std::string_view relative = path.substr(tree_.size());  // "/first/second/…"
  const auto second = relative.find('/', 1);
  if (second == std::string_view::npos) return std::nullopt;
  const std::string_view first = relative.substr(0, second);
  const bool isDotted = first.size() > 1 && first[1] == '.';
  const std::string_view place = first == kTrash ? kTrashFiles : kDocuments;
  if (isDotted && first != kTrash) return std::nullopt;
  const std::string_view rest = relative.substr(second);
  if (!isAtOrBelow(rest, place)) return std::nullopt;
  return rest.substr(place.size());
}

bool DriveLocations::isPrivate(std::string_view path) const {
  return isAtOrBelow(path, private_) || (isAtOrBelow(path, tree_) && !belowPlace(path));
}

bool DriveLocations::isExcluded(std::string_view path) const {
  std::string_view rest = belowPlace(path).value_or("");
  while (!rest.empty()) {
    rest.remove_prefix(1);
    const auto end = std::min(rest.find('/'), rest.size());
    if (qs_isExcludedName(rest.substr(0, end))) return true;
    rest.remove_prefix(end);
  }
  return false;
}

std::optional<std::string> DriveLocations::containerOfDocuments(std::string_view path) const {
  if (path == root_ + "/" + QSUbiquitousDocumentsFolderName)
    return QSUbiquitousDocumentsContainerID;
  if (path == root_ + "/" + QSUbiquitousDesktopFolderName) return QSUbiquitousDesktopContainerID;
  if (!isPathBelow(path, tree_) || !path.ends_with(kDocuments)) return std::nullopt;
  std::string_view container = path.substr(tree_.size() + 1);
  // "/Documents" may be all there is below the tree.
  if (container.size() <= kDocuments.size()) return std::nullopt;
  container.remove_suffix(kDocuments.size());
  const bool isName = container.find('/') == std::string_view::npos && !container.starts_with('.');
  return isName ? std::optional<std::string>(container) : std::nullopt;
}

}  // namespace yomber
