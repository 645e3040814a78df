#include "zarn/scan_session.h"

#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <unordered_set>

#include "platform/foundation/log.h"
#include "zarn/connection.h"
#include "zarn/row_queries.h"

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
