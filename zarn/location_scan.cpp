#include "zarn/location_scan.h"

#include <fcntl.h>

#include <cerrno>

#include "platform/ostrell/constants.h"
#include "zarn/connection.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

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
  const NSErrorRef none = error;
  const std::string diskName = diskNameOf(store_, folder, name);
  FolderSnapshot snapshot;
  snapshot.rankBefore = options_.currentRank();
  snapshot.folder = opened;
  FolderEntry entry;
  const bool exists = lookAtEntry(opened->get(), diskName.c_str(), entry);
  if (!exists && errno != ENOENT && errno != EINVAL && errno != ENAMETOOLONG) {
    error = NSError::errorWithErrno(errno, name);
    return std::nullopt;
  }
  auto row = rowOnDisk(store_, folder, diskName, error);
  if (error) return std::nullopt;
  error = none;
  const bool isRight = exists && row && row->inode == entry.inode && row->ctime == entry.ctime;
  if (isRight) return row;
  if (!exists && !row) return std::nullopt;
  if (exists) {
    snapshot.names = diskName;
    entry.nameLength = static_cast<std::uint16_t>(diskName.size());
    if (entry.type == EntryType::Folder) entry.visit = TreeWalker::nextVisit();
    snapshot.entries.push_back(entry);
  }
  if (NSErrorRef failure = compare(folder, diskName, snapshot)) {
    error = failure;
    return std::nullopt;
  }
  NSErrorRef failure;
  row = rowOnDisk(store_, folder, diskName, failure);
  if (failure) error = failure;
  return row;
}

NSErrorRef LocationScan::compare(std::uint64_t folder, const std::string& diskName,
                                 const FolderSnapshot& snapshot) {
  ScanSession session(store_.database(), links_, visitor_);
  TreeWalker walker(options_);
  ScanReport report;
  return session.compareNameAndFinish(folder, diskName, snapshot, walker, report);
}

}  // namespace yomber
