#pragma once

#include <string>
#include <string_view>

#include "zarn/tree_layout.h"

namespace yomber {

/// Tells bookmarks from other symbolic links.
/// Thread-safety: immutable.
class LinkResolver {
 public:
  explicit LinkResolver(TreeLayout layout);

  [[nodiscard]] const TreeLayout& layout() const { return layout_; }

  /// Whether the symbolic link `name` in the open folder leads to something inside the drive, both
  /// by what its text says and by where it really ends. Loops and dangling links do not.
  [[nodiscard]] bool isBookmark(int folder, const std::string& name) const;

 private:
  [[nodiscard]] bool isInside(std::string_view path) const;

  const TreeLayout layout_;
  const TreeLayout realLayout_;  ///< of the home with all links resolved
};

}  // namespace yomber
