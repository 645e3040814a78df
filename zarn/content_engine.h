#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/progress.h"

namespace yomber {

class ContentStore;
class DocumentDrawer;
class ItemStore;
class Scanner;
class Shares;

/// Where an item's content is.
struct ContentState {
  enum class Local { Here, Fault, Downloading, Evicting };
  enum class Upload {
    Confirmed,  ///< the store has this very content
    Waiting,
    Uploading,
    None,  ///< never uploaded: folders, links, excluded names
  };
  Local local = Local::Here;
  Upload upload = Upload::None;
  bool isPinned = false;  ///< itself, or a folder above it
  std::uint64_t size = 0;
  std::uint64_t localBytes = 0;  ///< of blocks on this disk
  NSErrorRef lastFailure;        ///< of the job that waits to be tried again
};

/// A job that is being done, or waits to be tried again.
struct ContentTransfer {
  enum class Kind { Upload, Download, Evict };
  std::uint64_t item = 0;
  std::string path;  ///< logical; empty when the item is gone
  Kind kind = Kind::Upload;
  bool isRunning = false;
  std::uint64_t total = 0;  ///< bytes
  std::uint64_t done = 0;
  std::uint32_t attempts = 0;               ///< that failed
  NSErrorRef failure;                       ///< of the last attempt
  std::optional<std::int64_t> nextAttempt;  ///< when it waits; ns since the epoch
};

struct ContentTransfers {
  std::vector<ContentTransfer> transfers;  ///< those under way first, then those that failed
  std::uint64_t waiting = 0;               ///< jobs, whether or not listed or made already
  std::uint64_t finished = 0;              ///< that moved something, since the engine was made
  bool isOffline = false;                  ///< the store was out of reach when last asked
};

/// Somebody's wish for an item's content. Destroying it takes the wish back: its completion is then
/// called with NSCocoaErrorDomain 3072, unless it was called before. A download that nobody wishes
/// for any longer is given up, leaving a fault.
class ContentWish {
 public:
  virtual ~ContentWish() = default;
  /// In bytes. Of the download that serves the wish; shared by all wishes for the item.
  [[nodiscard]] virtual NSProgressRef progress() const = 0;
};

/// What of the drive's content is uploaded, downloaded and evicted.
///
/// Every new, changed, moved or removed document leads to a job; jobs are rows of the database,
/// committed together with the change that made them, so that none is lost however the process
/// ends. Jobs of one item run one after the other, and so many of a kind at a time. A job that
/// fails is tried again, ever more slowly, and never dropped; while the store is out of reach, or
/// nobody is signed in, jobs wait without counting attempts.
///
/// Why content cannot be had: NSCocoaErrorDomain 4354 while the store is out of reach, 4355 when
/// the store's quota is used up, NSPOSIXErrorDomain ENOSPC when this disk is full, EBUSY while
/// another program has the fault open for writing,
/// NSCocoaErrorDomain 259 when what the store has is not the content that was put there,
/// NSCocoaErrorDomain 4 when nothing is at the location.
///
/// Locations may be logical or physical. Thread-safety: every operation may be called on any thread
/// but the database's writer thread. Completions are called exactly once, on any thread, also
/// before the call that they were given to returns, with no lock held; they must not block.
class ContentEngine {
 public:
  using Completion = std::function<void(NSErrorRef)>;
  /// ns since the epoch.
  using Clock = std::function<std::int64_t()>;

  struct Options {
    std::size_t uploadWorkers = 2;
    std::size_t downloadWorkers = 4;
    std::size_t evictWorkers = 1;
    /// Pauses between attempts double from the first to the second.
    std::chrono::milliseconds firstPause{1'000};
    std::chrono::milliseconds longestPause{15 * 60 * 1'000};
    /// A save is several changes, often of several files: for how long a document has to be left
    /// alone before it is uploaded. One that goes on changing is uploaded after ten times that.
    std::chrono::milliseconds uploadPause{500};
    /// How often a store out of reach is tried.
    std::chrono::milliseconds offlinePause{2'000};
    /// For how long marks of filled files gather before they are synced and taken off together.
    std::chrono::milliseconds settlePause{500};
    /// For how long thumbnails of what is uploaded together may keep it; the rest get theirs later.
    std::chrono::milliseconds drawingPatience{30'000};
    /// How often is asked what others have changed in shares.
    std::chrono::milliseconds sharesPause{3'000};
    std::shared_ptr<DocumentDrawer> drawer = {};  ///< when null, one of its own
    Clock clock = {};                             ///< when empty, the system's
  };

  /// Reading option: the answer waits until what is going on with the item has ended.
  static constexpr std::uint64_t kAfterWhatGoesOn = 0x20000;

  /// `contents` may be replaced later with `setStore`; null while nobody is signed in.
  static std::shared_ptr<ContentEngine> create(std::shared_ptr<ItemStore> items,
                                               std::shared_ptr<Scanner> scanner, Options options);
  virtual ~ContentEngine() = default;

  /// Begins to work on jobs; those of an earlier process go on.
  virtual void start() = 0;
  /// Ends the threads; what they were doing goes on after the next start. Wishes end with 3072.
  virtual void stop() = 0;
  /// To be called when a database was built anew: gives jobs to the documents in it, as their files
  /// get their marks (Scanner::stampSome). A mark that is written later would be a change, for
  /// which the document is read and compared once more.
  virtual void sweep() {}
  /// To be called when files got their marks.
  virtual void didStamp() {}
  /// The store of the account that is signed in now, under the name that tells accounts apart; null
  /// when nobody is. Jobs belong to the account under which they were made, and wait for it.
  virtual void setStore(std::shared_ptr<ContentStore> contents, const std::string& account) = 0;

  /// How items are moved to the drive's trash. To be called before `start`, at most once.
  virtual void setTrash(std::function<NSErrorRef(const std::string& path)> /*trash*/) {}

  /// What is shared with others; null where there is no record store.
  [[nodiscard]] virtual std::shared_ptr<Shares> shares() { return nullptr; }

  /// Completes when the content can be read; at once for what is here, and for folders and links.
  [[nodiscard]] virtual std::unique_ptr<ContentWish> startProviding(std::string_view path,
                                                                    std::uint64_t options,
                                                                    Completion completion) = 0;
  /// Gives up the local content, leaving a fault; success for what is a fault already. Refused with
  /// QSOstrellErrorDomain 6, with the reason as the description, while the content is not confirmed
  /// in the store, changed since, open somewhere, pinned or wished for, or has no fault form.
  virtual void evict(std::string_view path, Completion completion) = 0;
  /// Pinned content is brought here and never evicted. A pinned folder pins what is below it, also
  /// later. Answers when that is stored; the downloads go on behind it.
  [[nodiscard]] virtual NSErrorRef setPinned(std::string_view path, bool isPinned) = 0;

  [[nodiscard]] virtual std::optional<ContentState> contentState(
      std::string_view path, NSErrorRef* error = nullptr) const = 0;
  /// At most `limit` of them.
  [[nodiscard]] virtual ContentTransfers transfers(std::size_t limit = 1000) const = 0;

  /// Jobs that wait for their next attempt, or for a store out of reach, are tried now.
  virtual void retryNow() = 0;
  /// Waits until no job is left that could be done now. False after `patience`.
  [[nodiscard]] virtual bool waitUntilIdle(std::chrono::milliseconds patience) = 0;
};

}  // namespace yomber
