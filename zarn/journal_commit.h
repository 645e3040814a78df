#pragma once

#include <cstdint>
#include <functional>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "zarn/item_row.h"
#include "zarn/item_store.h"
#include "zarn/journal_queue.h"

namespace yomber {

/// Works out what a commit means for whoever shows the tree on disk.
///
/// The entries of a folder that is watched need not be told: its events have said, or will say,
/// all there is to say. For one thread, while one commit is told.
class JournalCommit {
 public:
  using IsWatched = std::function<bool(std::uint64_t folder)>;  ///< by id

  JournalCommit(const ItemStore& store, const IsWatched& isWatched)
      : store_(store), isWatched_(isWatched) {}

  void addChanges(const std::vector<ItemChange>& changes);
  void addTouched(const std::vector<ItemRow>& rows);

  /// In the order in which they count: of several for one name, the last.
  [[nodiscard]] const JournalBatch& news() const { return news_; }
  /// It cannot be told one by one.
  [[nodiscard]] bool hasLostTrack() const { return hasLostTrack_; }

 private:
  void noteFolder(const ItemChange& change);
  void addBefore(const ItemChange& change);
  void addAfter(const ItemRow& row);
  void addContainer(const ItemChange& change);
  void addEntry(std::uint64_t folder, const std::string& name);
  void addItself(const ItemRow& row);
  void addShownName(std::uint64_t folder, const std::string& name, const std::string& shownName);
  [[nodiscard]] bool isWatched(std::uint64_t folder);
  [[nodiscard]] std::uint64_t inodeOf(std::uint64_t folder);

  const ItemStore& store_;
  const IsWatched& isWatched_;
  std::unordered_map<std::uint64_t, std::uint64_t> inodes_;  // by id
  std::unordered_map<std::uint64_t, bool> watched_;          // by id
  std::unordered_set<std::uint64_t> dead_;
  JournalBatch news_;
  bool hasLostTrack_ = false;
};

}  // namespace yomber
