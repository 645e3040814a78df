#pragma once

#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

#include "zarn/folder_snapshot.h"

namespace yomber {

/// Finds a snapshot's entries by name. Cheap to build for folders of any size.
class EntryTable {
 public:
  explicit EntryTable(const FolderSnapshot& snapshot);

  /// The entry's index.
  [[nodiscard]] std::optional<std::size_t> find(std::string_view name) const;

 private:
  const FolderSnapshot& snapshot_;
  std::vector<std::uint32_t> slots_;  // index + 1; 0: empty. A power of two, at most half full.
};

}  // namespace yomber
