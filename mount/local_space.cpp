#include "mount/local_space.h"

#include <sys/stat.h>

#include <algorithm>
#include <utility>

#include "mount/content_requests.h"
#include "mount/content_walk.h"
#include "platform/foundation/date.h"
#include "platform/foundation/log.h"

namespace yomber {
namespace {

/// So many of those unused for longest are remembered by one look at the tree.
constexpr std::size_t kCandidates = 10'000;
/// So many that were refused are asked for again.
constexpr std::size_t kRetried = 1'000;
/// Uses that are remembered, twice; what is older has its date of last access.
constexpr std::size_t kRememberedUses = 16'384;
/// This part of the bound is given up besides.
constexpr std::uint64_t kBesides = 16;
/// A look at what others change is so much shorter than the pause before the next.
constexpr int kPauses = 50;

}  // namespace

LocalSpace::LocalSpace(const Places& places, GiveUp giveUp, std::uint64_t limit, Pace pace)
    : places_(places),
      giveUp_(std::move(giveUp)),
      limit_(limit),
      enough_(limit - limit / kBesides),
      pace_(pace),
      retryPause_(pace.firstRetry),
      thread_([this] { run(); }) {}

LocalSpace::~LocalSpace() {
  {
    LockGuard guard(mutex_);
    isEnding_ = true;
    changed_.notifyAll();
  }
  thread_.join();
}

void LocalSpace::noteUse(std::uint64_t inode) {
  LockGuard guard(mutex_);
  if (uses_.size() >= kRememberedUses) usesBefore_ = std::exchange(uses_, {});
  uses_[inode] = NSDate::now().nanoseconds();
}

void LocalSpace::noteGrowth(std::uint64_t bytes) {
  LockGuard guard(mutex_);
  grown_ += bytes;
  changed_.notifyAll();
}

void LocalSpace::noteChange() {
  LockGuard guard(mutex_);
  if (std::exchange(hasChanged_, true)) return;
  changed_.notifyAll();
}

std::uint64_t LocalSpace::looks() const {
  LockGuard guard(mutex_);
  return looks_;
}

bool LocalSpace::isStuck() const {
  LockGuard guard(mutex_);
  return isStuck_;
}

bool LocalSpace::isEnding() const {
  LockGuard guard(mutex_);
  return isEnding_;
}

void LocalSpace::run() {
  for (;;) {
    switch (waitForWork()) {
      case Work::End:
        return;
      case Work::Look:
        lookThrough();
        break;
      case Work::Retry:
        retry();
        break;
    }
  }
}

LocalSpace::Work LocalSpace::waitForWork() {
  LockGuard guard(mutex_);
  while (!isEnding_) {
    const auto now = Clock::now();
    const auto work = due(now);
    if (work == Work::Retry) return Work::Retry;
    if (work) {
      while (!isEnding_ && changed_.waitUntil(mutex_, now + pace_.burst)) {
      }
      return isEnding_ ? Work::End : Work::Look;
    }
    if (!hasChanged_ && !isStuck_) {
      changed_.wait(mutex_);
    } else if (!hasChanged_ || (isStuck_ && nextRetry_ < nextLook())) {
      (void)changed_.waitUntil(mutex_, nextRetry_);
    } else {
      (void)changed_.waitUntil(mutex_, nextLook());
    }
  }
  return Work::End;
}

std::optional<LocalSpace::Work> LocalSpace::due(Clock::time_point now) const {
  if (looks_ == 0 || (!isStuck_ && total_ + grown_ > limit_)) return Work::Look;
  if (isStuck_ && grown_ > limit_ / kBesides) return Work::Look;
  if (hasChanged_ && now >= nextLook()) return Work::Look;
  if (isStuck_ && now >= nextRetry_) return Work::Retry;
  return std::nullopt;
}

/// At what others have changed.
LocalSpace::Clock::time_point LocalSpace::nextLook() const {
  return lastLook_ + std::max<Clock::duration>(pace_.others, lookTook_ * kPauses);
}

void LocalSpace::lookThrough() {
  refused_.clear();
  Progress progress;
  for (bool goesOn = true; goesOn && !isEnding();) {
    std::vector<File> oldest;
    const bool areAll = find(progress, oldest);
    goesOn = progress.total > limit_ && giveUpOldest(oldest, progress) && progress.total > limit_ &&
             !areAll;
  }
  if (progress.given > 0) {
    log_info(defaultLog(), "[INFO] %llu bytes of content were given up, to keep %llu",
             static_cast<unsigned long long>(progress.given),
             static_cast<unsigned long long>(limit_));
  }
  LockGuard guard(mutex_);
  total_ = progress.total;
  const bool wasStuck = std::exchange(isStuck_, total_ > limit_);
  if (isStuck_ && !wasStuck && !isEnding_) {
    log_default(defaultLog(),
                "[NOTICE] %llu bytes of content are here, to keep %llu: nothing more can be given "
                "up now",
                static_cast<unsigned long long>(total_), static_cast<unsigned long long>(limit_));
  }
  if (!isStuck_ || progress.given > 0) retryPause_ = pace_.firstRetry;
  nextRetry_ = Clock::now() + retryPause_;
}

/// What all content takes, and the files that were not used for the longest time, the oldest first,
/// of those behind the ones that were tried. Whether these are all.
bool LocalSpace::find(Progress& progress, std::vector<File>& oldest) {
  const auto begun = Clock::now();
  {
    LockGuard guard(mutex_);
    ++looks_;
    grown_ = 0;
    hasChanged_ = false;
  }
  progress.total = 0;
  bool areAll = true;
  std::vector<std::uint32_t> bases{Places::kRoot};
  for (const auto& shown : places_.shownBases()) bases.push_back(shown.base);
  for (const std::uint32_t base : bases) {
    walkContent(places_.base(base).path, [&](ContentFile&& found) {
      progress.total += found.bytes;
      const Age age{lastUseOf(found.inode, found.accessed), found.inode};
      if (progress.tried && age <= *progress.tried) return !isEnding();
      oldest.push_back({age, base, std::move(found.path), found.bytes});
      std::push_heap(oldest.begin(), oldest.end());
      if (oldest.size() > kCandidates) {
        std::pop_heap(oldest.begin(), oldest.end());
        oldest.pop_back();
        areAll = false;
      }
      return !isEnding();
    });
  }
  std::sort_heap(oldest.begin(), oldest.end());
  LockGuard guard(mutex_);
  lastLook_ = Clock::now();
  lookTook_ = lastLook_ - begun;
  return areAll;
}

/// False when the store is out of reach: nothing can be given up then.
bool LocalSpace::giveUpOldest(std::vector<File>& oldest, Progress& progress) {
  for (File& file : oldest) {
    if (progress.total <= enough_ || isEnding()) break;
    progress.tried = file.age;
    const NSErrorRef error = giveUp_(locationOf(file));
    if (!error) {
      const std::uint64_t less = file.bytes - std::min(file.bytes, contentBytesAt(file.path));
      progress.given += less;
      progress.total -= std::min(progress.total, less);
    } else {
      if (refused_.size() < kRetried) refused_.push_back(std::move(file));
      if (errnoOf(error) == ENETUNREACH) return false;
    }
  }
  return true;
}

/// Where one of those that were refused can be given up now, or was used, all are looked at again.
void LocalSpace::retry() {
  bool isOther = false;
  for (const File& file : refused_) {
    if (isEnding()) return;
    isOther = lastUseOf(file.age.inode, file.age.lastUse) != file.age.lastUse;
    if (isOther) break;
    const NSErrorRef error = giveUp_(locationOf(file));
    isOther = !error;
    if (isOther || errnoOf(error) == ENETUNREACH) break;
  }
  LockGuard guard(mutex_);
  retryPause_ = isOther ? Clock::duration(pace_.firstRetry)
                        : std::min<Clock::duration>(retryPause_ * 2, pace_.longestRetry);
  nextRetry_ = Clock::now() + retryPause_;
  if (isOther) isStuck_ = false;
}

/// As the drive has it: some names on the disk are others.
std::string LocalSpace::locationOf(const File& file) const {
  std::string onDisk = places_.base(file.base).path;
  std::string location = onDisk;
  for (std::size_t at = onDisk.size(); at < file.path.size();) {
    const std::size_t end = std::min(file.path.find('/', at + 1), file.path.size());
    const std::string name = file.path.substr(at + 1, end - at - 1);
    struct stat folder{};
    const bool isThere = lstat(onDisk.c_str(), &folder) == 0;
    location += "/" + (isThere ? places_.shownName(folder.st_ino, name) : name);
    onDisk = file.path.substr(0, end);
    at = end;
  }
  return location;
}

std::int64_t LocalSpace::lastUseOf(std::uint64_t inode, std::int64_t accessed) const {
  LockGuard guard(mutex_);
  for (const auto* uses : {&uses_, &usesBefore_}) {
    if (const auto found = uses->find(inode); found != uses->end())
      return std::max(found->second, accessed);
  }
  return accessed;
}

}  // namespace yomber
