#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <vector>

#include "zarn/dirty_folders.h"
#include "zarn/folder_snapshot.h"
#include "zarn/item_row.h"
#include "zarn/link_resolver.h"
#include "zarn/scanner.h"
#include "zarn/write_transaction.h"

namespace yomber {

/// One scan's comparison of what the disk holds with the rows: from the first folder compared until
/// `finish`, so that what is gone in one place and new in another is seen as moved.
///
/// All but the constructor for the writer thread only, during jobs; all throw SQLite::Exception.
class Reconciler {
 public:
  /// A folder that has no rows below it yet.
  struct NewFolder {
    std::shared_ptr<const FileDescriptor> parent;
    std::string name;
    std::uint64_t visit = 0;
  };

  Reconciler(const LinkResolver& links, std::weak_ptr<FolderVisitor> visitor)
      : links_(links), visitor_(std::move(visitor)) {}

  /// Says which folder a visit reads. For other folders than those where a scan begins this is
  /// found out when their parent is compared, if `comparesEverything` is on, or if they are new.
  void setFolderOfVisit(std::uint64_t visit, std::uint64_t folder) { visits_[visit] = folder; }
  void setComparesEverything(bool on) { comparesEverything_ = on; }

  /// Compares a folder's rows with its entries.
  void compareFolder(WriteTransaction& transaction, const FolderSnapshot& snapshot);
  /// Compares one name in a folder: `snapshot` holds it alone, or no entry when it is gone.
  void compareName(WriteTransaction& transaction, std::uint64_t folder, const std::string& name,
                   const FolderSnapshot& snapshot);
  /// Compares a folder itself and some names in it: `snapshot` holds those that exist.
  void compareNames(WriteTransaction& transaction, std::uint64_t folder,
                    const std::vector<std::string>& names, const FolderSnapshot& snapshot);
  /// Decides what was left open, and removes the rows of what is gone.
  void finish(WriteTransaction& transaction);

  /// What was left alone because others had changed it since it was looked at: to be looked at
  /// again.
  [[nodiscard]] std::vector<DirtyFolder> takeConflicts();
  /// Whether a folder was to be read, and whether it could be.
  [[nodiscard]] bool hadTurn(std::uint64_t folder) const { return turns_.contains(folder); }
  [[nodiscard]] bool hasRead(std::uint64_t folder) const {
    const auto turn = turns_.find(folder);
    return turn != turns_.end() && turn->second;
  }
  [[nodiscard]] bool hasNewFolders() const { return !newFolders_.empty(); }
  [[nodiscard]] std::vector<NewFolder> takeNewFolders() { return std::exchange(newFolders_, {}); }

 private:
  /// An entry with no row of its own, or whose row is another file's.
  struct Candidate {
    const FolderSnapshot* snapshot = nullptr;
    std::uint64_t parent = 0;
    std::string name;
    FolderEntry entry;
    ItemAttributes attributes;
    std::shared_ptr<const FileDescriptor> folder;
    std::uint64_t rankBefore = 0;
    std::uint64_t replaced = 0;   ///< the row that has its place; 0: none
    bool isOpenedFolder = false;  ///< `folder` is open on it, rather than on its parent
  };
  struct Differing {
    std::uint64_t id = 0;
    std::size_t entry = 0;
  };
  struct Differences {
    std::vector<std::uint64_t> gone;
    std::vector<Differing> differing;
    std::vector<bool> isKnown;  ///< beside the entries
  };

  /// Whether a row has been changed by others since the snapshot was begun.
  [[nodiscard]] bool isNewer(std::uint64_t rank, std::uint64_t rankBefore) const;
  /// Notes the ranks that a piece of work used as this scan's own.
  class OwnRanks {
   public:
    OwnRanks(Reconciler& reconciler, const WriteTransaction& transaction)
        : reconciler_(reconciler), transaction_(transaction), first_(transaction.rank()) {}
    ~OwnRanks() {
      if (transaction_.rank() != first_)
        reconciler_.ownRanks_.emplace_back(first_, transaction_.rank());
    }
    OwnRanks(const OwnRanks&) = delete;
    OwnRanks& operator=(const OwnRanks&) = delete;

   private:
    Reconciler& reconciler_;
    const WriteTransaction& transaction_;
    const std::uint64_t first_;
  };

  void noteConflict(std::uint64_t folder, std::string_view name);

  // Telling (reconciler.cpp).
  Differences findDifferences(WriteTransaction& transaction, std::uint64_t folder,
                              const FolderSnapshot& snapshot);
  /// Whether times that are the same mean that nothing has changed. Not where something is known to
  /// have happened: two changes within one tick of the disk's clock have the same times.
  enum class Trust { Times, Nothing };
  void compareEntry(WriteTransaction& transaction, std::uint64_t folder, const std::string& name,
                    const FolderSnapshot& snapshot, const FolderEntry* entry, Trust trust);
  bool refreshFolder(WriteTransaction& transaction, std::uint64_t folder,
                     const FolderSnapshot& snapshot);
  void settleKnown(WriteTransaction& transaction, const FolderSnapshot& snapshot, ItemRow row,
                   const FolderEntry& entry);
  void noteGone(ItemRow row, const FolderSnapshot& snapshot);
  void addCandidate(WriteTransaction& transaction, std::uint64_t folder,
                    const FolderSnapshot& snapshot, const FolderEntry& entry,
                    std::uint64_t replaced);
  void noteFolder(const FolderSnapshot& snapshot, const FolderEntry& entry, std::uint64_t id,
                  bool isNew);

  // Deciding (reconciler_decisions.cpp).
  [[nodiscard]] std::optional<ItemRow> findOwnRow(WriteTransaction& transaction,
                                                  const Candidate& candidate);
  [[nodiscard]] bool isElsewhere(const ItemRow& row) const;
  bool isStillThere(const Candidate& candidate);
  void decide(WriteTransaction& transaction, Candidate& candidate);
  void decideOpen(WriteTransaction& transaction);
  [[nodiscard]] static bool isBeingSaved(const Candidate& candidate, const ItemRow& own);
  bool takeReplaced(WriteTransaction& transaction, Candidate& candidate);
  bool takeBackedUp(WriteTransaction& transaction, Candidate& candidate,
                    const std::optional<ItemRow>& own);
  void move(WriteTransaction& transaction, const Candidate& candidate, const ItemRow& row);
  void postpone(const Candidate& candidate);
  /// `former` is what it was before its row went, where that is known.
  void add(WriteTransaction& transaction, const Candidate& candidate,
           std::optional<ItemRow> former = std::nullopt);
  [[nodiscard]] static std::optional<ItemRow> findFormer(WriteTransaction& transaction,
                                                         const Candidate& candidate);
  /// The folder that what is gone was in.
  struct FormerFolder {
    std::uint64_t id = kNoParent;
    std::shared_ptr<const FileDescriptor> folder;
  };
  [[nodiscard]] bool isBack(Connection& connection, const ItemRow& row, FormerFolder& former) const;
  void removeGone(WriteTransaction& transaction);

  // Storing (reconciler_rows.cpp).
  void describe(const Candidate& candidate, ItemRow& row) const;
  void choosePlace(WriteTransaction& transaction, const Candidate& candidate, ItemRow& row);
  void giveBack(const Candidate& candidate, ItemRow& row) const;
  void stamp(const Candidate& candidate, ItemRow& row) const;
  /// False, with nothing stored, when a folder would come to lie below itself.
  bool storeChanged(WriteTransaction& transaction, const Candidate& candidate,
                    const ItemRow& before);

  const LinkResolver& links_;
  const std::weak_ptr<FolderVisitor> visitor_;
  bool comparesEverything_ = false;
  std::unordered_map<std::uint64_t, std::uint64_t> visits_;
  std::unordered_map<std::uint64_t, bool> turns_;  ///< of folders: whether they were read
  std::unordered_map<std::uint64_t, ItemRow> gone_;
  std::vector<Candidate> open_;
  std::size_t openFolders_ = 0;  ///< how many descriptors those hold
  std::unordered_set<std::uint64_t> openInodes_;
  std::map<std::uint64_t, std::set<std::string>> conflicts_;  ///< by folder; no name: itself alone
  std::vector<NewFolder> newFolders_;
  std::vector<std::pair<std::uint64_t, std::uint64_t>>
      ownRanks_;  ///< rising; first < rank <= second
};

/// Whether an entry is what its row says, without reading more of it.
[[nodiscard]] bool isAsBefore(const ItemRow& row, const FolderEntry& entry);
/// Whether a row and an entry are of the same type.
[[nodiscard]] bool isSameType(const ItemRow& row, const FolderEntry& entry);
/// Whether a row's file is that of an entry, wherever each of them is: by inode and, since inode
/// numbers are used again at once, by birth.
[[nodiscard]] bool isSameFile(const ItemRow& row, const FolderEntry& entry,
                              const ItemAttributes& attributes);

}  // namespace yomber
