#include "zarn/tree_layout.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>

#include "platform/ostrell/constants.h"
#include "platform/ostrell/exclusions.h"

namespace yomber {
namespace {

bool isBelowOrEqual(std::string_view path, std::string_view ancestor) {
  return path.starts_with(ancestor) &&
         (path.size() == ancestor.size() || path[ancestor.size()] == '/');
}

/// What follows `ancestor` and its slash.
std::string_view below(std::string_view path, std::string_view ancestor) {
  return path.substr(std::min(path.size(), ancestor.size() + 1));
}

template <typename Predicate>
bool anyComponent(std::string_view path, Predicate predicate) {
  while (!path.empty()) {
    const std::size_t slash = path.find('/');
    if (predicate(path.substr(0, slash))) return true;
    if (slash == std::string_view::npos) break;
    path.remove_prefix(slash + 1);
  }
  return false;
}

bool hasDotComponents(std::string_view path) {
  return anyComponent(path, [](std::string_view c) { return c.empty() || c == "." || c == ".."; });
}

int makeFolder(const std::string& path) {
  constexpr mode_t kPrivate = 0700;
  if (mkdir(path.c_str(), kPrivate) == 0 || errno == EEXIST) return 0;
  return errno;
}

constexpr std::string_view kDocuments = "Documents";

}  // namespace

TreeLayout::TreeLayout(std::string home)
    : home_(std::move(home)),
      tree_(home_ + "/tree"),
      root_(documents(QSUbiquitousDefaultContainerID)),
      trashFiles_(tree_ + "/.Trash/files"),
      trashInfo_(tree_ + "/.Trash/info"),
      promises_(tree_ + "/.Promises"),
      private_(home_ + "/private"),
      database_(home_ + "/zarn.db") {}

std::string TreeLayout::containerFolder(std::string_view containerID) const {
  return tree_ + "/" + std::string(containerID);
}

std::string TreeLayout::documents(std::string_view containerID) const {
  return containerFolder(containerID).append("/").append(kDocuments);
}

int TreeLayout::createFolders() const {
  for (const std::string& path :
       {home_, tree_, containerFolder(QSUbiquitousDefaultContainerID), root_, tree_ + "/.Trash",
        trashFiles_, trashInfo_, promises_, private_}) {
    if (const int failure = makeFolder(path); failure != 0) return failure;
  }
  return 0;
}

std::optional<TreeLayout::Place> TreeLayout::placeOf(std::string_view path) const {
  if (!isBelowOrEqual(path, tree_) || path.size() == tree_.size()) return std::nullopt;
  if (path.find('\0') != std::string_view::npos) return std::nullopt;  // no file has that
  if (hasDotComponents(below(path, tree_))) return std::nullopt;
  if (isBelowOrEqual(path, trashFiles_)) {
    return Place{Place::Kind::Trash, {}, trashFiles_, std::string(below(path, trashFiles_))};
  }
  const std::string_view relative = below(path, tree_);
  if (relative.empty() || relative.front() == '.') return std::nullopt;
  const std::string containerID(relative.substr(0, relative.find('/')));
  std::string place = documents(containerID);
  if (!isBelowOrEqual(path, place)) return std::nullopt;
  std::string rest(below(path, place));
  return Place{Place::Kind::Documents, containerID, std::move(place), std::move(rest)};
}

bool TreeLayout::isPrivate(std::string_view path) const {
  if (isBelowOrEqual(path, private_)) return true;
  return isBelowOrEqual(path, tree_) && !placeOf(path);
}

bool TreeLayout::isExcluded(std::string_view path) const {
  const auto place = placeOf(path);
  return place && anyComponent(place->relative, isExcludedName);
}

bool isExcludedName(std::string_view name) { return qs_isExcludedName(name); }

}  // namespace yomber
