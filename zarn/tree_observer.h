#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/database.h"
#include "zarn/dirty_folders.h"
#include "zarn/disk_entry.h"
#include "zarn/scanner.h"

namespace yomber {

/// What the observer asks for when the tree has changed. All are called on the observer's scanning
/// thread, one at a time, and may block.
struct ObservedTree {
  std::function<NSErrorRef()> scanAll;
  /// What is put into `notFound` is scanned again a moment later.
  std::function<NSErrorRef(const std::vector<DirtyFolder>&, std::vector<DirtyFolder>& notFound)>
      scanDirty;
  /// Told once, after the first `scanAll` has succeeded. May be empty.
  std::function<void()> didFinishFirstScan;
};

/// Sees what happens in the tree behind the daemon's back, and has it scanned.
///
/// Every folder that a scan reads is watched before it is read, so nothing slips through between
/// the two. Events become dirty names in dirty folders; the first one is acted on at once, those
/// that come while a scan runs are taken together by the next one. Both ends of a move are kept
/// together. An overflow of the system's event queue leads to a scan of the whole tree.
///
/// Where the system has no watches left, the folders without one are scanned again and again, the
/// more rarely the more that costs; `advice` says what to raise.
///
/// Threads: one that reads events, one that scans. Thread-safety: every operation may be called on
/// any thread. Ownership: shared; given to the scanner as its visitor and to the database as a sink
/// (dead folders lose their watches), both of which hold it weakly.
class TreeObserver final : public FolderVisitor, public ChangeSink {
 public:
  struct Options {
    /// At most so many watches are taken; the system may grant fewer.
    std::size_t watchLimit = std::numeric_limits<std::size_t>::max();
    /// Between two scans, so that what comes in a burst shares them.
    std::chrono::milliseconds batchInterval{3};
    /// How long a file that is being written waits for its next scan.
    std::chrono::milliseconds modifyInterval{300};
    /// Between two scans of the folders without a watch: at least so long, and so many times as
    /// long as the last such scan took.
    std::chrono::milliseconds unwatchedInterval{2000};
    unsigned unwatchedCostFactor = 20;
    /// After a scan that failed, doubling up to sixty times as long.
    std::chrono::milliseconds retryInterval{500};
  };

  struct Status {
    std::size_t watchedFolders = 0;
    std::size_t unwatchedFolders = 0;
    std::string advice;      ///< empty while every folder is watched
    bool scanning = true;    ///< a scan of the whole tree is running or due
    NSErrorRef lastFailure;  ///< of the last scan; nil when it succeeded
  };

  explicit TreeObserver(Options options);
  /// Ends both threads; waits for a scan that is running.
  ~TreeObserver() override;
  TreeObserver(const TreeObserver&) = delete;
  TreeObserver& operator=(const TreeObserver&) = delete;

  /// Has `sink`, which is held weakly, told of everything that is seen to happen, and of every
  /// folder that is watched from now on: whatever came about in it before was not seen. To be
  /// called before anything else.
  void setEventSink(std::weak_ptr<DiskEventSink> sink);

  /// Starts the threads; the first thing done is a `scanAll`. Called once.
  void start(ObservedTree tree);
  /// Ends both threads; nothing of the tree is called any more. Idempotent.
  void stop();
  /// Has the whole tree scanned soon.
  void requestFullScan();
  [[nodiscard]] Status status() const;
  /// Whether what happens in the folder of that id is seen at once.
  [[nodiscard]] bool isWatched(std::uint64_t folder) const;

  void willReadFolder(std::uint64_t visit, int descriptor) override;
  void didIdentifyFolder(std::uint64_t visit, std::uint64_t id) override;
  void didNotReadFolder(std::uint64_t id) override;
  void committed(const std::vector<ItemChange>& changes) override;

 private:
  class State;
  std::unique_ptr<State> state_;
};

}  // namespace yomber
