#include "zarn/scan_session.h"

#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <unordered_map>
#include <unordered_set>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "zarn/connection.h"
#include "zarn/row_queries.h"
#include "zarn/tree_layout.h"

namespace yomber {

void countSnapshot(const FolderSnapshot& snapshot, ScanReport& report) {
  if (!snapshot.isReadable) {
    ++report.unreadable;
    return;
  }
  ++report.folders;
  report.entries += snapshot.entries.size();
}

NSErrorRef ScanSession::run(const Work& work) {
  return database_->write([&](WriteTransaction& transaction) -> NSErrorRef {
    const std::size_t before = transaction.changes().size();
    work(transaction);
    changes_ += transaction.changes().size() - before;
    for (auto& folder : reconciler_.takeNewFolders()) newFolders_.push_back(std::move(folder));
    return nullptr;
  });
}

NSErrorRef ScanSession::compare(const Snapshots& snapshots) {
  return run([&](WriteTransaction& transaction) {
    for (const auto& snapshot : snapshots) reconciler_.compareFolder(transaction, *snapshot);
  });
}

NSErrorRef ScanSession::finish() {
  return run([&](WriteTransaction& transaction) { reconciler_.finish(transaction); });
}

NSErrorRef ScanSession::findMissed(std::vector<std::uint64_t>& folders) const {
  return database_->read([&](Connection& connection) {
    StatementUse statement(connection.prepared("SELECT id,parent FROM item WHERE kind=?1"));
    statement->bindInteger(1, static_cast<std::int64_t>(ItemKind::Folder));
    while (statement->step()) {
      const std::uint64_t id = statement->id(0);
      if (!reconciler_.hadTurn(id) && reconciler_.hasRead(statement->id(1))) folders.push_back(id);
    }
  });
}

NSErrorRef ScanSession::readNewFolders(TreeWalker& walker, ScanReport& report) {
  constexpr std::size_t kBatchedEntries = 10'000;
  constexpr std::size_t kBatchedFolders = 100;
  reconciler_.setComparesEverything(true);
  Snapshots batch;
  std::size_t entries = 0;
  NSErrorRef failure;
  const auto flush = [&] {
    failure = compare(batch);
    batch.clear();
    entries = 0;
    return !failure;
  };
  static FaultPoint beforeReading("zarn.scan.before-new-folders");
  (void)beforeReading.hit();
  for (const Reconciler::NewFolder& folder : std::exchange(newFolders_, {})) {
    auto opened = openFolderBelow(folder.parent->get(), folder.name);
    const bool goesOn =
        walker.walk(std::move(opened), folder.visit, [&](std::unique_ptr<FolderSnapshot> snapshot) {
          countSnapshot(*snapshot, report);
          entries += snapshot->entries.size();
          batch.push_back(std::move(snapshot));
          const bool isFull = batch.size() >= kBatchedFolders || entries >= kBatchedEntries;
          return !isFull || flush();
        });
    if (!goesOn) return failure;
  }
  if (!batch.empty() && !flush()) return failure;
  return nullptr;
}

NSErrorRef ScanSession::runAndFinish(const Work& work, TreeWalker& walker, ScanReport& report) {
  bool isFinished = false;
  NSErrorRef error = run([&](WriteTransaction& transaction) {
    work(transaction);
    // New folders may hold what is missing here, so those are read before anything is decided.
    if (reconciler_.hasNewFolders()) return;
    reconciler_.finish(transaction);
    isFinished = !reconciler_.hasNewFolders();
  });
  if (!error && !isFinished) {
    error = readNewFolders(walker, report);
    if (!error) error = finish();
  }
  report.changes = changes_;
  return error;
}

NSErrorRef ScanSession::compareAndFinish(const Snapshots& snapshots, TreeWalker& walker,
                                         ScanReport& report) {
  return runAndFinish(
      [&](WriteTransaction& transaction) {
        for (const auto& snapshot : snapshots) reconciler_.compareFolder(transaction, *snapshot);
      },
      walker, report);
}

NSErrorRef ScanSession::compareNameAndFinish(std::uint64_t folder, const std::string& name,
                                             const FolderSnapshot& snapshot, TreeWalker& walker,
                                             ScanReport& report) {
  return runAndFinish(
      [&](WriteTransaction& transaction) {
        reconciler_.compareName(transaction, folder, name, snapshot);
      },
      walker, report);
}

NSErrorRef ScanSession::compareNamesAndFinish(const std::vector<NamesInFolder>& names,
                                              const Snapshots& folders, TreeWalker& walker,
                                              ScanReport& report) {
  return runAndFinish(
      [&](WriteTransaction& transaction) {
        for (const auto& each : names) {
          reconciler_.compareNames(transaction, each.folder, each.names, *each.snapshot);
        }
        for (const auto& snapshot : folders) reconciler_.compareFolder(transaction, *snapshot);
      },
      walker, report);
}

std::shared_ptr<const FileDescriptor> openFolderOfItem(const ItemStore& store,
                                                       std::uint64_t folder) {
  const auto path = store.physicalPath(folder);
  const auto place = path ? store.layout().placeOf(*path) : std::nullopt;
  if (!place) {
    errno = ENOENT;
    return nullptr;
  }
  const auto base = openFolder(place->path);
  return base ? openFolderBelow(base->get(), place->relative) : nullptr;
}

std::shared_ptr<const FileDescriptor> FolderScan::open(std::uint64_t& folder) {
  for (;;) {
    auto opened = openFolderOfItem(store_, folder);
    if (opened || folder == kRootID || folder == kTrashID) return opened;
    // It has gone or moved: what is above it tells.
    const auto row = store_.itemByID(folder);
    if (!row || row->parent == kNoParent || row->isContainerFolder()) return nullptr;
    folder = row->parent;
  }
}

NSErrorRef FolderScan::run(const std::vector<std::uint64_t>& folders, Depth depth,
                           ScanReport& report) {
  ScanSession::Snapshots snapshots;
  std::unordered_set<std::uint64_t> seen;
  if (depth == Depth::Everything) session_.setComparesEverything();
  for (std::uint64_t folder : folders) {
    auto opened = open(folder);
    if (!opened || !seen.insert(folder).second) continue;
    const std::uint64_t visit = TreeWalker::nextVisit();
    session_.setFolderOfVisit(visit, folder);
    if (depth == Depth::Everything) {
      if (NSErrorRef error = readSubtree(std::move(opened), visit, report)) return error;
      continue;
    }
    snapshots.push_back(walker_.read(std::move(opened), visit));
    countSnapshot(*snapshots.back(), report);
  }
  return session_.compareAndFinish(snapshots, walker_, report);
}

/// Null when there is nothing to do for it now. `folder` is then what was opened: the dirty one, or
/// one above it.
std::shared_ptr<const FileDescriptor> FolderScan::openDirty(const DirtyFolder& dirty,
                                                            std::uint64_t& folder,
                                                            std::vector<DirtyFolder>& notFound) {
  // Without a row it is gone, or was identified in a moment whose commit is still to come.
  const auto row = store_.itemByID(folder);
  if (dirty.attempts >= Scanner::kMaximumAttempts) return row ? open(folder) : nullptr;
  auto opened = row ? openFolderOfItem(store_, folder) : nullptr;
  FolderEntry self;
  const bool isIt = opened && lookAtEntry(opened->get(), "", self) && self.inode == row->inode;
  if (isIt) return opened;
  notFound.push_back(dirty);
  return nullptr;
}

NSErrorRef FolderScan::run(const std::vector<DirtyFolder>& folders,
                           std::vector<DirtyFolder>& notFound, std::vector<std::uint64_t>& deep,
                           ScanReport& report) {
  std::vector<ScanSession::NamesInFolder> names;
  std::unordered_map<std::uint64_t, std::shared_ptr<const FileDescriptor>> whole;
  for (const DirtyFolder& dirty : folders) {
    std::uint64_t folder = dirty.id;
    auto opened = openDirty(dirty, folder, notFound);
    if (!opened) continue;
    if (dirty.isDeep && folder == dirty.id) {
      deep.push_back(folder);
      continue;
    }
    if (dirty.isWhole || folder != dirty.id) {
      whole.emplace(folder, std::move(opened));
      continue;
    }
    ScanSession::NamesInFolder some{.folder = folder, .names = dirty.names, .snapshot = nullptr};
    some.snapshot = readNames(std::move(opened), some.names, report);
    if (some.snapshot) names.push_back(std::move(some));
  }
  ScanSession::Snapshots snapshots;
  for (auto& [folder, opened] : whole) {
    const std::uint64_t visit = TreeWalker::nextVisit();
    session_.setFolderOfVisit(visit, folder);
    snapshots.push_back(walker_.read(std::move(opened), visit));
    countSnapshot(*snapshots.back(), report);
  }
  if (names.empty() && snapshots.empty()) return nullptr;
  return session_.compareNamesAndFinish(names, snapshots, walker_, report);
}

/// Takes out the names of which nothing can be said. Null when the folder itself is gone.
std::unique_ptr<FolderSnapshot> FolderScan::readNames(std::shared_ptr<const FileDescriptor> folder,
                                                      std::vector<std::string>& names,
                                                      ScanReport& report) {
  auto snapshot = std::make_unique<FolderSnapshot>();
  snapshot->rankBefore = store_.database()->currentRank();
  snapshot->isReadable = true;
  if (!lookAtEntry(folder->get(), "", snapshot->self)) return nullptr;
  std::erase_if(names, [&](const std::string& name) {
    if (isExcludedName(name)) return true;
    FolderEntry entry;
    if (!lookAtEntry(folder->get(), name.c_str(), entry)) {
      return errno != ENOENT && errno != EINVAL;
    }
    entry.nameOffset = static_cast<std::uint32_t>(snapshot->names.size());
    entry.nameLength = static_cast<std::uint16_t>(name.size());
    if (entry.type == EntryType::Folder) entry.visit = TreeWalker::nextVisit();
    snapshot->names += name;
    snapshot->entries.push_back(entry);
    return false;
  });
  snapshot->folder = std::move(folder);
  report.entries += names.size();
  return snapshot;
}

NSErrorRef FolderScan::readSubtree(std::shared_ptr<const FileDescriptor> folder,
                                   std::uint64_t visit, ScanReport& report) {
  NSErrorRef error;
  walker_.walk(std::move(folder), visit, [&](std::unique_ptr<FolderSnapshot> snapshot) {
    countSnapshot(*snapshot, report);
    ScanSession::Snapshots one;
    one.push_back(std::move(snapshot));
    error = session_.compare(one);
    return !error;
  });
  return error;
}

}  // namespace yomber
