#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <map>
#include <set>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "zarn/disk_entry.h"
#include "zarn/shown_names.h"

namespace yomber {

/// What is told at a time.
struct JournalBatch {
  std::vector<DiskEntry> entries;
  std::vector<ShownName> shownNames;

  [[nodiscard]] bool isEmpty() const { return entries.empty() && shownNames.empty(); }
};

/// What waits to be told to one observer: every entry once, every name as it is shown now.
///
/// Thread-safety: none; the owner guards it.
class JournalQueue {
 public:
  void add(const DiskEntry& entry);
  void add(const ShownName& name);
  void clear();

  [[nodiscard]] std::size_t size() const { return size_; }
  /// Up to `limit` of it: names first, so that what has changed is seen under the right one; then
  /// entries, folder by folder, in the order in which folders began to change.
  [[nodiscard]] JournalBatch take(std::size_t limit);

 private:
  struct Folder {
    bool isWhole = false;  ///< `names` is empty then
    std::set<std::string, std::less<>> names;
  };
  using Key = std::pair<std::uint64_t, std::string>;

  void takeEntries(std::size_t limit, std::vector<DiskEntry>& out);

  std::unordered_map<std::uint64_t, Folder> folders_;
  std::deque<std::uint64_t> order_;
  std::map<Key, ShownName> shownNames_;
  std::size_t size_ = 0;
};

}  // namespace yomber
