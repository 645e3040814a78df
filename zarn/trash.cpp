#include "zarn/trash.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <utility>

#include "platform/fileprovider/item_kind_name.h"
#include "platform/foundation/date.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "zarn/daemon_errors.h"
#include "zarn/located_item.h"
#include "zarn/share_doors.h"
#include "zarn/staged_removal.h"
#include "zarn/tree_walker.h"

namespace yomber {
namespace {

constexpr std::string_view kStaging = "emptied-";

/// Why an item cannot be trashed; nil when it can.
NSErrorRef refusal(const ItemRow& row, std::string_view path) {
  if (row.id == kRootID) {
    return refusedError(EPERM, path,
                        "the drive itself cannot be moved to the trash; choose items in it");
  }
  if (row.id == kTrashID) {
    return refusedError(EINVAL, path,
                        "the trash cannot be moved to the trash; empty it to remove what it holds");
  }
  if (row.isContainerFolder()) {
    return refusedError(EPERM, path,
                        "an application's folder cannot be moved to the trash; choose items in it, "
                        "or remove the application");
  }
  if (row.isTrashed()) {
    return refusedError(EINVAL, path,
                        "this is in the trash already; delete it there, or put it back");
  }
  return nullptr;
}

NSErrorRef couldNotTrash(int number, std::string_view path) {
  const auto cause = NSError::errorWithErrno(number, std::string(path));
  return refusedError(
      number, path,
      "could not be moved to the trash: " + cause->localizedDescription() + "; it is where it was");
}

/// Removes the open folder's content and the folder, which is at `path`.
RemovedItems removeStaging(const std::string& path) {
  const auto folder = openFolder(path);
  if (!folder) return {.count = 0, .failure = errno};
  const RemovedItems removed = removeStaged(folder->get());
  if (removed.failure == 0) (void)rmdir(path.c_str());
  return removed;
}

}  // namespace

std::shared_ptr<Trash> Trash::create(std::shared_ptr<ItemStore> store,
                                     std::shared_ptr<Scanner> scanner) {
  return std::shared_ptr<Trash>(new Trash(std::move(store), std::move(scanner)));
}

Trash::Trash(std::shared_ptr<ItemStore> store, std::shared_ptr<Scanner> scanner)
    : store_(std::move(store)),
      scanner_(std::move(scanner)),
      folder_(std::make_shared<TrashFolder>(store_->layout())),
      queue_(SerialQueue::create("trash-information")) {}

void Trash::recover() {
  folder_->dropOrphans();
  const std::string& privateArea = store_->layout().privateArea();
  DIR* const stream = opendir(privateArea.c_str());
  if (stream == nullptr) return;
  while (const dirent* const entry = readdir(stream)) {
    const std::string name = entry->d_name;
    if (!name.starts_with(kStaging)) continue;
    queue_->async([path = privateArea + "/" + name] { (void)removeStaging(path); });
  }
  closedir(stream);
}

// --- Into the trash.

/// What is to be kept about an item that is about to be trashed.
std::optional<TrashInfo> Trash::describe(const ItemRow& row, NSErrorRef* error) const {
  const TreeLayout& layout = store_->layout();
  const auto path = store_->logicalPath(row.id, error);
  const auto place = path ? layout.placeOf(*path) : std::nullopt;
  if (!place) return std::nullopt;
  TrashInfo info;
  info.path = place->relative;
  if (place->containerID != QSUbiquitousDefaultContainerID) {
    const auto container = store_->itemForContainer(place->containerID, error);
    if (!container) return std::nullopt;
    info.path = container->name + "/" + info.path;
  }
  info.deletionDate = trashDeletionDate(NSDate::now());
  info.containerID = place->containerID;
  info.pathInContainer = place->relative;
  info.kind = itemKindName(row.kind);
  return info;
}

std::optional<std::string> Trash::trash(std::string_view path, const IsCancelled& isCancelled,
                                        NSErrorRef* error) {
  NSErrorRef failure = noSuchLocationError(std::string(path));
  const auto item = locateItem(*store_, *scanner_, path, &failure);
  if (item) failure = refusal(item->row, path);
  if (item && !failure) failure = refusedByShare(*store_, item->row, path);
  std::optional<TrashInfo> info;
  if (item && !failure) {
    failure = noSuchLocationError(std::string(path));  // it may go meanwhile
    info = describe(item->row, &failure);
  }
  if (info && isCancelled()) {
    failure = cancelledError(path);
    info.reset();
  }
  if (!info) {
    storeError(error, failure);
    return std::nullopt;
  }
  const auto taken = folder_->take(item->folder->get(), item->name, item->row.name, *info);
  if (taken.failure != 0) {
    const bool isGone = taken.failure == ENOENT;
    storeError(error, isGone ? noSuchLocationError(std::string(path))
                             : couldNotTrash(taken.failure, path));
    return std::nullopt;
  }
  static FaultPoint afterMove("zarn.trash.after-move");
  (void)afterMove.hit();
  scanMove(item->row.parent, item->name, taken.name);
  const std::string location = store_->layout().trashFiles() + "/" + taken.name;
  const auto row = scanner_->scanLocation(location);
  const auto logical = row ? store_->logicalPath(row->id) : std::nullopt;
  return logical ? logical : location;
}

/// Both ends at once, so that the item is seen to move.
void Trash::scanMove(std::uint64_t folder, const std::string& before, const std::string& after) {
  std::vector<DirtyFolder> dirty(2);
  dirty[0].id = folder;
  dirty[0].names = {before};
  dirty[1].id = kTrashID;
  dirty[1].names = {after};
  std::vector<DirtyFolder> notFound;
  // What is wrong with the disk or the database is met again, and told, by whoever looks the item
  // up; the move itself is done.
  if (const auto error = scanner_->scanDirty(dirty, notFound)) {
    log_error(defaultLog(), "[ERROR] the trash cannot be scanned: %@", error);
  }
}

// --- Back.

/// Nothing for what lies outside the tree, which is what other programs' paths may say.
std::optional<std::string> Trash::locationOf(const TrashInfo& info) const {
  const TreeLayout& layout = store_->layout();
  std::string location;
  std::string containerID = info.containerID;
  if (!containerID.empty()) {
    location = layout.documents(containerID) + "/" + info.pathInContainer;
  } else if (info.path.starts_with('/')) {
    location = info.path;
  } else {
    // As the mount shows it: an application's folder is there under its display name.
    const std::size_t slash = info.path.find('/');
    const auto first = store_->itemByName(kRootID, info.path.substr(0, slash));
    const bool isInContainer = first && first->isContainerFolder() && slash != std::string::npos;
    location = isInContainer ? layout.documents(first->extra->containerID) + info.path.substr(slash)
                             : layout.root() + "/" + info.path;
  }
  const auto place = layout.placeOf(location);
  const bool isInside = place && place->kind == TreeLayout::Place::Kind::Documents &&
                        !place->relative.empty() &&
                        (containerID.empty() || place->containerID == containerID);
  return isInside ? std::optional(location) : std::nullopt;
}

std::optional<std::string> Trash::putBackLocation(std::string_view path, NSErrorRef* error) const {
  const TreeLayout& layout = store_->layout();
  const auto place = layout.placeOf(path);
  if (!place) {
    (void)findItemOnDisk(*store_, *scanner_, path, error);  // says why
    return std::nullopt;
  }
  if (place->kind != TreeLayout::Place::Kind::Trash || place->relative.empty()) {
    storeError(error, refusedError(EINVAL, path, "this is not in the trash: nothing to put back"));
    return std::nullopt;
  }
  NSErrorRef failure;
  const auto row = findItemOnDisk(*store_, *scanner_, path, &failure);
  const auto physical = row ? store_->physicalPath(row->id, &failure) : std::nullopt;
  const auto below = physical ? layout.placeOf(*physical) : std::nullopt;
  if (!below) {
    storeError(error, failure ? failure : noSuchLocationError(std::string(path)));
    return std::nullopt;
  }
  // What lies in a folder that was trashed comes from below that folder.
  const std::size_t slash = below->relative.find('/');
  const auto info = folder_->infoOf(below->relative.substr(0, slash));
  auto location = info ? locationOf(*info) : std::nullopt;
  if (!location) {
    storeError(error,
               NSError::errorWithDomain(
                   NSCocoaErrorDomain, NSFileNoSuchFileError,
                   {{NSFilePathErrorKey, std::string(path)},
                    {NSLocalizedDescriptionKey,
                     std::string("the trash does not know where this came from; say where it is "
                                 "to go")}}));
    return std::nullopt;
  }
  if (slash != std::string::npos) location->append(below->relative.substr(slash));
  return location;
}

// --- Out.

std::uint64_t Trash::empty(const IsCancelled& isCancelled, NSErrorRef* error) {
  const TreeLayout& layout = store_->layout();
  std::string staging = layout.privateArea() + "/" + std::string(kStaging) + "XXXXXX";
  const bool isMade = layout.createFolders() == 0 && mkdtemp(staging.data()) != nullptr;
  const auto folder = isMade ? openFolder(staging) : nullptr;
  if (!folder) {
    storeError(error, NSError::errorWithErrno(errno, layout.privateArea()));
    return 0;
  }
  bool wasCancelled = false;
  const auto emptied =
      folder_->moveAllTo(folder->get(), [&] { return !(wasCancelled = isCancelled()); });
  static FaultPoint afterMove("zarn.trash.after-emptying");
  (void)afterMove.hit();
  // From here on they are gone for everybody.
  const NSErrorRef scanFailure = scanner_->scanFolders({kTrashID});
  for (const std::string& name : emptied.names) folder_->didLeave(name);
  const RemovedItems removed = removeStaging(staging);
  const int failure = emptied.failure != 0 ? emptied.failure : removed.failure;
  if (failure != 0) {
    storeError(error, refusedError(failure, layout.trashFiles(),
                                   "something in the trash could not be removed: " +
                                       NSError::errorWithErrno(failure)->localizedDescription()));
  } else if (scanFailure) {
    storeError(error, scanFailure);
  } else if (wasCancelled) {
    storeError(error, cancelledError(layout.trashFiles()));
  }
  return removed.count;
}

void Trash::committed(const std::vector<ItemChange>& changes) {
  std::vector<std::pair<std::string, std::string>> moved;  // an empty new name: left
  for (const ItemChange& change : changes) {
    if (change.isNew || change.parentBefore != kTrashID) continue;
    const std::string& name = change.row.nameOnDisk();
    if (change.isDead()) {
      moved.emplace_back(name, std::string());
    } else if (change.row.parent != kTrashID) {
      moved.emplace_back(change.nameOnDiskBefore(), std::string());
    } else if (change.nameOnDiskBefore() != name) {
      moved.emplace_back(change.nameOnDiskBefore(), name);
    }
  }
  if (moved.empty()) return;
  queue_->async([folder = folder_, moved = std::move(moved)] {
    for (const auto& [before, after] : moved) {
      if (after.empty()) {
        folder->didLeave(before);
      } else {
        folder->didRename(before, after);
      }
    }
  });
}

}  // namespace yomber
