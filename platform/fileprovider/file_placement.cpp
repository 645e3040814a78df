#include "platform/fileprovider/file_placement.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <functional>
#include <memory>
#include <utility>

#include "platform/fileprovider/file_errors.h"
#include "platform/fileprovider/staging_folder.h"
#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/bounced_name.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/tree_copy.h"
#include "platform/foundation/tree_faults.h"
#include "platform/foundation/tree_removal.h"

namespace yomber {
namespace {

using Identity = TreeCopy::Identity;

FaultPoint copyIsStaged("fileprovider.copy.staged");
FaultPoint copyIsInPlace("fileprovider.move.copy-in-place");
FaultPoint nameIsSynced("fileprovider.copy.name-synced");
FaultPoint treeIsTakenAway("fileprovider.delete.taken-away");

struct Settings {
  AtomicCell<PhysicalLocationResolver> resolver;
  AtomicCell<FormerNameResolver> formerName;
  AtomicCell<DepartureRule> departure;
  AtomicCell<std::string> staging;
};

Settings& settings() {
  // Never destroyed: threads of the pool outlive `main`.
  static auto* const instance = new Settings;
  return *instance;
}

bool exists(const std::string& path) {
  struct stat status{};
  return lstat(path.c_str(), &status) == 0;
}

Placed failed(NSErrorRef error) { return {nullptr, std::move(error)}; }
Placed placedAt(const FileDestination& destination, const std::string& name) {
  return {destination.folder.logical->URLByAppendingPathComponent(name), nullptr};
}
Placed clash(const FileDestination& destination) {
  return failed(
      fileExistsError(destination.folder.logical->URLByAppendingPathComponent(destination.name)));
}

std::string onDisk(const FileDestination& destination, const std::string& name) {
  return destination.folder.onDisk + "/" + name;
}

/// Tries names until one is free; 0, EEXIST for a clash, or what the attempt failed with. `name` is
/// the one that was taken.
int takeName(const FileDestination& destination, std::string& name,
             const std::function<int(const std::string& path)>& attempt) {
  int number = 0;
  const auto isTaken = [&](const std::string& candidate) {
    number = attempt(onDisk(destination, candidate));
    return number == EEXIST && destination.bouncing == Bouncing::Allowed;
  };
  name = bouncedName(destination.name, isTaken);
  return number;
}

/// Never replaces, also where the file system itself cannot promise that.
int renameWithoutReplacing(const std::string& from, const std::string& to) {
  if (renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE) == 0) return 0;
  return errno;
}

/// Which end of a move `number` is about.
NSErrorRef moveError(int number, const FileLocation& source, const FileDestination& destination) {
  const std::string& folder = destination.folder.logical->path();
  if (number == ENOENT && exists(source.onDisk)) return noSuchFileError(folder);
  if (number == ENOENT) return noSuchFileError(source.logical->path());
  if (number == EINVAL && isPathBelow(destination.folder.onDisk + "/x", source.onDisk)) {
    return fileErrorFrom(
        NSError::errorWithDomain(
            NSPOSIXErrorDomain, EINVAL,
            {{NSFilePathErrorKey, source.logical->path()},
             {NSLocalizedDescriptionKey, source.logical->path() + " cannot be moved into itself"}}),
        FileAccess::Write);
  }
  return fileError(number, folder + "/" + destination.name);
}

NSErrorRef syncFolder(const std::string& path) {
  const FileDescriptor folder(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return folder && fsync(folder.get()) == 0 ? nullptr : fileError(errno, path);
}

/// A new file is answered when its name is on the disk as well; the disk makes one write of many
/// that ask for it at once.
Placed syncPlaced(const FileDestination& destination, Placed placed) {
  NSErrorRef error = syncFolder(destination.folder.onDisk);
  if (nameIsSynced.hit()) error = fileError(EIO, destination.folder.onDisk);
  if (error == nullptr) return placed;
  TreeRemoval removal;
  (void)removal.run(onDisk(destination, placed.url->lastPathComponent()));
  return failed(std::move(error));
}

/// Copies into the staging folder and renames into place. EXDEV when the staging folder is no good
/// for this destination.
int placeCopy(const StagingFolder& staging, const FileLocation& source,
              const FileDestination& destination, Identity identity, Placed& placed) {
  TreeCopy copy(identity);
  if (const NSErrorRef error = copy.run(source.onDisk, staging.content())) {
    placed = failed(fileErrorFrom(error, FileAccess::Write));
    return 0;
  }
  if (copyIsStaged.hit()) {
    placed = failed(fileError(EIO, source.logical->path()));
    return 0;
  }
  std::string name;
  const int number = takeName(destination, name, [&](const std::string& path) {
    return renameWithoutReplacing(staging.content(), path);
  });
  if (number == EXDEV) return number;
  if (number == EEXIST) {
    placed = clash(destination);
  } else if (number != 0) {
    placed = failed(moveError(number, source, destination));
  } else {
    placed = placedAt(destination, name);
    if (const auto mode = copy.pendingMode()) (void)chmod(onDisk(destination, name).c_str(), *mode);
    if (identity == Identity::New) placed = syncPlaced(destination, std::move(placed));
  }
  return 0;
}

/// The registered staging folder, when it is on that file system.
std::unique_ptr<StagingFolder> registeredStaging(dev_t device) {
  const std::string parent = settings().staging.load();
  if (parent.empty()) return nullptr;
  if (mkdir(parent.c_str(), S_IRWXU) != 0 && errno != EEXIST) return nullptr;
  auto staging = StagingFolder::make(parent);
  return staging != nullptr && staging->device() == device ? std::move(staging) : nullptr;
}

/// The device of the folder, or why there is none.
NSErrorRef checkFolder(const FileLocation& folder, dev_t& device) {
  struct stat status{};
  if (stat(folder.onDisk.c_str(), &status) != 0) return fileError(errno, folder.logical->path());
  device = status.st_dev;
  return S_ISDIR(status.st_mode) ? nullptr : fileError(ENOTDIR, folder.logical->path());
}

Placed copyFile(const FileLocation& source, const FileDestination& destination, Identity identity) {
  dev_t device = 0;
  if (NSErrorRef error = checkFolder(destination.folder, device)) return failed(std::move(error));
  const bool isTaken =
      destination.bouncing == Bouncing::Forbidden && exists(onDisk(destination, destination.name));
  if (isTaken) return clash(destination);  // before much is copied in vain
  Placed placed;
  if (const auto staging = registeredStaging(device)) {
    if (placeCopy(*staging, source, destination, identity, placed) == 0) return placed;
  }
  const auto beside = StagingFolder::make(destination.folder.onDisk);
  if (beside == nullptr) return failed(moveError(errno, source, destination));
  const int number = placeCopy(*beside, source, destination, identity, placed);
  return number == 0 ? placed : failed(moveError(number, source, destination));
}

/// For what cannot be renamed from one file system to another.
Placed moveByCopying(const FileLocation& source, const FileDestination& destination) {
  Placed placed = copyFile(source, destination, Identity::Kept);
  if (placed.error != nullptr) return placed;
  // The source goes only when its copy stays.
  NSErrorRef error = syncFolder(destination.folder.onDisk);
  if (error == nullptr && copyIsInPlace.hit()) error = fileError(EIO, source.logical->path());
  if (error == nullptr) error = deleteFile(source);
  if (error == nullptr) return placed;
  // A file that could not be removed stays where it was; of a folder, some may be gone already.
  (void)unlink(onDisk(destination, placed.url->lastPathComponent()).c_str());
  return failed(std::move(error));
}

NSErrorRef removeInPlace(const FileLocation& file) {
  TreeRemoval removal;
  if (removal.run(file.onDisk)) return nullptr;
  const int number = errno;
  const bool isItself = removal.failedPath() == file.onDisk;
  return fileError(number, isItself ? file.logical->path() : removal.failedPath());
}

NSErrorRef checkDeparture(const FileLocation& source, const FileDestination& destination) {
  const auto leaves = settings().departure.load();
  if (!leaves || !leaves(source.onDisk, onDisk(destination, destination.name))) return nullptr;
  if (!holdsFault(source.onDisk) || !exists(source.onDisk)) return nullptr;
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSUbiquitousFileUnavailableError,
      {{NSFilePathErrorKey, source.logical->path()},
       {NSLocalizedDescriptionKey, "what is called \"" + destination.name +
                                       "\" is not in the drive; bring the content here first"}});
}

/// Whether the disk cannot have that name at all.
bool isUnspeakable(int number) { return number == ENAMETOOLONG || number == EILSEQ; }

}  // namespace

void setPhysicalLocationResolver(PhysicalLocationResolver resolver) {
  settings().resolver.store(std::move(resolver));
}

void setFormerNameResolver(FormerNameResolver resolver) {
  settings().formerName.store(std::move(resolver));
}

std::optional<std::string> formerNameOf(const FileLocation& file) {
  const auto resolver = settings().formerName.load();
  auto name = resolver ? resolver(file.onDisk) : std::nullopt;
  return name && checkFileName(*name) == nullptr ? name : std::nullopt;
}

void setDepartureRule(DepartureRule rule) { settings().departure.store(std::move(rule)); }

void setStagingFolder(std::string path) { settings().staging.store(std::move(path)); }

FileLocation locateFile(const NSURLRef& url) {
  NSURLRef physical;
  if (url->hasMark(NSURL::Mark::Physical)) {
    if (const auto resolver = settings().resolver.load()) physical = resolver(url);
  }
  return {std::make_shared<NSURL>(url->path()), (physical != nullptr ? physical : url)->path()};
}

FileLocation locateFolder(const NSURLRef& url) {
  FileLocation folder = locateFile(url);
  if (exists(folder.onDisk)) return folder;
  if (const auto resolver = settings().resolver.load()) {
    if (const NSURLRef physical = resolver(url)) folder.onDisk = physical->path();
  }
  return folder;
}

Placed makeFolder(const FileDestination& destination) {
  constexpr mode_t kAsTheUserWishes = 0777;
  const std::string path = onDisk(destination, destination.name);
  if (mkdir(path.c_str(), kAsTheUserWishes) == 0) return placedAt(destination, destination.name);
  const int number = errno;
  struct stat status{};
  if (number == EEXIST && lstat(path.c_str(), &status) == 0) {
    return S_ISDIR(status.st_mode) ? placedAt(destination, destination.name) : clash(destination);
  }
  const std::string& folder = destination.folder.logical->path();
  return failed(fileError(number, number == ENOENT ? folder : folder + "/" + destination.name));
}

Placed moveFile(const FileLocation& source, const FileDestination& destination) {
  if (source.onDisk == onDisk(destination, destination.name)) {
    return exists(source.onDisk) ? placedAt(destination, destination.name)
                                 : failed(noSuchFileError(source.logical->path()));
  }
  if (NSErrorRef error = checkDeparture(source, destination)) return failed(std::move(error));
  std::string name;
  const auto moveTo = [&](const std::string& path) {
    return renameWithoutReplacing(source.onDisk, path);
  };
  int number = takeName(destination, name, moveTo);
  const bool keepsItsName = destination.name == source.logical->lastPathComponent();
  if (isUnspeakable(number) && keepsItsName) {
    number = moveTo(onDisk(destination, NSURL(source.onDisk).lastPathComponent()));
  }
  switch (number) {
    case 0:
      return placedAt(destination, name);
    case EEXIST:
      return clash(destination);
    case EXDEV:
      return moveByCopying(source, destination);
    default:
      return failed(moveError(number, source, destination));
  }
}

Placed renameFile(const FileLocation& source, const std::string& newName) {
  if (source.logical->lastPathComponent() == newName) {
    return {source.logical, checkFileIsThere(source)};
  }
  const auto onDisk = NSURL(source.onDisk).URLByDeletingLastPathComponent();
  return moveFile(source,
                  {{source.logical->URLByDeletingLastPathComponent(), onDisk->path()}, newName});
}

Placed importFile(const FileLocation& source, const FileDestination& destination) {
  if (!exists(source.onDisk)) {
    return failed(fileError(errno, source.logical->path(), FileAccess::Read));
  }
  return copyFile(source, destination, Identity::New);
}

NSErrorRef checkFileIsThere(const FileLocation& file) {
  return exists(file.onDisk) ? nullptr : fileError(errno, file.logical->path());
}

NSErrorRef deleteFile(const FileLocation& file) {
  // Whatever a location was made of, it is never everything.
  if (file.onDisk == "/") return fileError(EBUSY, file.onDisk);
  struct stat status{};
  if (lstat(file.onDisk.c_str(), &status) != 0) return fileError(errno, file.logical->path());
  // A tree disappears at once, and is taken apart where nobody sees it.
  if (S_ISDIR(status.st_mode)) {
    const auto staging = registeredStaging(status.st_dev);
    if (staging != nullptr && renameWithoutReplacing(file.onDisk, staging->content()) == 0) {
      (void)treeIsTakenAway.hit();
      return nullptr;
    }
  }
  return removeInPlace(file);
}

}  // namespace yomber
