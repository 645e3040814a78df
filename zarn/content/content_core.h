#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/lock.h"
#include "zarn/content/content_participant.h"
#include "zarn/content/content_store.h"
#include "zarn/content/document_drawer.h"
#include "zarn/content/fault_file.h"
#include "zarn/content/job_queue.h"
#include "zarn/content/share_rows.h"
#include "zarn/content/wishes.h"
#include "zarn/content_engine.h"
#include "zarn/item_store.h"
#include "zarn/scanner.h"

namespace yomber {

/// What an item's job needs to know, read at once.
struct JobSubject {
  Job job;
  std::optional<ItemRow> row;
  std::optional<ContentRow> content;
  std::string path;                    ///< on this disk; empty when the item is gone
  RZRecordZoneID zone;                 ///< where its record belongs now
  std::optional<ShareRow> share = {};  ///< whose zone that is, where it is not a container's
  bool isPinned = false;
  bool isStale = false;  ///< the job was ended, or replaced, before it was handed out
};

/// What the workers of the engine share.
///
/// Thread-safety: every operation may be called on any thread but the writer's.
class ContentCore {
 public:
  ContentCore(std::shared_ptr<ItemStore> itemStore, std::shared_ptr<Scanner> itemScanner,
              ContentEngine::Options engineOptions);

  [[nodiscard]] std::int64_t now() const { return options.clock(); }
  [[nodiscard]] Database& database() const { return *items->database(); }

  /// Null while nobody is signed in.
  [[nodiscard]] std::shared_ptr<ContentStore> store() const;
  /// For jobs of that account; null when another one is signed in by now.
  [[nodiscard]] std::shared_ptr<ContentStore> storeOf(std::int64_t account) const;
  [[nodiscard]] std::string account() const;
  void setStore(std::shared_ptr<ContentStore> store, const std::string& account);
  /// To be called now and then: jobs wait while the account could not be stored, as on a full disk.
  void storeAccountAgain();
  /// The store did not answer: jobs that need it wait until it does.
  void noteOutOfReach();
  /// Looks whether it can be reached again.
  void probe();
  [[nodiscard]] bool isOffline() const { return isOffline_.load(); }

  [[nodiscard]] NSErrorRef readSubjects(const std::vector<Job>& jobs,
                                        std::vector<JobSubject>& subjects) const;

  /// When a job that has failed `attempts` times is tried again.
  [[nodiscard]] std::int64_t nextAttempt(std::uint32_t attempts) const;
  /// Stores that a job failed, and when it is tried again.
  void postpone(Connection& connection, Job job, const NSErrorRef& error) const;

  /// To be told what came of storing the outcome of jobs. Where that failed, as on a full disk,
  /// they are found again at once as they were: whoever did them rests before.
  void noteStored(const NSErrorRef& error) { storingFailure_.store(error); }
  [[nodiscard]] NSErrorRef storingFailure() const { return storingFailure_.load(); }

  /// An upload into a share was refused: `isForbidden`, or as others have changed the record.
  void noteRefused(std::uint64_t item, const RZRecordZoneID& zone, bool isForbidden);
  struct Refused {
    std::map<RZRecordZoneID, std::set<std::uint64_t>> changed;
    std::map<RZRecordZoneID, std::set<std::uint64_t>> forbidden;
  };
  [[nodiscard]] Refused takeRefused();
  /// Called when there are some; on any thread, with no lock held. Set once, before jobs are done.
  std::function<void()> didRefuse;
  /// Moves an item to the drive's trash; empty where there is none. Set once, before jobs are done.
  std::function<NSErrorRef(const std::string& path)> trash;

  /// Decides on a fault that somebody has written to: what they wrote over all of it counts, what
  /// they wrote into it is brought to a file of its own.
  NSErrorRef settleWritten(const std::string& path, const FaultExamination& found);
  /// A file that was busy, or whose change by us was stored, is looked at once more unless it still
  /// is what was stored: what others did to it meanwhile was passed over, or hidden by ours.
  void lookAgain(const JobSubject& subject, const FileStamp& stored) const;

  const std::shared_ptr<ItemStore> items;
  const std::shared_ptr<Scanner> scanner;
  const ContentEngine::Options options;
  const std::shared_ptr<JobQueue> queue;
  const std::shared_ptr<ContentParticipant> participant;
  const std::shared_ptr<DocumentDrawer> drawer;
  Wishes wishes;     ///< for content to come
  Wishes evictions;  ///< for content to go; never taken back
  std::atomic<std::uint64_t> finished{0};

 private:
  void forgetChangeTime(std::uint64_t item) const;

  [[nodiscard]] bool storeAccount(const std::string& account) REQUIRES(signingMutex_);

  Mutex signingMutex_;  ///< held while the account is stored, so that the last one is
  bool isAccountStored_ GUARDED_BY(signingMutex_) = true;

  mutable Mutex mutex_;
  std::shared_ptr<ContentStore> store_ GUARDED_BY(mutex_);
  std::string account_ GUARDED_BY(mutex_);
  static constexpr std::int64_t kNoAccount = -1;
  std::int64_t storeKey_ GUARDED_BY(mutex_) = kNoAccount;  ///< the account's, as jobs have it
  std::atomic<bool> isOffline_{false};
  AtomicCell<NSErrorRef> storingFailure_;
  Refused refused_ GUARDED_BY(mutex_);
};

/// Rows that are as they are while a file is filled or given up.
class BusyFile {
 public:
  BusyFile(const ContentCore& core, std::uint64_t inode);
  ~BusyFile();
  BusyFile(BusyFile&& other) noexcept;
  BusyFile& operator=(BusyFile&&) = delete;

 private:
  const std::shared_ptr<Database> database_;
  std::uint64_t inode_;
};

/// Each does the jobs given, stores what came of them, and tells who waits.
void doUploads(ContentCore& core, const std::vector<Job>& jobs);
void doDownloads(ContentCore& core, const std::vector<Job>& jobs);
/// Tells nobody: what it returns does, to be called when the jobs count as running no longer.
/// Otherwise whoever is told, and looks, would see an eviction still going on.
[[nodiscard]] std::function<void()> doEvictions(ContentCore& core, const std::vector<Job>& jobs);
void doSettling(ContentCore& core, const std::vector<Job>& jobs);
void doSpreading(ContentCore& core, const std::vector<Job>& jobs);
void doThumbnails(ContentCore& core, const std::vector<Job>& jobs);

/// To be called before the first sweep of a process: where there was nobody to draw, or others than
/// now, that begins anew.
void beginThumbnailSweep(const ContentCore& core, WriteTransaction& transaction);
/// Gives jobs to documents that were uploaded before there were thumbnails; a part of them at a
/// time. True when there are no more.
[[nodiscard]] bool sweepThumbnails(const ContentCore& core, WriteTransaction& transaction);

/// Gives a document a download where it is pinned and not here, and takes the one away that was
/// only for the sake of a pin and has not begun.
void followPins(const ContentCore& core, Connection& connection, const ItemRow& row, bool isPinned);

/// What is known of a file whose marks have changed.
enum class LocalContent {
  Away,
  Verified,  ///< it is what the store has
  Unread,    ///< it is what it was before
};
/// Stores in an item's row that its content is here or not, and as which file. Leaves alone what a
/// scan has seen to be another file meanwhile. False: somebody has changed it before, which a scan
/// is still to find.
[[nodiscard]] bool storeLocalState(WriteTransaction& transaction, std::uint64_t item,
                                   const FileStamp& before, const FileStamp& after,
                                   LocalContent local);

}  // namespace yomber
