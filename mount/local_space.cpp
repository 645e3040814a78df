#include "mount/local_space.h"

#include <fts.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <utility>

#include "platform/foundation/date.h"
#include "platform/foundation/file_time.h"
#include "platform/foundation/log.h"

namespace yomber {
namespace {

/// What comes in a burst is looked at once.
constexpr std::chrono::milliseconds kPause{1000};
/// What was refused may be given up later: it was closed, or is in the store now.
constexpr std::chrono::seconds kBetweenAttempts{30};
/// So many of those unused for longest are remembered by one look at the tree.
constexpr std::size_t kCandidates = 10'000;
/// Uses that are remembered; what is older has its date of last access.
constexpr std::size_t kRememberedUses = 100'000;
/// What an evicted file keeps is no content that could be given up.
constexpr std::uint64_t kSmallest = 8192;
constexpr std::uint64_t kBlock = 512;

}  // namespace

LocalSpace::LocalSpace(const Places& places, std::shared_ptr<ContentRequests> requests,
                       std::uint64_t limit)
    : places_(places), requests_(std::move(requests)), limit_(limit), thread_([this] { run(); }) {}

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
  if (uses_.size() >= kRememberedUses) uses_.clear();
  uses_[inode] = NSDate::now().nanoseconds();
}

void LocalSpace::noteGrowth() {
  LockGuard guard(mutex_);
  hasGrown_ = true;
  changed_.notifyAll();
}

bool LocalSpace::isEnding() {
  LockGuard guard(mutex_);
  return isEnding_;
}

void LocalSpace::run() {
  for (;;) {
    {
      LockGuard guard(mutex_);
      while (!hasGrown_ && !isEnding_) changed_.wait(mutex_);
      const auto until = std::chrono::steady_clock::now() + kPause;
      while (!isEnding_ && changed_.waitUntil(mutex_, until)) {
      }
      if (isEnding_) return;
      hasGrown_ = false;
    }
    if (giveUpSome()) continue;
    LockGuard guard(mutex_);
    const auto until = std::chrono::steady_clock::now() + kBetweenAttempts;
    while (!isEnding_ && changed_.waitUntil(mutex_, until)) {
    }
    hasGrown_ = true;
  }
}

bool LocalSpace::giveUpSome() {
  std::vector<File> oldest;
  std::uint64_t total = findUnused(oldest);
  const std::uint64_t before = total;
  for (const File& file : oldest) {
    if (total <= limit_ || isEnding()) break;
    const NSErrorRef error = requests_->stopProviding(file.path);
    struct stat status{};
    if (error || lstat(file.path.c_str(), &status) != 0) continue;
    const std::uint64_t left = static_cast<std::uint64_t>(status.st_blocks) * kBlock;
    total -= std::min(total, file.bytes - std::min(file.bytes, left));
  }
  if (total < before) {
    log_info(defaultLog(), "[INFO] %llu bytes of content were given up, to keep %llu",
             static_cast<unsigned long long>(before - total),
             static_cast<unsigned long long>(limit_));
  }
  if (total <= limit_) return true;
  if (total < before) noteGrowth();  // there may be more than were remembered
  return total < before;
}

/// What all content takes, and the files with content that were not used for the longest time, the
/// oldest first.
std::uint64_t LocalSpace::findUnused(std::vector<File>& oldest) {
  std::uint64_t total = 0;
  std::vector<std::string> bases{places_.base(Places::kRoot).path};
  for (const auto& shown : places_.shownBases()) {
    if (shown.base != Places::kTrash) bases.push_back(places_.base(shown.base).path);
  }
  for (std::string& base : bases) {
    const std::array<char*, 2> paths{base.data(), nullptr};
    FTS* const walk = fts_open(paths.data(), FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV, nullptr);
    if (walk == nullptr) continue;
    for (const FTSENT* entry = fts_read(walk); entry != nullptr; entry = fts_read(walk)) {
      if (isEnding()) break;
      const auto bytes = static_cast<std::uint64_t>(entry->fts_statp->st_blocks) * kBlock;
      if (entry->fts_info != FTS_F || bytes <= kSmallest) continue;
      total += bytes;
      const auto accessed = nanosecondsOf(entry->fts_statp->st_atim);
      oldest.push_back({entry->fts_path, bytes, lastUseOf(entry->fts_statp->st_ino, accessed)});
      std::push_heap(oldest.begin(), oldest.end());
      if (oldest.size() <= kCandidates) continue;
      std::pop_heap(oldest.begin(), oldest.end());
      oldest.pop_back();
    }
    (void)fts_close(walk);
  }
  std::sort_heap(oldest.begin(), oldest.end());
  return total;
}

std::int64_t LocalSpace::lastUseOf(std::uint64_t inode, std::int64_t accessed) {
  LockGuard guard(mutex_);
  const auto found = uses_.find(inode);
  return found == uses_.end() ? accessed : std::max(found->second, accessed);
}

}  // namespace yomber
