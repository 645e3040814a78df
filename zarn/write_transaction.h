#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "zarn/busy_files.h"
#include "zarn/connection.h"
#include "zarn/item_row.h"
#include "zarn/recent_backups.h"
#include "zarn/recently_gone.h"

namespace yomber {

/// How many tombstones, and how many departures from the working set, are kept for those who ask
/// what changed; the oldest go first.
inline constexpr std::int64_t kMaximumTombstones = 100'000;

/// What a job on the writer thread changes rows with: keeps ranks, tombstones, the working set and
/// the trash's marks right, and collects what the sinks are told.
///
/// All throw SQLite::Exception. For the writer thread only, during its job.
class WriteTransaction {
 public:
  WriteTransaction(Connection& connection, std::uint64_t rank, std::int64_t now,
                   const BusyFiles& busyFiles, RecentBackups& recentBackups,
                   RecentlyGone& recentlyGone)
      : connection_(connection),
        rank_(rank),
        now_(now),
        busyFiles_(busyFiles),
        recentBackups_(recentBackups),
        recentlyGone_(recentlyGone) {}

  [[nodiscard]] Connection& connection() { return connection_; }
  /// Of the last change so far.
  [[nodiscard]] std::uint64_t rank() const { return rank_; }
  std::uint64_t nextRank() { return ++rank_; }
  [[nodiscard]] const std::vector<ItemChange>& changes() const { return changes_; }
  /// Rows that were changed quietly, as they are then.
  [[nodiscard]] const std::vector<ItemRow>& touched() const { return touched_; }
  [[nodiscard]] std::int64_t now() const { return now_; }
  /// See BusyFiles.
  [[nodiscard]] bool isBusy(std::uint64_t inode) const { return busyFiles_.contains(inode); }
  [[nodiscard]] RecentBackups& recentBackups() { return recentBackups_; }
  [[nodiscard]] RecentlyGone& recentlyGone() { return recentlyGone_; }

  /// An id that no item has.
  [[nodiscard]] std::uint64_t issueID();
  /// Adds a row. The rank and the trashed flag are filled in.
  void insert(ItemRow& row);
  /// Stores `after` over `before` with a new rank, and marks what is below when it went into or out
  /// of the trash. False, with nothing changed, when a folder would come to lie below itself.
  bool update(const ItemRow& before, ItemRow& after);
  /// Stores what nobody is shown (inode, ctime, stamps): no rank, no change.
  void updateQuietly(const ItemRow& row);
  /// Removes a row and everything below it, each leaving a tombstone.
  void remove(const ItemRow& row);
  /// Gives up the row's name, which another row is about to get; the row itself gets a new one, or
  /// goes, in the same session.
  void park(std::uint64_t id);

  /// Whether another row than `self` in the folder has that name, or one that is the same text.
  /// Rows that `ignore` accepts do not count.
  using Ignore = std::function<bool(const ItemRow&)>;
  [[nodiscard]] bool isNameTaken(std::uint64_t parent, std::string_view name, std::uint64_t self,
                                 const Ignore& ignore);

  /// Takes a member out of the working set, with a new rank.
  void departFromWorkingSet(std::uint64_t id);

  // For the writer: what a failed job leaves is taken back.
  struct Mark {
    std::uint64_t rank = 0;
    std::size_t changes = 0;
    std::size_t touched = 0;
  };
  [[nodiscard]] Mark mark() const { return {rank_, changes_.size(), touched_.size()}; }
  void rewind(const Mark& mark);
  /// Drops the oldest tombstones and departures where there are too many. Answers the rank up to
  /// which departures are now unknown, 0 when none were dropped.
  std::uint64_t prune();

 private:
  [[nodiscard]] bool isInTrash(std::uint64_t parent);
  [[nodiscard]] bool isBelow(std::uint64_t folder, std::uint64_t ancestor);
  void store(const ItemRow& row);
  void removeOne(const ItemRow& row);
  void markBelow(std::uint64_t folder, bool isTrashed);
  void keepWorkingSet(const ItemRow* before, const ItemRow& after);

  Connection& connection_;
  std::uint64_t rank_;
  const std::int64_t now_;
  const BusyFiles& busyFiles_;
  RecentBackups& recentBackups_;
  RecentlyGone& recentlyGone_;
  std::vector<ItemChange> changes_;
  std::vector<ItemRow> touched_;
};

}  // namespace yomber
