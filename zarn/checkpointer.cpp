#include "zarn/checkpointer.h"

#include <utility>

#include "platform/foundation/log.h"

namespace yomber {
namespace {

/// Shorter logs stay until they grow: their index is searched in no time.
constexpr int kShortLogPages = 500;
/// Commits that are as far apart are done for now.
constexpr std::chrono::milliseconds kPause{1'000};
/// The log is written back once it has so many pages, whether commits pause or not.
constexpr int kCheckpointPages = 4000;
/// While commits go on, the log is never written back to its end. From so many pages on the writer
/// does the little that is left itself, so that the log begins anew.
constexpr int kLongLogPages = 20'000;
/// Then it does all of it, so that the log does not grow without bound.
constexpr int kMaximumLogPages = 100'000;

}  // namespace

void Checkpointer::start(WriteBack writeBack) {
  writeBack_ = std::move(writeBack);
  thread_ = std::thread([this] { run(); });
}

void Checkpointer::end() {
  {
    LockGuard guard(mutex_);
    isEnding_ = true;
    changed_.notifyAll();
  }
  thread_.join();
}

bool Checkpointer::didCommit(int logPages) {
  if (logPages < kShortLogPages) return false;
  LockGuard guard(mutex_);
  ++commits_;
  if (logPages > kMaximumLogPages) return true;
  if (logPages > kLongLogPages && std::exchange(isNearlyWrittenBack_, false)) return true;
  const bool isNews = !isPending_ || (logPages >= kCheckpointPages && !isLong_);
  isPending_ = true;
  isLong_ = isLong_ || logPages >= kCheckpointPages;
  if (isNews) changed_.notifyAll();
  return false;
}

/// False when there will be nothing more to do.
bool Checkpointer::waitUntilDue() {
  LockGuard guard(mutex_);
  while (!isPending_ && !isEnding_) changed_.wait(mutex_);
  std::uint64_t seen = commits_ - 1;
  while (!isLong_ && !isEnding_ && seen != commits_) {
    seen = commits_;
    const auto pauseEnds = std::chrono::steady_clock::now() + kPause;
    while (!isLong_ && !isEnding_ && changed_.waitUntil(mutex_, pauseEnds)) {
    }
  }
  isPending_ = false;
  isLong_ = false;
  return !isEnding_;
}

void Checkpointer::run() {
  while (waitUntilDue()) {
    if (const NSErrorRef error = writeBack_()) {
      log_error(defaultLog(), "[ERROR] the database's log could not be written back: %@", error);
      continue;
    }
    LockGuard guard(mutex_);
    isNearlyWrittenBack_ = true;
  }
}

}  // namespace yomber
