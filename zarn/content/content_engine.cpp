#include "zarn/content_engine.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <thread>
#include <utility>

#include "platform/foundation/background_thread.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "zarn/content/content_core.h"
#include "zarn/content/shares.h"
#include "zarn/row_queries.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

// What is read together is synced and committed together.
constexpr JobQueue::Portion kUploadsAtOnce{.jobs = 256, .bytes = 64 << 20};
// What is stored and answered together should come together.
constexpr JobQueue::Portion kDownloadsAtOnce{.jobs = 256, .bytes = 1 << 20};
constexpr JobQueue::Portion kEvictionsAtOnce{.jobs = 128};
constexpr JobQueue::Portion kSettlingAtOnce{.jobs = 1024};
constexpr JobQueue::Portion kSpreadingAtOnce{.jobs = 16};
// Whoever wants to read the document meanwhile waits for it.
constexpr JobQueue::Portion kThumbnailsAtOnce{.jobs = 1};

NSErrorRef cancelled() {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError);
}

NSErrorRef noSuchFile(std::string_view path) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError,
                                  {{NSFilePathErrorKey, std::string(path)}});
}

FaultPoint wishTakenBack("zarn.wish.taken-back");

/// A wish that has been answered already.
class GrantedWish final : public ContentWish {
 public:
  [[nodiscard]] NSProgressRef progress() const override {
    return NSProgress::progressWithTotalUnitCount(0);
  }
};

class WaitingWish final : public ContentWish {
 public:
  WaitingWish(std::shared_ptr<ContentCore> core, std::uint64_t item,
              ContentEngine::Completion completion)
      : core_(std::move(core)),
        item_(item),
        number_(core_->wishes.add(item, std::move(completion), progress_)) {}
  ~WaitingWish() override {
    const auto completion = core_->wishes.remove(item_, number_);
    if (!completion) return;
    (void)wishTakenBack.hit();
    completion(cancelled());
  }
  WaitingWish(const WaitingWish&) = delete;
  WaitingWish& operator=(const WaitingWish&) = delete;

  [[nodiscard]] NSProgressRef progress() const override { return progress_; }

 private:
  const std::shared_ptr<ContentCore> core_;
  const std::uint64_t item_;
  NSProgressRef progress_;
  const std::uint64_t number_;
};

/// Returns what is to be called once the jobs count as running no longer.
using Work = std::function<std::function<void()>(ContentCore&, const std::vector<Job>&)>;

Work withNothingAfter(void (*work)(ContentCore&, const std::vector<Job>&)) {
  return [work](ContentCore& core, const std::vector<Job>& jobs) {
    work(core, jobs);
    return [] {};
  };
}

class Engine final : public ContentEngine {
 public:
  Engine(std::shared_ptr<ItemStore> items, std::shared_ptr<Scanner> scanner, Options options)
      : core_(std::make_shared<ContentCore>(std::move(items), std::move(scanner),
                                            std::move(options))),
        shares_(std::make_shared<Shares>(core_,
                                         Shares::Options{.interval = core_->options.sharesPause})) {
    core_->database().setParticipant(core_->participant);
  }
  ~Engine() override { end(); }

  void start() override;
  void stop() override { end(); }
  void setStore(std::shared_ptr<ContentStore> contents, const std::string& account) override {
    core_->setStore(std::move(contents), account);
  }
  void sweep() override;
  void didStamp() override;
  void setTrash(std::function<NSErrorRef(const std::string& path)> trash) override {
    core_->trash = std::move(trash);
  }
  [[nodiscard]] std::shared_ptr<Shares> shares() override { return shares_; }

  [[nodiscard]] std::unique_ptr<ContentWish> startProviding(std::string_view path,
                                                            std::uint64_t options,
                                                            Completion completion) override;
  void evict(std::string_view path, Completion completion) override;
  [[nodiscard]] NSErrorRef setPinned(std::string_view path, bool isPinned) override;
  [[nodiscard]] std::optional<ContentState> contentState(std::string_view path,
                                                         NSErrorRef* error) const override;
  [[nodiscard]] ContentTransfers transfers(std::size_t limit) const override;
  void retryNow() override;
  [[nodiscard]] bool waitUntilIdle(std::chrono::milliseconds patience) override {
    return core_->queue->waitUntilIdle(std::chrono::steady_clock::now() + patience);
  }

 private:
  /// Whether somebody waits for what a worker does.
  enum class Urgency { Asked, Background };
  void addWorkers(JobKind kind, std::size_t count, Urgency urgency, const JobQueue::Portion& atOnce,
                  const Work& work);
  void watchStore();
  void end();
  std::optional<ItemRow> find(std::string_view path, NSErrorRef* error) const;
  [[nodiscard]] ContentTransfer describe(const Job& job) const;

  const std::shared_ptr<ContentCore> core_;
  const std::shared_ptr<Shares> shares_;
  std::vector<std::thread> threads_;
  Mutex mutex_;
  Condition changed_;
  bool isEnding_ GUARDED_BY(mutex_) = false;
};

void Engine::addWorkers(JobKind kind, std::size_t count, Urgency urgency,
                        const JobQueue::Portion& atOnce, const Work& work) {
  for (std::size_t i = 0; i < count; ++i) {
    threads_.emplace_back([core = core_, kind, urgency, atOnce, work] {
      if (urgency == Urgency::Background) giveWayToOthers();
      for (;;) {
        const auto jobs = core->queue->take(kind, atOnce);
        if (jobs.empty()) return;
        const auto after = work(*core, jobs);
        if (core->storingFailure()) core->queue->rest(core->options.offlinePause);
        core->queue->release(jobs);
        after();
      }
    });
  }
}

void Engine::start() {
  const Options& options = core_->options;
  using enum Urgency;
  addWorkers(JobKind::Upload, options.uploadWorkers, Background, kUploadsAtOnce,
             withNothingAfter(doUploads));
  addWorkers(JobKind::Download, options.downloadWorkers, Asked, kDownloadsAtOnce,
             withNothingAfter(doDownloads));
  addWorkers(JobKind::Evict, options.evictWorkers, Asked, kEvictionsAtOnce, doEvictions);
  addWorkers(JobKind::Settle, 1, Background, kSettlingAtOnce, withNothingAfter(doSettling));
  addWorkers(JobKind::Spread, 1, Background, kSpreadingAtOnce, withNothingAfter(doSpreading));
  addWorkers(JobKind::Thumbnail, 1, Background, kThumbnailsAtOnce, withNothingAfter(doThumbnails));
  threads_.emplace_back([this] { watchStore(); });
  shares_->start();
  if (!core_->database().needsFirstScan()) sweep();
}

/// Notices when a store out of reach is back.
void Engine::watchStore() {
  for (;;) {
    {
      LockGuard guard(mutex_);
      if (isEnding_) return;
      (void)changed_.waitUntil(mutex_,
                               std::chrono::steady_clock::now() + core_->options.offlinePause);
      if (isEnding_) return;
    }
    core_->storeAccountAgain();
    if (core_->isOffline()) core_->probe();
  }
}

void Engine::end() {
  {
    LockGuard guard(mutex_);
    isEnding_ = true;
    changed_.notifyAll();
  }
  core_->queue->end();
  shares_->stop();
  for (std::thread& thread : threads_) thread.join();
  threads_.clear();
  for (Wishes* wishes : {&core_->wishes, &core_->evictions}) {
    for (auto& completion : wishes->takeAll()) {
      if (completion) completion(cancelled());
    }
  }
}

/// True when there is no more to sweep for now.
using Sweep = std::function<bool(ContentCore&, WriteTransaction&)>;

/// A part at a time, so that others get their turn.
void sweepOn(const std::shared_ptr<ContentCore>& core, JobKind kind, const Sweep& sweep) {
  const auto isDone = std::make_shared<bool>(true);
  core->database().writeLater(
      [core, isDone, sweep](WriteTransaction& transaction) {
        *isDone = sweep(*core, transaction);
        return NSErrorRef();
      },
      [core, isDone, kind, sweep](const NSErrorRef& error) {
        if (error) log_error(defaultLog(), "[ERROR] documents get no jobs: %@", error);
        core->queue->noteJobs(kind);
        if (!error && !*isDone && !core->queue->isEnding()) sweepOn(core, kind, sweep);
      });
}

void Engine::didStamp() {
  sweepOn(core_, JobKind::Upload, [](ContentCore& core, WriteTransaction& transaction) {
    return core.participant->sweep(transaction);
  });
}

void Engine::sweep() {
  didStamp();
  core_->database().writeLater(
      [core = core_](WriteTransaction& transaction) {
        beginThumbnailSweep(*core, transaction);
        return NSErrorRef();
      },
      [](const NSErrorRef&) {});
  sweepOn(core_, JobKind::Thumbnail, sweepThumbnails);
}

std::optional<ItemRow> Engine::find(std::string_view path, NSErrorRef* error) const {
  NSErrorRef failure;
  auto row = core_->items->itemAtPath(path, &failure);
  if (!row && !failure) row = core_->scanner->scanLocation(path, &failure);
  if (!row) storeError(error, failure ? failure : noSuchFile(path));
  return row;
}

std::unique_ptr<ContentWish> Engine::startProviding(std::string_view path, std::uint64_t options,
                                                    Completion completion) {
  NSErrorRef error;
  const auto row = find(path, &error);
  if (row && row->kind == ItemKind::Document) {
    const auto physical = core_->items->physicalPath(row->id, &error);
    const auto running = core_->queue->running(row->id);
    const bool isLeaving = running && running->job.kind == JobKind::Evict;
    const bool isToCome =
        physical && (isLeaving || (options & kAfterWhatGoesOn) != 0 || isFaultAtPath(*physical));
    if (!physical && !error) error = noSuchFile(path);
    if (isToCome && core_->queue->isEnding()) {
      error = cancelled();
    } else if (isToCome) {
      auto wish = std::make_unique<WaitingWish>(core_, row->id, std::move(completion));
      core_->queue->pushUrgent(row->id, row->size);
      return wish;
    }
  }
  if (completion) completion(error);
  return std::make_unique<GrantedWish>();
}

void Engine::evict(std::string_view path, Completion completion) {
  NSErrorRef error;
  const auto row = find(path, &error);
  if (row && row->kind != ItemKind::Document) {
    error = NSError::errorWithDomain(
        QSOstrellErrorDomain, QSOstrellErrorCannotEvict,
        {{NSLocalizedDescriptionKey, std::string("only documents can be given up")}});
  }
  if (!error && core_->queue->isEnding()) error = cancelled();
  if (error) {
    if (completion) completion(error);
    return;
  }
  NSProgressRef progress;
  (void)core_->evictions.add(row->id, std::move(completion), progress);
  core_->database().writeLater(
      [core = core_, id = row->id](WriteTransaction& transaction) {
        const std::int64_t now = core->now();
        addJob(transaction.connection(), id, JobKind::Evict, core->queue->account(), now, now);
        return NSErrorRef();
      },
      [core = core_, id = row->id](const NSErrorRef& failure) {
        if (!failure) return core->queue->noteJobs(JobKind::Evict);
        for (auto& each : core->evictions.take(id)) {
          if (each) each(failure);
        }
      });
}

NSErrorRef Engine::setPinned(std::string_view path, bool isPinned) {
  NSErrorRef error;
  const auto row = find(path, &error);
  if (!row) return error;
  error = core_->database().write([&](WriteTransaction& transaction) {
    Connection& connection = transaction.connection();
    ContentRow content;
    content.id = row->id;
    content.account = core_->queue->account();
    if (const auto known = findContent(connection, row->id)) content = *known;
    content.isPinned = isPinned;
    storeContent(connection, content);
    const std::int64_t now = core_->now();
    if (row->isFolder()) {
      addJob(connection, row->id, JobKind::Spread, core_->queue->account(), now, now);
    } else if (row->kind == ItemKind::Document) {
      followPins(*core_, connection, *row, yomber::isPinned(connection, row->id));
    }
    return NSErrorRef();
  });
  core_->queue->noteJobs(JobKind::Spread);
  core_->queue->noteJobs(JobKind::Download);
  return error;
}

std::optional<ContentState> Engine::contentState(std::string_view path, NSErrorRef* error) const {
  NSErrorRef failure;
  const auto row = find(path, &failure);
  const auto physical = row ? core_->items->physicalPath(row->id, &failure) : std::nullopt;
  if (!physical) {
    storeError(error, failure ? failure : noSuchFile(path));
    return std::nullopt;
  }
  ContentState state;
  state.size = row->size;
  struct stat status{};
  constexpr std::uint64_t kBlock = 512;
  if (lstat(physical->c_str(), &status) == 0) {
    state.localBytes = static_cast<std::uint64_t>(status.st_blocks) * kBlock;
  }
  const auto running = core_->queue->running(row->id);
  const bool isDocument = row->kind == ItemKind::Document;
  if (isDocument && isFaultAtPath(*physical)) state.local = ContentState::Local::Fault;
  if (running && running->job.kind == JobKind::Evict) state.local = ContentState::Local::Evicting;
  if (running && running->job.kind == JobKind::Download && state.local != ContentState::Local::Here)
    state.local = ContentState::Local::Downloading;
  bool isBehind = false;
  failure = core_->database().read([&](Connection& connection) {
    state.isPinned = isPinned(connection, row->id);
    const auto upload = findJob(connection, row->id, JobKind::Upload);
    const auto download = findJob(connection, row->id, JobKind::Download);
    if (download) state.lastFailure = download->error;
    if (upload && upload->error) state.lastFailure = upload->error;
    if (!state.lastFailure && (upload || download)) state.lastFailure = core_->storingFailure();
    if (!isDocument) return;
    const auto content = findContent(connection, row->id);
    // What was written a moment ago may not have been scanned yet.
    const bool isAsOnDisk = running || state.local == ContentState::Local::Fault ||
                            (content && content->stamp.hasSameContent(FileStamp::of(status)));
    isBehind = content && !upload && !isAsOnDisk;
    const bool isStored = isAsOnDisk && content && !upload && isConfirmed(*row, *content);
    state.upload = isStored ? ContentState::Upload::Confirmed : ContentState::Upload::Waiting;
  });
  if (running && running->job.kind == JobKind::Upload)
    state.upload = ContentState::Upload::Uploading;
  // Not every change is told of.
  constexpr std::int64_t kLongestTelling = 1'000'000'000;
  if (isBehind && core_->now() - FileStamp::of(status).ctime > kLongestTelling) {
    (void)core_->scanner->scanLocation(path);
  }
  storeError(error, failure);
  if (failure) return std::nullopt;
  return state;
}

ContentTransfer Engine::describe(const Job& job) const {
  ContentTransfer result;
  result.item = job.item;
  result.kind = static_cast<ContentTransfer::Kind>(job.kind);
  result.attempts = job.attempts;
  result.failure = job.error;
  const bool isGivenUp = job.due == kNeverDue;
  if (job.state != JobState::Waiting && !isGivenUp) result.nextAttempt = job.due;
  if (auto found = core_->items->located(job.item)) {
    result.path = std::move(found->path);
    result.total = found->row.size;
  }
  return result;
}

ContentTransfers Engine::transfers(std::size_t limit) const {
  ContentTransfers result;
  for (const JobQueue::Running& running : core_->queue->allRunning()) {
    if (running.job.kind >= JobKind::Settle || result.transfers.size() >= limit) continue;
    ContentTransfer transfer = describe(running.job);
    transfer.isRunning = true;
    transfer.nextAttempt.reset();
    transfer.done = static_cast<std::uint64_t>(running.progress->completedUnitCount());
    result.transfers.push_back(std::move(transfer));
  }
  std::vector<Job> failed;
  (void)core_->database().read([&](Connection& connection) {
    const std::int64_t account = core_->queue->account();
    failed = failedJobs(connection, account, limit);
    result.waiting = countJobs(connection, account) + countUnswept(connection);
  });
  const std::size_t running = result.transfers.size();
  for (const Job& job : failed) {
    if (result.transfers.size() >= limit) break;
    const bool isListed = std::any_of(
        result.transfers.begin(), result.transfers.begin() + static_cast<std::ptrdiff_t>(running),
        [&](const ContentTransfer& each) { return each.item == job.item; });
    if (!isListed) result.transfers.push_back(describe(job));
  }
  result.finished = core_->finished.load();
  result.isOffline = core_->isOffline();
  return result;
}

void Engine::retryNow() {
  core_->probe();
  const NSErrorRef error = core_->database().write([&](WriteTransaction& transaction) {
    makeAllDue(transaction.connection(), core_->queue->account(), core_->now());
    return NSErrorRef();
  });
  if (error) log_error(defaultLog(), "[ERROR] jobs cannot be tried now: %@", error);
  for (std::size_t kind = 0; kind < kJobKinds; ++kind)
    core_->queue->noteJobs(static_cast<JobKind>(kind));
}

}  // namespace

std::shared_ptr<ContentEngine> ContentEngine::create(std::shared_ptr<ItemStore> items,
                                                     std::shared_ptr<Scanner> scanner,
                                                     Options options) {
  return std::make_shared<Engine>(std::move(items), std::move(scanner), std::move(options));
}

}  // namespace yomber
