#include "zarn/scanner.h"

#include <fcntl.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <functional>
#include <thread>

#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "zarn/connection.h"
#include "zarn/first_scan.h"
#include "zarn/location_scan.h"
#include "zarn/reconciler.h"
#include "zarn/row_queries.h"
#include "zarn/scan_session.h"
#include "zarn/snapshot_queue.h"
#include "zarn/stamper.h"
#include "zarn/tree_walker.h"

namespace yomber {
namespace {

/// How often what others keep changing is looked at again.
constexpr int kMaximumRounds = 8;
constexpr std::size_t kWaitingFolders = 64;
constexpr std::size_t kWaitingEntries = 50'000;

/// Walks places on a thread of its own; the snapshots come out of the queue.
template <typename T>
class WalkingThread {
 public:
  using Prepare = std::function<T(std::unique_ptr<FolderSnapshot>)>;
  WalkingThread(TreeWalker::Options options, std::vector<ScanPlace> places, Prepare prepare)
      : queue_(kWaitingFolders, kWaitingEntries),
        thread_([this, walker = TreeWalker(std::move(options)), places = std::move(places),
                 prepare = std::move(prepare)]() mutable {
          for (ScanPlace& place : places) {
            const bool goesOn =
                walker.walk(std::move(place.folder), place.visit,
                            [&](std::unique_ptr<FolderSnapshot> snapshot) {
                              const std::size_t entries = snapshot->entries.size();
                              return queue_.push(prepare(std::move(snapshot)), entries);
                            });
            if (!goesOn) break;
          }
          queue_.finish();
        }) {}
  ~WalkingThread() {
    queue_.abandon();
    thread_.join();
  }
  WalkingThread(const WalkingThread&) = delete;
  WalkingThread& operator=(const WalkingThread&) = delete;

  std::vector<T> take() { return queue_.take(); }

 private:
  SnapshotQueue<T> queue_;
  std::thread thread_;
};

/// The row of the root or the trash, for an empty database.
ItemRow rowOfPlace(const ScanPlace& place) {
  ItemRow row;
  row.id = place.id;
  row.parent = kNoParent;
  row.kind = ItemKind::Folder;
  row.flags = row_flag::kDownloaded;
  if (place.id == kTrashID) row.flags |= row_flag::kTrashed;
  // Siblings need different names; nobody is shown these.
  row.name = place.id == kTrashID ? ".Trash" : "";
  FolderEntry entry;
  if (!lookAtEntry(place.folder->get(), "", entry)) return row;
  row.mode = entry.mode;
  row.inode = entry.inode;
  row.mtime = entry.mtime;
  row.btime = entry.btime;
  row.ctime = entry.changeTimeToRemember();
  return row;
}

}  // namespace

class Scanner::State {
 public:
  State(std::shared_ptr<ItemStore> itemStore, std::weak_ptr<FolderVisitor> folderVisitor)
      : store(std::move(itemStore)),
        visitor(std::move(folderVisitor)),
        links(store->layout()),
        stamper(store) {}

  [[nodiscard]] TreeWalker::Options walkerOptions(bool readsAttributes) const {
    return {visitor, [database = store->database()] { return database->currentRank(); },
            readsAttributes};
  }
  NSErrorRef findPlaces(std::vector<ScanPlace>& places) const;
  NSErrorRef firstScan(ScanReport& report);
  NSErrorRef reconcile(ScanReport& report);
  NSErrorRef scanFolders(const std::vector<std::uint64_t>& folders, FolderScan::Depth depth,
                         ScanReport& report);
  NSErrorRef scanDirty(const std::vector<DirtyFolder>& folders, std::vector<DirtyFolder>& notFound,
                       ScanReport& report);
  NSErrorRef tellMissed(const ScanSession& session) const;
  /// Looks again at what others have changed during a scan.
  NSErrorRef settle(std::vector<DirtyFolder> conflicts);
  [[nodiscard]] FolderScan folderScan() const {
    return {*store, links, visitor, walkerOptions(false)};
  }

  const std::shared_ptr<ItemStore> store;
  const std::weak_ptr<FolderVisitor> visitor;
  const LinkResolver links;
  Stamper stamper;
  std::atomic<bool> hasScannedAll{false};
  Mutex wholeScan;  ///< held by a scan of the whole tree: two first scans would issue two ids each
};

NSErrorRef Scanner::State::findPlaces(std::vector<ScanPlace>& places) const {
  const TreeLayout& layout = store->layout();
  const auto addPlace = [&](const std::string& path, ItemRow row) -> NSErrorRef {
    auto folder = openFolder(path);
    if (!folder) return NSError::errorWithErrno(errno, path);
    const std::uint64_t id = row.id;
    places.push_back({id, TreeWalker::nextVisit(), std::move(folder), std::move(row)});
    return nullptr;
  };
  for (const auto& [path, id] :
       {std::pair(layout.root(), kRootID), std::pair(layout.trashFiles(), kTrashID)}) {
    ItemRow row;
    row.id = id;
    if (NSErrorRef error = addPlace(path, std::move(row))) return error;
  }
  std::vector<ItemRow> containers;
  NSErrorRef failure = store->database()->read(
      [&](Connection& connection) { containers = findContainerFolders(connection); });
  if (failure) return failure;
  for (ItemRow& row : containers) {
    const std::string path = layout.documents(row.extra->containerID);
    if (NSErrorRef error = addPlace(path, std::move(row))) {
      log_error(defaultLog(), "[ERROR] a container's folder cannot be read: %@", error);
    }
  }
  return nullptr;
}

NSErrorRef Scanner::State::firstScan(ScanReport& report) {
  std::vector<ScanPlace> places;
  if (NSErrorRef error = findPlaces(places)) return error;
  return store->database()->rebuild([&](BulkLoad& load) -> NSErrorRef {
    FirstScan scan(load, links, visitor);
    for (ScanPlace& place : places) {
      const bool isContainer = place.row.isContainerFolder();
      scan.addPlace(isContainer ? std::move(place.row) : rowOfPlace(place), place.visit);
    }
    WalkingThread<std::unique_ptr<SortedSnapshot>> walk(
        walkerOptions(true), places, [](std::unique_ptr<FolderSnapshot> snapshot) {
          return std::make_unique<SortedSnapshot>(std::move(snapshot));
        });
    for (auto taken = walk.take(); !taken.empty(); taken = walk.take()) {
      for (const auto& sorted : taken) {
        countSnapshot(*sorted->snapshot, report);
        scan.addFolder(*sorted);
      }
    }
    report.changes = load.count();
    return nullptr;
  });
}

NSErrorRef Scanner::State::reconcile(ScanReport& report) {
  std::vector<ScanPlace> places;
  if (NSErrorRef error = findPlaces(places)) return error;
  ScanSession session(store->database(), links, visitor);
  session.setComparesEverything();
  for (const ScanPlace& place : places) session.setFolderOfVisit(place.visit, place.id);
  const std::uint64_t rankBefore = store->database()->currentRank();
  {
    WalkingThread<std::unique_ptr<FolderSnapshot>> walk(
        walkerOptions(false), places,
        [](std::unique_ptr<FolderSnapshot> snapshot) { return snapshot; });
    for (auto taken = walk.take(); !taken.empty(); taken = walk.take()) {
      for (const auto& snapshot : taken) countSnapshot(*snapshot, report);
      if (NSErrorRef error = session.compare(taken)) return error;
    }
  }
  NSErrorRef error = session.finish();
  report.changes = session.changes();
  std::vector<DirtyFolder> conflicts = session.takeConflicts();
  const bool isUnchanged = conflicts.empty() && store->database()->currentRank() == rankBefore;
  // Where nothing has changed meanwhile, nothing was missed: no need to look at all rows.
  if (error || isUnchanged) return error;
  error = settle(std::move(conflicts));
  return error ? error : tellMissed(session);
}

NSErrorRef Scanner::State::tellMissed(const ScanSession& session) const {
  const auto told = visitor.lock();
  std::vector<std::uint64_t> folders;
  NSErrorRef error = told ? session.findMissed(folders) : nullptr;
  for (const std::uint64_t folder : folders) told->didNotReadFolder(folder);
  return error;
}

NSErrorRef Scanner::State::settle(std::vector<DirtyFolder> conflicts) {
  for (int round = 0; round < kMaximumRounds && !conflicts.empty(); ++round) {
    FolderScan scan = folderScan();
    ScanReport report;
    // What has moved on, or is to be read as a whole, is told of by whoever moved it.
    std::vector<DirtyFolder> notFound;
    std::vector<std::uint64_t> deep;
    if (NSErrorRef error = scan.run(conflicts, notFound, deep, report)) return error;
    conflicts = scan.takeConflicts();
  }
  return nullptr;
}

NSErrorRef Scanner::State::scanFolders(const std::vector<std::uint64_t>& folders,
                                       FolderScan::Depth depth, ScanReport& report) {
  FolderScan scan = folderScan();
  const NSErrorRef error = scan.run(folders, depth, report);
  return error ? error : settle(scan.takeConflicts());
}

NSErrorRef Scanner::State::scanDirty(const std::vector<DirtyFolder>& folders,
                                     std::vector<DirtyFolder>& notFound, ScanReport& report) {
  std::vector<std::uint64_t> deep;
  FolderScan scan = folderScan();
  if (NSErrorRef error = scan.run(folders, notFound, deep, report)) return error;
  if (NSErrorRef error = settle(scan.takeConflicts())) return error;
  for (const std::uint64_t folder : deep) {
    const auto depth = FolderScan::Depth::Everything;
    if (NSErrorRef error = scanFolders({folder}, depth, report)) return error;
  }
  return nullptr;
}

Scanner::Scanner(std::shared_ptr<ItemStore> store, std::weak_ptr<FolderVisitor> visitor)
    : state_(std::make_unique<State>(std::move(store), std::move(visitor))) {}

Scanner::~Scanner() = default;

NSErrorRef Scanner::scanAll(ScanReport* report) {
  ScanReport own;
  ScanReport& out = report != nullptr ? *report : own;
  out = {};
  LockGuard guard(state_->wholeScan);
  try {
    const bool isFirst = state_->store->database()->needsFirstScan();
    NSErrorRef error = isFirst ? state_->firstScan(out) : state_->reconcile(out);
    if (!error) state_->hasScannedAll = true;
    return error;
  } catch (const std::exception& exception) {
    return NSError::errorWithDomain(kDatabaseErrorDomain, kDatabaseFailure,
                                    {{NSLocalizedDescriptionKey, std::string(exception.what())}});
  }
}

bool Scanner::hasScannedAll() const { return state_->hasScannedAll; }

NSErrorRef Scanner::scanFolders(const std::vector<std::uint64_t>& folders, ScanReport* report) {
  ScanReport own;
  ScanReport& out = report != nullptr ? *report : own;
  out = {};
  return state_->scanFolders(folders, FolderScan::Depth::NewOnly, out);
}

NSErrorRef Scanner::scanDirty(const std::vector<DirtyFolder>& folders,
                              std::vector<DirtyFolder>& notFound, ScanReport* report) {
  ScanReport own;
  ScanReport& out = report != nullptr ? *report : own;
  out = {};
  std::vector<DirtyFolder> missing;
  notFound.clear();
  if (NSErrorRef error = state_->scanDirty(folders, missing, out)) return error;
  if (missing.empty()) return nullptr;
  // The others may have told where they are now.
  if (NSErrorRef error = state_->scanDirty(missing, notFound, out)) return error;
  for (DirtyFolder& folder : notFound) ++folder.attempts;
  return nullptr;
}

NSErrorRef Scanner::scanSubtree(std::uint64_t folder, ScanReport* report) {
  ScanReport own;
  ScanReport& out = report != nullptr ? *report : own;
  out = {};
  return state_->scanFolders({folder}, FolderScan::Depth::Everything, out);
}

std::optional<ItemRow> Scanner::scanLocation(std::string_view path, NSErrorRef* error) {
  LocationScan scan(*state_->store, state_->links, state_->visitor, state_->walkerOptions(false));
  auto row = scan.run(path, error);
  if (NSErrorRef failure = state_->settle(scan.takeConflicts())) {
    storeError(error, failure);
    return std::nullopt;
  }
  return row;
}

NSErrorRef Scanner::stampSome(std::uint32_t limit, std::uint32_t& count) {
  return state_->stamper.stampSome(limit, count);
}

}  // namespace yomber
