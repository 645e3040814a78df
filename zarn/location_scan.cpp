#include "zarn/location_scan.h"

#include <fcntl.h>

#include <cerrno>

#include "platform/ostrell/constants.h"
#include "zarn/connection.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

constexpr int kMaximumAttempts = 8;

NSErrorRef noSuchItem(std::string_view path) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError,
                                  {{NSFilePathErrorKey, std::string(path)}});
}

/// Why a folder could not be opened: mostly it is not there, or is none.
NSErrorRef whyNotOpened(int number, std::string_view path) {
  const bool isGone = number == ENOENT || number == ENOTDIR || number == ELOOP;
  return isGone ? noSuchItem(path) : NSError::errorWithErrno(number, std::string(path));
}

/// The name on this disk of what the drive calls `name`.
std::string diskNameOf(const ItemStore& store, std::uint64_t folder, const std::string& name) {
  const auto row = store.itemByName(folder, name);
  return row && !row->isContainerFolder() ? row->nameOnDisk() : name;
}

void addOnlyEntry(FolderSnapshot& snapshot, const std::string& name, FolderEntry entry) {
  snapshot.names = name;
  entry.nameLength = static_cast<std::uint16_t>(name.size());
  if (entry.type == EntryType::Folder) entry.visit = TreeWalker::nextVisit();
  snapshot.entries.push_back(entry);
}

std::optional<ItemRow> rowOnDisk(const ItemStore& store, std::uint64_t folder,
                                 const std::string& diskName, NSErrorRef& error) {
  std::optional<ItemRow> row;
  error = store.database()->read(
      [&](Connection& connection) { row = findByDiskName(connection, folder, diskName); });
  return row;
}

}  // namespace

std::optional<ItemRow> LocationScan::run(std::string_view path, NSErrorRef* error) {
  NSErrorRef failure = noSuchItem(path);
  const TreeLayout& layout = store_.layout();
  const auto place = layout.placeOf(path);
  if (!place || layout.isExcluded(path)) {
    storeError(error, failure);
    return std::nullopt;
  }
  auto row = place->kind == TreeLayout::Place::Kind::Trash
                 ? store_.itemByID(kTrashID, &failure)
                 : store_.itemForContainer(place->containerID, &failure);
  auto opened = openFolder(place->path);
  std::string_view rest = place->relative;
  while (row && !rest.empty()) {
    const std::size_t slash = rest.find('/');
    const std::string name(rest.substr(0, slash));
    rest.remove_prefix(slash == std::string_view::npos ? rest.size() : slash + 1);
    const std::uint64_t folder = row->id;
    failure = opened ? noSuchItem(path) : whyNotOpened(errno, path);
    row.reset();
    if (!opened) break;
    row = scanName(folder, opened, name, failure);
    if (row && !rest.empty()) opened = openFolderBelow(opened->get(), row->nameOnDisk());
  }
  if (!row) storeError(error, failure);
  return row;
}

std::optional<ItemRow> LocationScan::scanName(std::uint64_t folder,
                                              const std::shared_ptr<const FileDescriptor>& opened,
                                              const std::string& name, NSErrorRef& error) {
  const std::string diskName = diskNameOf(store_, folder, name);
  std::optional<ItemRow> row;
  // Others may change the file or its row meanwhile. What was stored is looked at again, so that
  // the answer is right, unless the file does not come to rest at all.
  for (int attempt = 0; attempt < kMaximumAttempts; ++attempt) {
    FolderSnapshot snapshot;
    snapshot.rankBefore = options_.currentRank();
    snapshot.folder = opened;
    FolderEntry entry;
    const bool exists = lookAtEntry(opened->get(), diskName.c_str(), entry);
    if (!exists && errno != ENOENT && errno != EINVAL && errno != ENAMETOOLONG) {
      error = NSError::errorWithErrno(errno, name);
      return std::nullopt;
    }
    NSErrorRef failure;
    row = rowOnDisk(store_, folder, diskName, failure);
    const bool isRight = exists ? row && isAsBefore(*row, entry) : !row;
    if (failure) error = failure;
    if (isRight || failure) return row;
    if (exists) addOnlyEntry(snapshot, diskName, entry);
    failure = compare(folder, diskName, snapshot);
    if (failure) {
      error = failure;
      return std::nullopt;
    }
  }
  return row;
}

NSErrorRef LocationScan::compare(std::uint64_t folder, const std::string& diskName,
                                 const FolderSnapshot& snapshot) {
  ScanSession session(store_.database(), links_, visitor_);
  TreeWalker walker(options_);
  ScanReport report;
  const NSErrorRef error = session.compareNameAndFinish(folder, diskName, snapshot, walker, report);
  for (DirtyFolder& conflict : session.takeConflicts()) {
    // This very name is looked at again anyway.
    if (conflict.id != folder) conflicts_.push_back(std::move(conflict));
  }
  return error;
}

}  // namespace yomber
