#include "zarn/content/job_queue.h"

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"

namespace yomber {
namespace {

/// More than all workers together can hold, so that a page is never all taken.
constexpr std::size_t kWindow = 2048;
/// After which jobs that could not be read are looked for again; ns.
constexpr std::int64_t kReadingPause = 1'000'000'000;

FaultPoint jobsRead("zarn.jobs.read");
FaultPoint jobsUnread("zarn.jobs.unread");

}  // namespace

JobQueue::JobQueue(std::shared_ptr<Database> database, Options options)
    : database_(std::move(database)), options_(std::move(options)) {}

void JobQueue::setAccount(std::int64_t account) {
  LockGuard guard(mutex_);
  account_ = account;
  for (Lane& lane : lanes_) {
    lane.window.clear();
    lane.mayHaveMore = true;
    ++lane.notes;
  }
  wakeAll();
}

std::int64_t JobQueue::account() const {
  LockGuard guard(mutex_);
  return account_;
}

void JobQueue::setStoreOpen(bool isOpen) {
  LockGuard guard(mutex_);
  isStoreOpen_ = isOpen;
  wakeAll();
}

void JobQueue::wakeAll() {
  for (Lane& lane : lanes_) lane.changed.notifyAll();
}

void JobQueue::noteJobs(JobKind kind) {
  LockGuard guard(mutex_);
  lane(kind).mayHaveMore = true;
  ++lane(kind).notes;
  lane(kind).changed.notifyOne();
}

void JobQueue::pushUrgent(std::uint64_t item, std::uint64_t size) {
  LockGuard guard(mutex_);
  if (!urgentItems_.insert(item).second) return;
  Job& job = urgent_.emplace_back();
  job.item = item;
  job.kind = JobKind::Download;
  job.size = size;
  lane(JobKind::Download).changed.notifyOne();
}

bool JobQueue::isOpen(JobKind kind) const {
  const bool needsStore =
      kind == JobKind::Upload || kind == JobKind::Download || kind == JobKind::Thumbnail;
  return isStoreOpen_ || !needsStore;
}

/// What one worker is about to get.
class JobQueue::Taking {
 public:
  explicit Taking(const Portion& portion) : portion_(portion) {}

  [[nodiscard]] bool hasRoomFor(const Job& job) const {
    if (jobs_.empty()) return true;
    return jobs_.size() < portion_.jobs && job.size <= portion_.bytes - bytes_;
  }
  void add(Job job) {
    bytes_ += std::min(job.size, portion_.bytes - bytes_);
    jobs_.push_back(std::move(job));
  }
  [[nodiscard]] bool isEmpty() const { return jobs_.empty(); }
  std::vector<Job> finish() { return std::move(jobs_); }

 private:
  const Portion portion_;
  std::vector<Job> jobs_;
  std::uint64_t bytes_ = 0;
};

void JobQueue::pickUrgent(Taking& taking) {
  for (auto job = urgent_.begin(); job != urgent_.end() && taking.hasRoomFor(*job);) {
    if (running_.contains(job->item)) {
      ++job;
      continue;
    }
    job->account = account_;
    urgentItems_.erase(job->item);
    running_.emplace(job->item, Running{*job, NSProgress::progressWithTotalUnitCount(0)});
    taking.add(std::move(*job));
    job = urgent_.erase(job);
  }
}

std::vector<Job> JobQueue::pick(JobKind kind, const Portion& portion) {
  Taking taking(portion);
  if (kind == JobKind::Download) pickUrgent(taking);
  if (!taking.isEmpty() || !isOpen(kind)) return taking.finish();
  auto& window = lane(kind).window;
  while (!window.empty() && taking.hasRoomFor(window.front())) {
    Job& job = window.front();
    // Who is being worked on comes again with the next page.
    if (!running_.contains(job.item)) {
      running_.emplace(job.item, Running{job, NSProgress::progressWithTotalUnitCount(0)});
      taking.add(std::move(job));
    } else {
      lane(kind).mayHaveMore = true;
      lane(kind).blockedAt = releases_;
    }
    window.pop_front();
  }
  return taking.finish();
}

void JobQueue::refill(JobKind kind) {
  std::int64_t account = 0;
  std::uint64_t notes = 0;
  {
    LockGuard guard(mutex_);
    lane(kind).isReading = true;
    account = account_;
    notes = lane(kind).notes;
  }
  std::vector<Job> page;
  std::optional<std::int64_t> next;
  const std::int64_t now = options_.clock();
  NSErrorRef error = database_->read([&](Connection& connection) {
    page = dueJobs(connection, account, kind, now, kWindow);
    next = nextDue(connection, account, kind, now);
  });
  if (jobsRead.hit()) error = NSError::errorWithErrno(EIO);
  if (error) {
    log_error(defaultLog(), "[ERROR] jobs cannot be read: %@", error);
    page.clear();
    next = now + kReadingPause;
    (void)jobsUnread.hit();
  }
  LockGuard guard(mutex_);
  Lane& its = lane(kind);
  its.isReading = false;
  its.nextDue = next;
  if (account == account_) {
    const bool isAll = page.size() < kWindow && notes == its.notes;
    its.mayHaveMore = !isAll;
    for (Job& job : page) {
      if (running_.contains(job.item)) {
        its.mayHaveMore = true;
        its.blockedAt = releases_;
      } else {
        its.window.push_back(std::move(job));
      }
    }
    if (!its.window.empty() || notes != its.notes) its.blockedAt = ~0ULL;
  }
  its.changed.notifyOne();
}

bool JobQueue::hasWork(JobKind kind) const {
  const Lane& its = lanes_[static_cast<std::size_t>(kind)];
  const bool isUrgent = kind == JobKind::Download && !urgent_.empty();
  return isUrgent || (isOpen(kind) && (its.mayHaveMore || !its.window.empty() || its.isReading));
}

void JobQueue::waitForWork(JobKind kind) {
  auto wait = options_.tick;
  if (const auto due = lane(kind).nextDue) {
    const std::chrono::nanoseconds left(*due - options_.clock());
    const auto rounded =
        std::chrono::duration_cast<std::chrono::milliseconds>(left) + std::chrono::milliseconds(1);
    wait = std::clamp(rounded, std::chrono::milliseconds(0), wait);
  }
  (void)lane(kind).changed.waitUntil(mutex_, std::chrono::steady_clock::now() + wait);
  if (const auto due = lane(kind).nextDue; due && *due <= options_.clock()) {
    lane(kind).nextDue.reset();
    lane(kind).mayHaveMore = true;
    lane(kind).blockedAt = ~0ULL;
  }
}

std::vector<Job> JobQueue::take(JobKind kind, const Portion& portion) {
  for (;;) {
    {
      LockGuard guard(mutex_);
      if (isEnding_) return {};
      auto taken = pick(kind, portion);
      if (!taken.empty()) {
        if (hasWork(kind)) lane(kind).changed.notifyOne();
        return taken;
      }
      const Lane& its = lane(kind);
      const bool isWorthReading = isOpen(kind) && its.mayHaveMore && !its.isReading &&
                                  its.window.empty() && its.blockedAt != releases_;
      if (!isWorthReading) {
        waitForWork(kind);
        continue;
      }
    }
    refill(kind);
  }
}

void JobQueue::release(const std::vector<Job>& jobs) {
  LockGuard guard(mutex_);
  for (const Job& job : jobs) {
    running_.erase(job.item);
    // What was not done, or is to be tried again, is a row as before.
    lane(job.kind).mayHaveMore = true;
    ++lane(job.kind).notes;
  }
  ++releases_;
  for (std::size_t kind = 0; kind < kJobKinds; ++kind) {
    if (hasWork(static_cast<JobKind>(kind))) lanes_[kind].changed.notifyOne();
  }
  released_.notifyAll();
}

std::optional<JobQueue::Running> JobQueue::running(std::uint64_t item) const {
  LockGuard guard(mutex_);
  const auto found = running_.find(item);
  if (found == running_.end()) return std::nullopt;
  return found->second;
}

std::vector<JobQueue::Running> JobQueue::allRunning() const {
  LockGuard guard(mutex_);
  std::vector<Running> result;
  result.reserve(running_.size());
  for (const auto& [item, running] : running_) result.push_back(running);
  return result;
}

void JobQueue::rest(std::chrono::milliseconds length) {
  const auto until = std::chrono::steady_clock::now() + length;
  LockGuard guard(mutex_);
  while (!isEnding_ && ended_.waitUntil(mutex_, until)) {
  }
}

void JobQueue::end() {
  LockGuard guard(mutex_);
  isEnding_ = true;
  wakeAll();
  ended_.notifyAll();
  released_.notifyAll();
}

bool JobQueue::isEnding() const {
  LockGuard guard(mutex_);
  return isEnding_;
}

bool JobQueue::waitUntilIdle(std::chrono::steady_clock::time_point deadline) {
  constexpr std::chrono::milliseconds kLook{5};
  LockGuard guard(mutex_);
  const auto isIdle = [&]() REQUIRES(mutex_) {
    if (!running_.empty() || !urgent_.empty()) return false;
    // Marks that wait to be taken off are nothing to wait for.
    return !hasWork(JobKind::Upload) && !hasWork(JobKind::Download) && !hasWork(JobKind::Evict) &&
           !hasWork(JobKind::Spread) && !hasWork(JobKind::Thumbnail);
  };
  while (!isIdle()) {
    const auto now = std::chrono::steady_clock::now();
    if (now >= deadline) return false;
    (void)released_.waitUntil(mutex_, std::min(deadline, now + kLook));
  }
  return true;
}

}  // namespace yomber
