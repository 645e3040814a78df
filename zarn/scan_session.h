#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/database.h"
#include "zarn/item_store.h"
#include "zarn/reconciler.h"
#include "zarn/tree_walker.h"

namespace yomber {

/// A place where a scan begins.
struct ScanPlace {
  std::uint64_t id = 0;
  std::uint64_t visit = 0;
  std::shared_ptr<const FileDescriptor> folder;
  ItemRow row;  ///< of containers; elsewhere only the id counts
};

void countSnapshot(const FolderSnapshot& snapshot, ScanReport& report);

/// A Reconciler's work as jobs of the writer thread. For one thread at a time.
class ScanSession {
 public:
  ScanSession(std::shared_ptr<Database> database, const LinkResolver& links,
              std::weak_ptr<FolderVisitor> visitor)
      : database_(std::move(database)), reconciler_(links, std::move(visitor)) {}

  void setComparesEverything() { reconciler_.setComparesEverything(true); }
  void setFolderOfVisit(std::uint64_t visit, std::uint64_t folder) {
    reconciler_.setFolderOfVisit(visit, folder);
  }

  using Snapshots = std::vector<std::unique_ptr<FolderSnapshot>>;
  [[nodiscard]] NSErrorRef compare(const Snapshots& snapshots);
  /// Compares and, when nothing new has to be read, finishes in the same transaction.
  [[nodiscard]] NSErrorRef compareAndFinish(const Snapshots& snapshots, TreeWalker& walker,
                                            ScanReport& report);
  /// The same for one name.
  [[nodiscard]] NSErrorRef compareNameAndFinish(std::uint64_t folder, const std::string& name,
                                                const FolderSnapshot& snapshot, TreeWalker& walker,
                                                ScanReport& report);
  /// Some names in a folder.
  struct NamesInFolder {
    std::uint64_t folder = 0;
    std::vector<std::string> names;
    std::unique_ptr<FolderSnapshot> snapshot;  ///< of those that exist
  };
  /// The same for names in some folders and all of others, as one change.
  [[nodiscard]] NSErrorRef compareNamesAndFinish(const std::vector<NamesInFolder>& names,
                                                 const Snapshots& folders, TreeWalker& walker,
                                                 ScanReport& report);
  [[nodiscard]] NSErrorRef finish();

  /// The topmost folders that have rows but never had their turn: each has come into one that was
  /// read before.
  [[nodiscard]] NSErrorRef findMissed(std::vector<std::uint64_t>& folders) const;

  [[nodiscard]] std::uint64_t changes() const { return changes_; }
  /// See Reconciler::takeConflicts.
  [[nodiscard]] std::vector<DirtyFolder> takeConflicts() { return reconciler_.takeConflicts(); }

 private:
  using Work = std::function<void(WriteTransaction&)>;
  NSErrorRef run(const Work& work);
  NSErrorRef readNewFolders(TreeWalker& walker, ScanReport& report);
  NSErrorRef runAndFinish(const Work& work, TreeWalker& walker, ScanReport& report);

  const std::shared_ptr<Database> database_;
  Reconciler reconciler_;
  std::vector<Reconciler::NewFolder> newFolders_;
  std::uint64_t changes_ = 0;
};

/// Scans folders that are known by id.
class FolderScan {
 public:
  enum class Depth { NewOnly, Everything };
  FolderScan(const ItemStore& store, const LinkResolver& links,
             std::weak_ptr<FolderVisitor> visitor, TreeWalker::Options options)
      : store_(store),
        session_(store.database(), links, std::move(visitor)),
        walker_(std::move(options)) {}
  [[nodiscard]] NSErrorRef run(const std::vector<std::uint64_t>& folders, Depth depth,
                               ScanReport& report);
  /// Folders that are not where their rows say go into `notFound`; those that are to be scanned
  /// with everything below them, into `deep`.
  [[nodiscard]] NSErrorRef run(const std::vector<DirtyFolder>& folders,
                               std::vector<DirtyFolder>& notFound, std::vector<std::uint64_t>& deep,
                               ScanReport& report);
  /// See Reconciler::takeConflicts.
  [[nodiscard]] std::vector<DirtyFolder> takeConflicts() { return session_.takeConflicts(); }

 private:
  std::shared_ptr<const FileDescriptor> open(std::uint64_t& folder);
  std::shared_ptr<const FileDescriptor> openDirty(const DirtyFolder& dirty, std::uint64_t& folder,
                                                  std::vector<DirtyFolder>& notFound);
  std::unique_ptr<FolderSnapshot> readNames(std::shared_ptr<const FileDescriptor> folder,
                                            std::vector<std::string>& names, ScanReport& report);
  NSErrorRef readSubtree(std::shared_ptr<const FileDescriptor> folder, std::uint64_t visit,
                         ScanReport& report);

  const ItemStore& store_;
  ScanSession session_;
  TreeWalker walker_;
};

/// Opens an item's folder by the names that the rows have for it. Null with errno set.
[[nodiscard]] std::shared_ptr<const FileDescriptor> openFolderOfItem(const ItemStore& store,
                                                                     std::uint64_t folder);

}  // namespace yomber
