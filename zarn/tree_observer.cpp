#include "zarn/tree_observer.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <iterator>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/log.h"
#include "platform/ipc/unix_socket.h"
#include "zarn/dirty_folders.h"
#include "zarn/watch_table.h"

namespace yomber {

namespace {

using Clock = std::chrono::steady_clock;
constexpr unsigned kMaximumRetryFactor = 64;
constexpr std::size_t kUnwatchedSlice = 128;
constexpr std::chrono::milliseconds kNotFoundPause{20};
constexpr std::chrono::milliseconds kUnreadPause{10};  // doubling
constexpr unsigned kMaximumReadings = 8;

}  // namespace

class TreeObserver::State {
 public:
  explicit State(Options options)
      : options_(options),
        wakeReader_(eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC)),
        watches_(options.watchLimit),
        queueDescriptor_(watches_.descriptor()),
        dirty_(options.modifyInterval) {}

  void setEventSink(std::weak_ptr<DiskEventSink> sink) { sink_ = std::move(sink); }

  void start(ObservedTree tree) {
    tree_ = std::move(tree);
    reader_ = std::thread([this] { readEvents(); });
    scanner_ = std::thread([this] { scanWhenDue(); });
  }

  void stop() {
    {
      LockGuard guard(mutex_);
      stopping_ = true;
      changed_.notifyAll();
    }
    const std::uint64_t one = 1;
    (void)!write(wakeReader_.get(), &one, sizeof one);
    if (reader_.joinable()) reader_.join();
    if (scanner_.joinable()) scanner_.join();
  }

  void requestFullScan() {
    LockGuard guard(mutex_);
    fullScanDue_ = true;
    changed_.notifyAll();
  }

  Status status() const {
    LockGuard guard(mutex_);
    return {.watchedFolders = watches_.watched(),
            .unwatchedFolders = watches_.unwatched().size(),
            .advice = watches_.advice(),
            .scanning = fullScanDue_ || fullScanRunning_,
            .lastFailure = lastFailure_};
  }

  bool isWatched(std::uint64_t folder) const {
    LockGuard guard(mutex_);
    return watches_.isWatched(folder);
  }

  void willReadFolder(std::uint64_t visit, int descriptor) {
    std::uint64_t watched = 0;
    {
      LockGuard guard(mutex_);
      watched = watches_.willRead(visit, descriptor);
    }
    if (watched == 0) return;
    if (const auto sink = wantedSink()) sink->entriesDidChange({{.folder = watched, .name = {}}});
  }

  void didIdentifyFolder(std::uint64_t visit, std::uint64_t id) {
    LockGuard guard(mutex_);
    unread_.erase(id);
    if (watches_.didIdentify(visit, id)) {
      dirty_.noteWhole(id);
      changed_.notifyAll();
    }
    if (!fullScanRunning_) sayAdvice();
  }

  /// Tried again at growing distances; then it is left to the next scan of the tree.
  void didNotReadFolder(std::uint64_t id) {
    LockGuard guard(mutex_);
    Unread& unread = unread_[id];
    if (unread.attempts >= kMaximumReadings) return;
    unread.due = Clock::now() + kUnreadPause * (1U << unread.attempts++);
    unread.isDue = true;
    changed_.notifyAll();
  }

  void committed(const std::vector<ItemChange>& changes) {
    LockGuard guard(mutex_);
    for (const auto& change : changes) {
      if (!change.isDead() || !change.row.isFolder()) continue;
      unread_.erase(change.row.id);
      watches_.forget(change.row.id);
      dirty_.forget(change.row.id);
    }
    if (watches_.unwatched().empty()) saidAdvice_ = false;
  }

 private:
  /// What the events of one reading say to those outside.
  struct Seen {
    std::vector<DiskEntry> entries;
    bool lostTrack = false;
  };
  /// A folder that has a row but was not read.
  struct Unread {
    unsigned attempts = 0;
    bool isDue = false;
    Clock::time_point due;
  };

  /// Null while nobody wants to be told of events.
  std::shared_ptr<DiskEventSink> wantedSink() const {
    auto sink = sink_.lock();
    return sink && sink->wantsEvents() ? sink : nullptr;
  }

  // --- The reading thread.

  void readEvents() {
    const ipc::UniqueFd poll(epoll_create1(EPOLL_CLOEXEC));
    for (const int descriptor : {wakeReader_.get(), queueDescriptor_}) {
      epoll_event interest{.events = EPOLLIN, .data = {.fd = descriptor}};
      if (descriptor >= 0) epoll_ctl(poll.get(), EPOLL_CTL_ADD, descriptor, &interest);
    }
    while (!isStopping()) {
      epoll_event ready{};
      if (epoll_wait(poll.get(), &ready, 1, -1) != 1 || ready.data.fd != queueDescriptor_) continue;
      static FaultPoint beforeRead("zarn.observer.before-read");
      (void)beforeRead.hit();
      drainQueue();
    }
  }

  void drainQueue() {
    alignas(inotify_event) std::array<char, 65536> buffer;
    for (;;) {
      const ssize_t length = read(queueDescriptor_, buffer.data(), buffer.size());
      if (length <= 0) return;
      handleEvents({buffer.data(), static_cast<std::size_t>(length)});
    }
  }

  void handleEvents(std::string_view events) {
    const auto sink = wantedSink();
    const auto now = Clock::now();
    Seen seen;
    {
      LockGuard guard(mutex_);
      for (std::size_t at = 0; at < events.size();) {
        inotify_event event;
        std::memcpy(&event, events.data() + at, sizeof event);
        const char* const name = events.data() + at + sizeof event;
        if (sink) note(event, name, seen);
        handle(event, name, now);
        at += sizeof event + event.len;
      }
      changed_.notifyAll();
    }
    if (!seen.entries.empty()) sink->entriesDidChange(seen.entries);
    if (seen.lostTrack) sink->didLoseTrack();
  }

  /// What is told outside, by folders as the disk knows them: also of those that are not identified
  /// yet, and of names that no scan looks at.
  void note(const inotify_event& event, const char* name, Seen& seen) REQUIRES(mutex_) {
    if ((event.mask & IN_Q_OVERFLOW) != 0) seen.lostTrack = true;
    constexpr std::uint32_t kNoChange = IN_Q_OVERFLOW | IN_IGNORED | IN_UNMOUNT | IN_DELETE_SELF;
    if ((event.mask & kNoChange) != 0) return;
    const std::uint64_t inode = watches_.inodeOfEvent(event.wd);
    if (inode == 0) return;
    seen.entries.push_back({.folder = inode, .name = event.len == 0 ? "." : name});
  }

  void handle(const inotify_event& event, const char* name, Clock::time_point now)
      REQUIRES(mutex_) {
    if ((event.mask & IN_Q_OVERFLOW) != 0) return handleOverflow();
    const auto folder = watches_.folderOfEvent(event.wd);
    if ((event.mask & IN_IGNORED) != 0) return watches_.didDrop(event.wd);
    if ((event.mask & IN_UNMOUNT) != 0) {
      log_error(defaultLog(), "[ERROR] the drive's file system was unmounted");
      return;
    }
    if (!folder) return;
    if (event.len == 0) return handleFolderItself(event, *folder);
    handleEntry(event, *folder, std::string_view(name), now);
  }

  void handleOverflow() REQUIRES(mutex_) {
    log_default(defaultLog(), "[NOTICE] changes came faster than they could be read, scanning all");
    fullScanDue_ = true;
    dirty_.clear();
  }

  /// The deletion of a folder shows in its parent; but the drive's own roots have none.
  void handleFolderItself(const inotify_event& event, std::uint64_t folder) REQUIRES(mutex_) {
    if (folder < kFirstIssuedID && (event.mask & IN_DELETE_SELF) != 0) fullScanDue_ = true;
  }

  void handleEntry(const inotify_event& event, std::uint64_t folder, std::string_view name,
                   Clock::time_point now) REQUIRES(mutex_) {
    if ((event.mask & ~std::uint32_t{IN_ISDIR}) == IN_MODIFY) {
      return dirty_.noteModify(folder, name, now);
    }
    if ((event.mask & IN_MOVED_FROM) != 0) dirty_.noteMovedFrom(event.cookie, now);
    if ((event.mask & IN_MOVED_TO) != 0) dirty_.noteMovedTo(event.cookie);
    dirty_.noteName(folder, name);
  }

  /// While the whole tree is scanned it is not known yet how many watches are missing.
  void sayAdvice() REQUIRES(mutex_) {
    if (watches_.unwatched().empty() || std::exchange(saidAdvice_, true)) return;
    log_error(defaultLog(), "[ERROR] %@", watches_.advice());
    changed_.notifyAll();
  }

  bool isStopping() const {
    LockGuard guard(mutex_);
    return stopping_;
  }

  // --- The scanning thread.

  struct Task {
    enum class Kind { Stop, All, Dirty, Unwatched };
    Kind kind = Kind::Stop;
    std::vector<DirtyFolder> dirty;
  };

  void scanWhenDue() {
    for (;;) {
      Task task = nextTask();
      switch (task.kind) {
        case Task::Kind::Stop:
          return;
        case Task::Kind::All:
          scanAll();
          break;
        case Task::Kind::Dirty:
          scanDirty(task.dirty);
          break;
        case Task::Kind::Unwatched:
          scanUnwatched(task.dirty);
          break;
      }
    }
  }

  Task nextTask() {
    LockGuard guard(mutex_);
    for (;;) {
      if (stopping_) return {};
      const auto now = Clock::now();
      const auto fullScan = fullScanDue_ ? notBefore_ : Clock::time_point::max();
      const auto dirty = fullScanDue_ ? Clock::time_point::max() : dirtyTime();
      const auto unwatched =
          fullScanDue_ || watches_.unwatched().empty() ? Clock::time_point::max() : nextUnwatched_;
      if (fullScan <= now) return fullScanTask();
      if (dirty <= now) return dirtyTask(now);
      if (unwatched <= now) return unwatchedTask();
      const auto next = std::min({fullScan, dirty, unwatched});
      if (next == Clock::time_point::max()) {
        changed_.wait(mutex_);
      } else {
        changed_.waitUntil(mutex_, next);
      }
    }
  }

  Clock::time_point dirtyTime() const REQUIRES(mutex_) {
    auto due = dirty_.dueTime().value_or(Clock::time_point::max());
    if (!notFound_.empty()) due = std::min(due, notFoundDue_);
    for (const auto& [id, unread] : unread_) {
      if (unread.isDue) due = std::min(due, unread.due);
    }
    return std::max(due, notBefore_);
  }

  Task dirtyTask(Clock::time_point now) REQUIRES(mutex_) {
    for (auto& [id, unread] : unread_) {
      if (!unread.isDue || unread.due > now) continue;
      unread.isDue = false;
      dirty_.noteDeep(id);
    }
    Task task{.kind = Task::Kind::Dirty, .dirty = dirty_.take(now)};
    std::ranges::move(notFound_, std::back_inserter(task.dirty));
    notFound_.clear();
    return task;
  }

  Task fullScanTask() REQUIRES(mutex_) {
    fullScanDue_ = false;
    fullScanRunning_ = true;
    dirty_.clear();
    notFound_.clear();
    unread_.clear();
    return {.kind = Task::Kind::All, .dirty = {}};
  }

  /// A slice of a round over the folders without a watch, so that live changes need not wait for
  /// all of it.
  Task unwatchedTask() REQUIRES(mutex_) {
    if (unwatchedRound_.empty()) {
      unwatchedRound_.assign(watches_.unwatched().begin(), watches_.unwatched().end());
      unwatchedCost_ = {};
    }
    Task task{.kind = Task::Kind::Unwatched, .dirty = {}};
    while (!unwatchedRound_.empty() && task.dirty.size() < kUnwatchedSlice) {
      task.dirty.push_back({.id = unwatchedRound_.back(), .isWhole = true, .names = {}});
      unwatchedRound_.pop_back();
    }
    return task;
  }

  void scanAll() {
    NSErrorRef error = tree_.scanAll();
    const bool failed = error != nullptr;
    noteOutcome(std::move(error), "the scan of the tree");
    {
      LockGuard guard(mutex_);
      fullScanRunning_ = false;
      if (failed) fullScanDue_ = true;
      sayAdvice();
      nextUnwatched_ = Clock::now() + options_.unwatchedInterval;
    }
    if (!failed && !std::exchange(finishedFirstScan_, true) && tree_.didFinishFirstScan) {
      tree_.didFinishFirstScan();
    }
  }

  void scanDirty(const std::vector<DirtyFolder>& dirty) {
    if (dirty.empty()) return;
    std::vector<DirtyFolder> notFound;
    NSErrorRef error = tree_.scanDirty(dirty, notFound);
    const bool failed = error != nullptr;
    noteOutcome(std::move(error), "the scan of changed folders");
    LockGuard guard(mutex_);
    if (failed) {
      for (const auto& folder : dirty) putBack(folder);
    } else if (!notFound.empty()) {
      notFound_ = std::move(notFound);
      notFoundDue_ = Clock::now() + kNotFoundPause;
    }
  }

  void putBack(const DirtyFolder& folder) REQUIRES(mutex_) {
    if (folder.isWhole) dirty_.noteWhole(folder.id);
    if (folder.isDeep) dirty_.noteDeep(folder.id);
    for (const auto& name : folder.names) dirty_.noteName(folder.id, name);
  }

  /// The more a round costs, the rarer it comes.
  void scanUnwatched(const std::vector<DirtyFolder>& folders) {
    const auto before = Clock::now();
    std::vector<DirtyFolder> notFound;  // their turn comes again anyway
    noteOutcome(tree_.scanDirty(folders, notFound), "the scan of folders without a watch");
    const auto after = Clock::now();
    LockGuard guard(mutex_);
    unwatchedCost_ += after - before;
    if (unwatchedRound_.empty()) {
      nextUnwatched_ =
          after + std::max<Clock::duration>(options_.unwatchedInterval,
                                            unwatchedCost_ * options_.unwatchedCostFactor);
    }
    if (watches_.unwatched().empty() && std::exchange(saidAdvice_, false)) {
      log_default(defaultLog(), "[NOTICE] every folder is watched again");
    }
  }

  /// Decides when the next scan may start; a failure is logged when it is not the last one again.
  void noteOutcome(NSErrorRef error, const char* what) {
    LockGuard guard(mutex_);
    if (!error) {
      retryFactor_ = 1;
      lastFailure_ = nullptr;
      notBefore_ = Clock::now() + options_.batchInterval;
      return;
    }
    const bool isSame = lastFailure_ && lastFailure_->is(error->domain(), error->code());
    if (!isSame) {
      log_error(defaultLog(), "[ERROR] %s failed, trying again: %@", what, error);
    }
    notBefore_ = Clock::now() + options_.retryInterval * retryFactor_;
    retryFactor_ = std::min(retryFactor_ * 2, kMaximumRetryFactor);
    lastFailure_ = std::move(error);
  }

  const Options options_;
  ObservedTree tree_;                  // constant once started
  std::weak_ptr<DiskEventSink> sink_;  // constant once set
  const ipc::UniqueFd wakeReader_;

  mutable Mutex mutex_;
  Condition changed_;
  WatchTable watches_ GUARDED_BY(mutex_);
  const int queueDescriptor_;
  DirtyFolders dirty_ GUARDED_BY(mutex_);
  bool stopping_ GUARDED_BY(mutex_) = false;
  bool fullScanDue_ GUARDED_BY(mutex_) = true;
  bool fullScanRunning_ GUARDED_BY(mutex_) = false;
  bool saidAdvice_ GUARDED_BY(mutex_) = false;
  NSErrorRef lastFailure_ GUARDED_BY(mutex_);
  unsigned retryFactor_ GUARDED_BY(mutex_) = 1;
  Clock::time_point notBefore_ GUARDED_BY(mutex_) = Clock::time_point::min();
  Clock::time_point nextUnwatched_ GUARDED_BY(mutex_) = Clock::time_point::min();
  std::unordered_map<std::uint64_t, Unread> unread_ GUARDED_BY(mutex_);
  std::vector<DirtyFolder> notFound_ GUARDED_BY(mutex_);  // moving; tried again a moment later
  Clock::time_point notFoundDue_ GUARDED_BY(mutex_) = Clock::time_point::min();
  std::vector<std::uint64_t> unwatchedRound_ GUARDED_BY(mutex_);  // still to be scanned
  Clock::duration unwatchedCost_ GUARDED_BY(mutex_){};            // of the round so far

  bool finishedFirstScan_ = false;  // scanning thread only
  std::thread reader_;
  std::thread scanner_;
};

TreeObserver::TreeObserver(Options options) : state_(std::make_unique<State>(options)) {}
TreeObserver::~TreeObserver() { stop(); }
void TreeObserver::setEventSink(std::weak_ptr<DiskEventSink> sink) {
  state_->setEventSink(std::move(sink));
}
void TreeObserver::start(ObservedTree tree) { state_->start(std::move(tree)); }
void TreeObserver::stop() { state_->stop(); }
void TreeObserver::requestFullScan() { state_->requestFullScan(); }
TreeObserver::Status TreeObserver::status() const { return state_->status(); }
bool TreeObserver::isWatched(std::uint64_t folder) const { return state_->isWatched(folder); }

void TreeObserver::willReadFolder(std::uint64_t visit, int descriptor) {
  state_->willReadFolder(visit, descriptor);
}
void TreeObserver::didIdentifyFolder(std::uint64_t visit, std::uint64_t id) {
  state_->didIdentifyFolder(visit, id);
}
void TreeObserver::didNotReadFolder(std::uint64_t id) { state_->didNotReadFolder(id); }
void TreeObserver::committed(const std::vector<ItemChange>& changes) { state_->committed(changes); }

}  // namespace yomber
