#pragma once

#include <sys/inotify.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "platform/ipc/unix_socket.h"

namespace yomber {

/// The system's watches on folders, and which folder each belongs to.
///
/// A folder is watched when it is about to be read, before its id is known; events that come until
/// it is identified are remembered. Folders that get no watch are kept by id.
///
/// Thread-safety: none; the owner guards it. `descriptor` may be read on another thread.
class WatchTable {
 public:
  explicit WatchTable(std::size_t limit);

  /// Of the event queue, non-blocking; -1 when the system grants none, and no folder is watched.
  [[nodiscard]] int descriptor() const { return queue_.get(); }

  /// The folder's inode number when it was not watched before, and is now; else 0.
  std::uint64_t willRead(std::uint64_t visit, int folderDescriptor);
  /// True when something happened in the folder meanwhile.
  bool didIdentify(std::uint64_t visit, std::uint64_t id);
  /// The folder is gone: gives its watch back.
  void forget(std::uint64_t id);

  /// The folder of an event. Nothing when it is not known (yet): the event is remembered if the
  /// folder may still be identified.
  [[nodiscard]] std::optional<std::uint64_t> folderOfEvent(int watch);
  /// The inode number of the folder of an event, whether or not it is identified; 0 when there is
  /// no such watch any more.
  [[nodiscard]] std::uint64_t inodeOfEvent(int watch) const;
  [[nodiscard]] bool isWatched(std::uint64_t id) const { return byID_.contains(id); }
  /// The system has dropped the watch.
  void didDrop(int watch);

  [[nodiscard]] std::size_t watched() const { return byID_.size(); }
  [[nodiscard]] const std::unordered_set<std::uint64_t>& unwatched() const { return unwatched_; }
  /// What a person can do so that every folder is watched; empty when all are.
  [[nodiscard]] std::string advice() const;

 private:
  struct Watch {
    std::vector<std::uint64_t> visits;  // readings that have not been identified yet
    std::optional<std::uint64_t> id;
    bool sawEvent = false;  // since the first of those readings
    std::uint64_t inode = 0;
  };
  enum class Shortage { None, Watches, Instances, OwnLimit };

  int add(int folderDescriptor);
  void setUnwatchedVisit(std::uint64_t visit);
  void bind(int descriptor, std::uint64_t id);
  void unbind(int descriptor);

  const std::size_t limit_;
  ipc::UniqueFd queue_;
  Shortage shortage_ = Shortage::None;
  std::unordered_map<int, Watch> watches_;
  std::unordered_map<std::uint64_t, int> byID_;
  std::unordered_map<std::uint64_t, int> byVisit_;
  std::set<std::uint64_t> unwatchedVisits_;
  std::unordered_set<std::uint64_t> unwatched_;
};

}  // namespace yomber
