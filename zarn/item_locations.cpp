#include "zarn/item_locations.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>

#include "zarn/daemon_errors.h"
#include "zarn/located_item.h"

namespace yomber {
namespace {

constexpr mode_t kPrivate = 0700;

enum class Found { Folder, Nothing, SomethingElse };

Found look(const std::string& path) {
  struct stat status{};
  if (lstat(path.c_str(), &status) != 0) return Found::Nothing;
  return S_ISDIR(status.st_mode) ? Found::Folder : Found::SomethingElse;
}

NSErrorRef inTheWay(const std::string& path) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileWriteFileExistsError,
      {{NSFilePathErrorKey, path},
       {NSUnderlyingErrorKey, NSError::errorWithErrno(ENOTDIR, path)},
       {NSLocalizedDescriptionKey, path + " is no folder and has the place of one; rename it"}});
}

NSErrorRef makeFolder(const std::string& path) {
  if (mkdir(path.c_str(), kPrivate) == 0) return nullptr;
  if (errno != EEXIST) {
    return refusedError(errno, path,
                        "the folder cannot be made: " +
                            NSError::errorWithErrno(errno, path)->localizedDescription());
  }
  return look(path) == Found::Folder ? nullptr : inTheWay(path);
}

}  // namespace

std::optional<std::string> ItemLocations::physicalLocation(std::string_view path,
                                                           NSErrorRef* error) const {
  NSErrorRef failure;
  auto row = store_->itemAtPath(path, &failure);
  if (!row && !failure) row = findItemOnDisk(*store_, *scanner_, path, &failure);
  std::optional<std::string> physical;
  if (row) physical = store_->physicalPath(row->id, &failure);
  if (!physical) {
    storeError(error, failure ? failure : noSuchLocationError(std::string(path)));
  }
  return physical;
}

std::optional<ItemLocations::Container> ItemLocations::containerLocation(
    const std::string& containerID, Recreate recreate, NSErrorRef* error) const {
  const ContainerListRef list = containers_->list();
  const auto record =
      std::find_if(list->containers.begin(), list->containers.end(),
                   [&](const ContainerRecord& each) { return each.containerID == containerID; });
  if (record == list->containers.end()) {
    storeError(error, invalidParameterError("containerID", containerID));
    return std::nullopt;
  }
  const std::string& documents = record->documents;
  NSErrorRef failure;
  const Found found = look(documents);
  switch (found) {
    case Found::Folder:
      break;
    case Found::SomethingElse:
      failure = inTheWay(documents);
      break;
    case Found::Nothing:
      failure = recreate == Recreate::Yes ? makeDocuments(containerID, documents)
                                          : noSuchLocationError(documents);
  }
  if (!failure) failure = scanDocuments(containerID, documents, found == Found::Nothing);
  if (failure) {
    storeError(error, std::move(failure));
    return std::nullopt;
  }
  return Container{
      .documents = documents, .displayName = record->displayName, .generation = list->generation};
}

NSErrorRef ItemLocations::makeDocuments(const std::string& containerID,
                                        const std::string& documents) const {
  const TreeLayout& layout = store_->layout();
  // Those of the drive's own containers lie in the root.
  const bool isOwnFolder = documents == layout.documents(containerID);
  if (NSErrorRef error =
          makeFolder(isOwnFolder ? layout.containerFolder(containerID) : layout.root())) {
    return error;
  }
  return makeFolder(documents);
}

/// A container's own folder is no name in another one: it is looked at as the place that it is.
NSErrorRef ItemLocations::scanDocuments(const std::string& containerID,
                                        const std::string& documents, bool isNew) const {
  NSErrorRef error;
  if (documents != store_->layout().documents(containerID)) {
    return scanner_->scanLocation(documents, &error) ? nullptr : error;
  }
  const auto row = store_->itemForContainer(containerID, &error);
  if (!row) return error ? error : noSuchLocationError(documents);
  struct stat status{};
  // A new folder may have the very inode of the one before it.
  const bool isAsKnown =
      !isNew && lstat(documents.c_str(), &status) == 0 && status.st_ino == row->inode;
  return isAsKnown ? nullptr : scanner_->scanFolders({row->id});
}

}  // namespace yomber
