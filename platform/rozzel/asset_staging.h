#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/date.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/lock.h"
#include "platform/rozzel/asset_folder.h"
#include "platform/rozzel/engine.h"

namespace yomber {

/// A folder below `staging/` in which one engine writes assets until they are whole. It holds a
/// lock while it lives, so that others can tell the folders of dead processes from those of living
/// ones. Failures are StoreFailure.
///
/// Thread-safety: every operation may be called on any thread.
class StagingSession {
 public:
  explicit StagingSession(const AssetFolder& folder);
  ~StagingSession();
  StagingSession(const StagingSession&) = delete;
  StagingSession& operator=(const StagingSession&) = delete;

  [[nodiscard]] const std::string& path() const { return path_; }
  /// False when somebody has taken the folder away.
  [[nodiscard]] bool isThere() const;
  /// A name in the folder that was not used before.
  [[nodiscard]] std::string newPath();

 private:
  std::string path_;
  FileDescriptor owner_;
  std::atomic<std::uint64_t> next_{0};
};

/// Removes the folders of sessions whose processes are gone.
void removeDeadSessions(const AssetFolder& folder);

/// An asset's content on its way into the store; removed unless it was published.
class StagedFile {
 public:
  explicit StagedFile(std::string path);
  StagedFile(StagedFile&& other) noexcept;
  StagedFile& operator=(StagedFile&&) = delete;
  ~StagedFile();

  [[nodiscard]] int descriptor() const { return descriptor_.get(); }
  /// Syncs the content alone.
  void sync();
  /// Gives the descriptor up. Groups of many files cannot keep one each.
  void closeDescriptor() { descriptor_ = FileDescriptor(); }
  /// Brings it to its place. A file that is there already stays if it is small and sound; else it
  /// is replaced, which mends what may have been damaged.
  void publish(const AssetFolder& folder, const RZAsset& asset, NSDate now);

 private:
  std::string path_;
  FileDescriptor descriptor_;
};

/// See RZAssetGroup. Keeps its session.
class StagedGroup final : public RZAssetGroup {
 public:
  StagedGroup(AssetFolder folder, std::shared_ptr<StagingSession> session,
              std::function<NSDate()> clock, std::function<NSErrorRef()> reachability);

  [[nodiscard]] std::unique_ptr<RZAssetWriter> newWriter(NSErrorRef* error) override;
  [[nodiscard]] NSErrorRef importAsset(int descriptor, const RZTransfer& transfer,
                                       RZAsset& asset) override;
  [[nodiscard]] NSErrorRef commit() override;

 private:
  friend class StagedWriter;
  struct Finished {
    StagedFile file;
    RZAsset asset;
  };

  [[nodiscard]] StagedFile newFile();
  void add(StagedFile file, const RZAsset& asset);
  void syncContents(std::vector<Finished>& files) const;
  void syncFolders(const std::vector<Finished>& files) const;

  const AssetFolder folder_;
  const std::shared_ptr<StagingSession> session_;
  const std::function<NSDate()> clock_;
  const std::function<NSErrorRef()> reachability_;
  /// Opened before anything is written, so that its syncfs reports every failed write since.
  const FileDescriptor fileSystem_;

  Mutex mutex_;
  std::vector<Finished> finished_ GUARDED_BY(mutex_);
};

}  // namespace yomber
