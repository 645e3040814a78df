#include "zarn/entry_table.h"

#include <bit>
#include <functional>

namespace yomber {

EntryTable::EntryTable(const FolderSnapshot& snapshot)
    : snapshot_(snapshot), slots_(std::bit_ceil(snapshot.entries.size() * 2 + 2)) {
  const std::size_t mask = slots_.size() - 1;
  for (std::size_t i = 0; i < snapshot.entries.size(); ++i) {
    std::size_t slot = std::hash<std::string_view>()(snapshot.nameOf(snapshot.entries[i])) & mask;
    while (slots_[slot] != 0) slot = (slot + 1) & mask;
    slots_[slot] = static_cast<std::uint32_t>(i + 1);
  }
}

std::optional<std::size_t> EntryTable::find(std::string_view name) const {
  const std::size_t mask = slots_.size() - 1;
  for (std::size_t slot = std::hash<std::string_view>()(name) & mask; slots_[slot] != 0;
       slot = (slot + 1) & mask) {
    const std::size_t index = slots_[slot] - 1;
    if (snapshot_.nameOf(snapshot_.entries[index]) == name) return index;
  }
  return std::nullopt;
}

}  // namespace yomber
