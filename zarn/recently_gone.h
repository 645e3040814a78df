#pragma once

#include <cstdint>
#include <list>
#include <optional>
#include <unordered_map>
#include <utility>

#include "zarn/item_row.h"

namespace yomber {

/// Items that carried no id of their own when their rows went. One that was moved, and of whose
/// move only the first half was seen, gets its id (and what its row alone knew) back when the other
/// half is.
///
/// For the writer thread.
class RecentlyGone {
 public:
  static constexpr std::size_t kMaximumRows = 10'000;

  void note(const ItemRow& row) {
    rows_.push_back(row);
    byInode_.emplace(row.inode, std::prev(rows_.end()));
    if (rows_.size() > kMaximumRows) forget(rows_.begin());
  }
  /// One that `isIt` accepts among those of the inode; nobody gets it twice.
  template <typename IsIt>
  [[nodiscard]] std::optional<ItemRow> take(std::uint64_t inode, const IsIt& isIt) {
    const auto [begin, end] = byInode_.equal_range(inode);
    for (auto each = begin; each != end; ++each) {
      if (!isIt(*each->second)) continue;
      ItemRow row = std::move(*each->second);
      rows_.erase(each->second);
      byInode_.erase(each);
      return row;
    }
    return std::nullopt;
  }

 private:
  using Rows = std::list<ItemRow>;  // oldest first
  void forget(Rows::iterator row) {
    const auto [begin, end] = byInode_.equal_range(row->inode);
    for (auto each = begin; each != end; ++each) {
      if (each->second != row) continue;
      byInode_.erase(each);
      break;
    }
    rows_.erase(row);
  }

  Rows rows_;
  std::unordered_multimap<std::uint64_t, Rows::iterator> byInode_;
};

}  // namespace yomber
