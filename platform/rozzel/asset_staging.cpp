#include "platform/rozzel/asset_staging.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <set>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/uuid.h"
#include "platform/rozzel/asset_writer.h"
#include "platform/rozzel/hashed_copy.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

/// Up to so many files are synced one by one; with more, one sync of the whole file system costs
/// less, whatever else is waiting to be written there.
constexpr std::size_t kFewFiles = 4;
/// A file in the way of a small asset is compared rather than replaced.
constexpr std::uint64_t kSmallAsset = 64 * 1024;

constexpr const char* kOwnerFile = "/owner";

FaultPoint whenStaged("rozzel.asset.staged");
FaultPoint whenWritten("rozzel.asset.written");
FaultPoint whenSynced("rozzel.asset.synced");
FaultPoint whenPublished("rozzel.asset.published");
FaultPoint whenDurable("rozzel.asset.durable");

void pass(FaultPoint& point) {
  if (point.hit()) throwErrno("storing an asset was told to fail", ENOSPC);
}

std::string newSessionPath(const AssetFolder& folder) {
  UUID uuid;
  uuid_generate(uuid);
  return folder.stagingFolder() + "/" + uuid_unparse(uuid);
}

/// The open owner file of a session whose process is gone; none while it lives. A folder without
/// such a file was left half made or half removed: the lock of the assets keeps out who is at it.
bool isDead(const std::string& session, FileDescriptor& owner) {
  owner = FileDescriptor(open((session + kOwnerFile).c_str(), O_RDWR | O_CLOEXEC));
  if (!owner) return errno == ENOENT;
  return flock(owner.get(), LOCK_EX | LOCK_NB) == 0;
}

bool isSameContent(const std::string& path, const RZAsset& asset) {
  if (asset.size > kSmallAsset) return false;
  const FileDescriptor there(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  RZAsset found;
  return there && !rz_hashFile(there.get(), {}, found) && found == asset;
}

bool shareBlocks(int source, int target) { return ioctl(target, FICLONE, source) == 0; }

}  // namespace

StagingSession::StagingSession(const AssetFolder& folder) {
  const AssetLock lock(folder, AssetLock::Kind::Publishing);
  path_ = newSessionPath(folder);
  if (mkdir(path_.c_str(), 0700) != 0) throwErrno("cannot make " + path_);
  owner_ = FileDescriptor(
      open((path_ + kOwnerFile).c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
  if (!owner_ || flock(owner_.get(), LOCK_EX | LOCK_NB) != 0) throwErrno("cannot lock " + path_);
}

StagingSession::~StagingSession() { removeWholeFolder(path_); }

bool StagingSession::isThere() const { return access((path_ + kOwnerFile).c_str(), F_OK) == 0; }

std::string StagingSession::newPath() { return path_ + "/" + std::to_string(++next_); }

void removeDeadSessions(const AssetFolder& folder) {
  std::vector<std::pair<std::string, FileDescriptor>> dead;
  {
    const AssetLock lock(folder, AssetLock::Kind::Dropping);
    std::error_code error;
    for (const auto& entry : std::filesystem::directory_iterator(folder.stagingFolder(), error)) {
      FileDescriptor owner;
      if (isDead(entry.path(), owner)) dead.emplace_back(entry.path(), std::move(owner));
    }
  }
  for (const auto& [path, owner] : dead) removeWholeFolder(path);
}

StagedFile::StagedFile(std::string path)
    : path_(std::move(path)),
      descriptor_(open(path_.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0400)) {
  if (!descriptor_) throwErrno("cannot make " + path_);
}

StagedFile::StagedFile(StagedFile&& other) noexcept
    : path_(std::exchange(other.path_, {})), descriptor_(std::move(other.descriptor_)) {}

StagedFile::~StagedFile() {
  if (!path_.empty()) unlink(path_.c_str());
}

void StagedFile::sync() {
  if (fsync(descriptor_.get()) != 0) throwErrno("cannot sync an asset");
}

void StagedFile::publish(const AssetFolder& folder, const RZAsset& asset, NSDate now) {
  setModificationTime(path_, now);
  const std::string target = folder.pathFor(asset);
  const auto moveTo = [&](unsigned flags) {
    return renameat2(AT_FDCWD, path_.c_str(), AT_FDCWD, target.c_str(), flags) == 0;
  };
  bool moved = moveTo(RENAME_NOREPLACE);
  if (!moved && errno == ENOENT) {
    folder.createSubfolders();
    moved = moveTo(RENAME_NOREPLACE);
  }
  if (!moved && (errno == EEXIST || errno == EINVAL)) {
    if (isSameContent(target, asset)) {
      setModificationTime(target, now);
      return;
    }
    moved = moveTo(0);
  }
  if (!moved) throwErrno("cannot put " + asset.description() + " into its place");
  path_.clear();
}

StagedGroup::StagedGroup(AssetFolder folder, std::shared_ptr<StagingSession> session,
                         std::function<NSDate()> clock, std::function<NSErrorRef()> reachability)
    : folder_(std::move(folder)),
      session_(std::move(session)),
      clock_(std::move(clock)),
      reachability_(std::move(reachability)),
      fileSystem_(open(session_->path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)) {
  if (!fileSystem_) throwErrno("cannot open " + session_->path());
}

StagedFile StagedGroup::newFile() {
  if (NSErrorRef error = reachability_()) throw StoreFailure{std::move(error)};
  StagedFile file(session_->newPath());
  pass(whenStaged);
  return file;
}

std::unique_ptr<RZAssetWriter> StagedGroup::newWriter(NSErrorRef* error) {
  std::unique_ptr<RZAssetWriter> writer;
  storeError(error,
             catchingFailures([&] { writer = std::make_unique<StagedWriter>(*this, newFile()); }));
  return writer;
}

NSErrorRef StagedGroup::importAsset(int descriptor, const RZTransfer& transfer, RZAsset& asset) {
  return catchingFailures([&] {
    StagedFile file = newFile();
    const bool shared = shareBlocks(descriptor, file.descriptor());
    NSErrorRef error = shared ? rz_hashFile(file.descriptor(), transfer, asset)
                              : rz_copyAndHashFile(descriptor, file.descriptor(), transfer, asset);
    if (error) throw StoreFailure{std::move(error)};
    // Zeros at the end were not written.
    if (!shared && ftruncate(file.descriptor(), static_cast<off_t>(asset.size)) != 0) {
      throwErrno("cannot set the size of an asset");
    }
    add(std::move(file), asset);
  });
}

void StagedGroup::add(StagedFile file, const RZAsset& asset) {
  pass(whenWritten);
  LockGuard guard(mutex_);
  if (finished_.size() >= kFewFiles) file.closeDescriptor();
  finished_.push_back({std::move(file), asset});
}

NSErrorRef StagedGroup::commit() {
  std::vector<Finished> files;
  {
    LockGuard guard(mutex_);
    files.swap(finished_);
  }
  if (files.empty()) return nullptr;
  return catchingFailures([&] {
    if (NSErrorRef error = reachability_()) throw StoreFailure{std::move(error)};
    syncContents(files);
    pass(whenSynced);
    {
      const AssetLock lock(folder_, AssetLock::Kind::Publishing);
      for (auto& [file, asset] : files) file.publish(folder_, asset, clock_());
    }
    pass(whenPublished);
    syncFolders(files);
    pass(whenDurable);
  });
}

void StagedGroup::syncContents(std::vector<Finished>& files) const {
  if (files.size() <= kFewFiles) {
    for (auto& [file, asset] : files) file.sync();
  } else if (syncfs(fileSystem_.get()) != 0) {
    throwErrno("cannot sync the assets");
  }
}

void StagedGroup::syncFolders(const std::vector<Finished>& files) const {
  std::set<std::uint8_t> folders;
  for (const auto& [file, asset] : files) folders.insert(asset.hash[0]);
  if (folders.size() <= kFewFiles) {
    for (const std::uint8_t byte : folders) syncStoreFolder(folder_.folderFor(byte));
  } else if (syncfs(fileSystem_.get()) != 0) {
    throwErrno("cannot sync the assets");
  }
}

}  // namespace yomber
