#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "zarn/connection.h"
#include "zarn/tree_layout.h"

namespace yomber {

/// How an entry on disk is shown, where that is not by its name there.
struct ShownName {
  std::uint64_t folder = 0;  ///< inode number; of a container's folder: that of its Documents
  std::string name;          ///< on disk; of a container's folder: empty
  std::string shownName;     ///< empty: no longer otherwise than on disk, or gone
  std::string location;      ///< of a container's folder: its Documents; else empty

  friend bool operator==(const ShownName&, const ShownName&) = default;
};

/// How far the names have been read.
struct ShownNamesPosition {
  std::uint64_t folder = 0;  ///< id
  std::string diskName;
};

/// Adds up to `limit` names to `out`, from behind `after` on; from the beginning without one.
/// Answers where to go on, nothing when there are no more. Throws SQLite::Exception.
[[nodiscard]] std::optional<ShownNamesPosition> readShownNames(
    Connection& connection, const std::optional<ShownNamesPosition>& after, std::size_t limit,
    std::vector<ShownName>& out);

/// Whether an entry of the folder is shown otherwise. Throws SQLite::Exception.
[[nodiscard]] bool hasShownNames(Connection& connection, std::uint64_t folder);

/// Adds the containers' folders to `out`. Throws SQLite::Exception.
void readShownContainers(Connection& connection, const TreeLayout& layout,
                         std::vector<ShownName>& out);

}  // namespace yomber
