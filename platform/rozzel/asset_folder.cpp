#include "platform/rozzel/asset_folder.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <span>
#include <utility>

#include "platform/foundation/file_time.h"
#include "platform/foundation/hexadecimal.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

void makeFolder(const std::string& path) {
  if (mkdir(path.c_str(), 0700) != 0 && errno != EEXIST) throwErrno("cannot make " + path);
}

[[noreturn]] void throwMissing(const RZAsset& asset) {
  throwFailure(RZErrorAssetMissing, asset.description() + " is missing from the store");
}

[[noreturn]] void throwDamaged(const RZAsset& asset) {
  throwFailure(RZErrorAssetDamaged,
               asset.description() + " is damaged in the store; store the content again");
}

void requireSize(const RZAsset& asset, const struct stat& status) {
  if (!S_ISREG(status.st_mode) || static_cast<std::uint64_t>(status.st_size) != asset.size) {
    throwDamaged(asset);
  }
}

}  // namespace

AssetFolder::AssetFolder(std::string storeFolder) : storeFolder_(std::move(storeFolder)) {}

std::string AssetFolder::folderFor(std::uint8_t firstByte) const {
  return storeFolder_ + "/assets/" + hexadecimal(std::as_bytes(std::span(&firstByte, 1)));
}

std::string AssetFolder::pathFor(const RZAsset& asset) const {
  return folderFor(asset.hash[0]) + "/" + asset.hexHash();
}

void AssetFolder::create() const {
  makeFolder(stagingFolder());
  makeFolder(storeFolder_ + "/assets");
  syncStoreFolder(storeFolder_);
}

void AssetFolder::createSubfolders() const {
  create();
  for (unsigned byte = 0; byte < 256; ++byte) {
    makeFolder(folderFor(static_cast<std::uint8_t>(byte)));
  }
  syncStoreFolder(storeFolder_ + "/assets");
}

void AssetFolder::require(const RZAsset& asset) const {
  struct stat status{};
  if (stat(pathFor(asset).c_str(), &status) != 0) {
    if (errno == ENOENT || errno == ENOTDIR) throwMissing(asset);
    throwErrno("cannot examine " + asset.description());
  }
  requireSize(asset, status);
}

FileDescriptor AssetFolder::open(const RZAsset& asset) const {
  FileDescriptor descriptor(
      ::open(pathFor(asset).c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  if (!descriptor) {
    if (errno == ENOENT || errno == ENOTDIR) throwMissing(asset);
    throwErrno("cannot open " + asset.description());
  }
  struct stat status{};
  if (fstat(descriptor.get(), &status) != 0) throwErrno("cannot examine " + asset.description());
  requireSize(asset, status);
  return descriptor;
}

void AssetFolder::requireSame(const RZAsset& asset, const RZAsset& found) {
  if (found != asset) throwDamaged(asset);
}

AssetLock::AssetLock(const AssetFolder& folder, Kind kind)
    : descriptor_(::open((folder.storeFolder() + "/assets.lock").c_str(),
                         O_RDWR | O_CREAT | O_CLOEXEC, 0600)) {
  if (!descriptor_) throwErrno("cannot open the lock of the assets");
  while (flock(descriptor_.get(), kind == Kind::Publishing ? LOCK_SH : LOCK_EX) != 0) {
    if (errno != EINTR) throwErrno("cannot lock the assets");
  }
}

void setModificationTime(const std::string& path, NSDate date) {
  const timespec time = timespecOf(date.nanoseconds());
  const timespec times[2] = {time, time};
  if (utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW) != 0) {
    throwErrno("cannot set the times of " + path);
  }
}

void removeWholeFolder(const std::string& path) {
  std::error_code ignored;
  std::filesystem::remove_all(path, ignored);
}

void syncStoreFolder(const std::string& path) {
  const FileDescriptor descriptor(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!descriptor) throwErrno("cannot open " + path);
  if (fsync(descriptor.get()) != 0) throwErrno("cannot sync " + path);
}

}  // namespace yomber
