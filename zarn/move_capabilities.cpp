#include "zarn/move_capabilities.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <optional>
#include <vector>

#include "platform/ostrell/constants.h"
#include "platform/ostrell/move_capability.h"
#include "zarn/daemon_errors.h"
#include "zarn/located_item.h"
#include "zarn/share_doors.h"

namespace yomber {
namespace {

bool isFixed(const ItemRow& row) { return row.parent == kNoParent || row.isContainerFolder(); }

std::string_view folderOf(std::string_view path) {
  return path.substr(0, std::min(path.size(), path.rfind('/')));
}

bool exists(std::string_view path) {
  struct stat status{};
  return lstat(std::string(path).c_str(), &status) == 0;
}

}  // namespace

std::uint32_t MoveCapabilities::capability(std::string_view source, std::string_view destination,
                                           NSErrorRef* error) const {
  Verdict verdict = judge(source, destination);
  if (verdict.error) storeError(error, std::move(verdict.error));
  return verdict.capability;
}

MoveCapabilities::Verdict MoveCapabilities::judge(std::string_view source,
                                                  std::string_view destination) const {
  const TreeLayout& layout = store_->layout();
  const auto place = layout.placeOf(destination);
  const bool isTaken = layout.isPrivate(destination) || (place && place->relative.empty());
  if (layout.isExcluded(source)) {
    if (!exists(source)) return {0, noSuchLocationError(std::string(source))};
    if (!isTaken) return {QSMoveCapabilityNeverSynced, nullptr};
  }
  NSErrorRef error;
  const auto row = layout.isExcluded(source) ? std::optional(ItemRow())
                                             : findItemOnDisk(*store_, *scanner_, source, &error);
  if (!row) return {0, std::move(error)};
  if (!layout.isExcluded(source) && isFixed(*row)) {
    return {
        QSMoveCapabilityRefusedFixedItem,
        refusedError(EPERM, source, "this has its fixed place in the drive; move what is in it")};
  }
  if (isTaken) {
    return {QSMoveCapabilityRefusedLocation,
            refusedError(EPERM, destination,
                         "this is the drive's own place; choose a folder among its items")};
  }
  if (!layout.isExcluded(source)) {
    if (NSErrorRef refused = refusedByShare(*store_, *row, source))
      return {QSMoveCapabilityRefusedFixedItem, std::move(refused)};
  }
  const bool isLeaving = !place || layout.isExcluded(destination);
  if (isLeaving) return {QSMoveCapabilityOutOfSync, nullptr};
  return judgeIntoFolder(*row, source, destination);
}

MoveCapabilities::Verdict MoveCapabilities::judgeIntoFolder(const ItemRow& row,
                                                            std::string_view source,
                                                            std::string_view destination) const {
  NSErrorRef error;
  const auto folder = findItemOnDisk(*store_, *scanner_, folderOf(destination), &error);
  if (!folder) return {0, std::move(error)};
  if (!folder->isFolder()) {
    return {QSMoveCapabilityRefusedLocation,
            refusedError(ENOTDIR, destination, "nothing can be moved into what is no folder")};
  }
  if (NSErrorRef refused = refusedInFolder(*store_, *folder, destination))
    return {QSMoveCapabilityRefusedLocation, std::move(refused)};
  const auto above = store_->ancestors(folder->id, &error);
  const bool isInto =
      folder->id == row.id || std::find(above.begin(), above.end(), row.id) != above.end();
  if (isInto) {
    return {QSMoveCapabilityRefusedIntoItself,
            refusedError(EINVAL, destination,
                         "a folder cannot be moved into itself; choose one outside of it")};
  }
  return {betweenFolders(row, *folder, source), nullptr};
}

std::uint32_t MoveCapabilities::betweenFolders(const ItemRow& row, const ItemRow& folder,
                                               std::string_view source) const {
  if (folder.isTrashed() || folder.id == kTrashID) {
    return row.isTrashed() ? QSMoveCapabilityWithinContainer : QSMoveCapabilityToTrash;
  }
  const Zone to = zoneIn(folder.id);
  if (row.isTrashed()) {
    if (to.sharedFolder != 0) return QSMoveCapabilityIntoSharedZone;
    return containerOfTrashed(source) == to.containerID ? QSMoveCapabilityFromTrash
                                                        : QSMoveCapabilityFromTrashAcrossContainers;
  }
  const Zone from = zoneIn(row.parent);
  if (from == to) {
    return from.sharedFolder != 0 ? QSMoveCapabilityWithinSharedZone
                                  : QSMoveCapabilityWithinContainer;
  }
  if (from.sharedFolder != 0 && to.sharedFolder != 0) return QSMoveCapabilityAcrossSharedZones;
  if (from.sharedFolder != 0) return QSMoveCapabilityOutOfSharedZone;
  if (to.sharedFolder != 0) return QSMoveCapabilityIntoSharedZone;
  return QSMoveCapabilityAcrossContainers;
}

MoveCapabilities::Zone MoveCapabilities::zoneIn(std::uint64_t folder) const {
  Zone zone{.containerID = QSUbiquitousDefaultContainerID};
  std::vector<std::uint64_t> way{folder};
  for (const std::uint64_t above : store_->ancestors(folder)) way.push_back(above);
  for (const std::uint64_t id : way) {
    const auto row = id == kNoParent ? std::nullopt : store_->itemByID(id);
    if (!row) continue;
    const bool isShared = (row->flags & row_flag::kShared) != 0;
    if (isShared && zone.sharedFolder == 0) zone.sharedFolder = id;
    if (row->isContainerFolder()) {
      zone.containerID = row->extra->containerID;
      break;
    }
  }
  return zone;
}

/// What others put into the trash without a word belongs to the drive's own container.
std::string MoveCapabilities::containerOfTrashed(std::string_view path) const {
  const auto origin = trash_->putBackLocation(path, nullptr);
  const auto place = origin ? store_->layout().placeOf(*origin) : std::nullopt;
  return place ? place->containerID : QSUbiquitousDefaultContainerID;
}

}  // namespace yomber
