#include "mount/request_loop.h"

#include <poll.h>
#include <sched.h>

#include <cerrno>
#include <cstdlib>
#include <system_error>
#include <utility>

namespace yomber {
namespace {

using Clock = std::chrono::steady_clock;

/// For how long the next request is looked out for at most: less than it costs to sleep and to be
/// woken.
constexpr std::chrono::microseconds kLongestLookOut{50};
/// Below that it is not worth while.
constexpr std::chrono::microseconds kShortestLookOut{5};
/// So many requests in a row that were there already are a queue.
constexpr unsigned kQueue = 4;

std::chrono::microseconds longestLookOut() {
  static const bool isAlone = std::thread::hardware_concurrency() < 2;
  return isAlone ? std::chrono::microseconds(0) : kLongestLookOut;
}

/// A buffer whose memory the library allocates when it is first read into.
class RequestBuffer {
 public:
  ~RequestBuffer() { std::free(buffer.mem); }
  RequestBuffer() = default;
  RequestBuffer(const RequestBuffer&) = delete;
  RequestBuffer& operator=(const RequestBuffer&) = delete;
  fuse_buf buffer{};
};

}  // namespace

RequestLoop::RequestLoop(Source source, unsigned mostThreads)
    : source_(std::move(source)), mostThreads_(mostThreads) {}

RequestLoop::~RequestLoop() = default;

int RequestLoop::run() {
  work();
  for (;;) {
    std::vector<std::thread> ended;
    {
      LockGuard guard(mutex_);
      if (others_.empty()) return failure_;
      ended.swap(others_);
    }
    for (std::thread& thread : ended) thread.join();
  }
}

void RequestLoop::work() {
  RequestBuffer request;
  while (waitForTurn()) {
    do {
      const int size = read(request.buffer);
      if (size <= 0) return end(-size);
    } while (answer(request.buffer));
  }
}

/// Waits idly until the turn is this thread's; false when all is over. One of those who wait looks
/// after long answers.
bool RequestLoop::waitForTurn() {
  LockGuard guard(mutex_);
  ++idle_;
  while (!isVacant_ && !isOver_) {
    if (hasWatcher_) {
      changed_.wait(mutex_);
    } else {
      hasWatcher_ = true;
      watch();
      hasWatcher_ = isWatched_ = false;
    }
  }
  --idle_;
  if (isOver_) return false;
  takeTurn();
  return true;
}

void RequestLoop::takeTurn() {
  isVacant_ = false;
  state_.store((state_.load() | kAnswering) + 1);
  if (idle_ == 0) addThread();
}

/// Somebody has to be there to take the turn next. Where the system has no more threads, that is
/// whoever has answered.
void RequestLoop::addThread() {
  if (isOver_ || others_.size() + 1 >= mostThreads_) return;
  try {
    others_.emplace_back([this] { work(); });
  } catch (const std::system_error&) {
  }
}

/// Until the turn is vacant. Sleeps while nothing is asked; looks every moment while something is.
void RequestLoop::watch() {
  State before = state_.load();
  while (!isVacant_ && !isOver_) {
    isWatched_ = true;
    (void)changed_.waitUntil(mutex_, Clock::now() + kMoment);
    State now = state_.load();
    if (now != before) {
      before = now;
    } else if ((now & kAnswering) != 0) {
      // What it answers goes on without the turn.
      if (state_.compare_exchange_strong(now, now + 1)) isVacant_ = true;
    } else {
      isWatched_ = false;
      while (!isWatched_ && state_.load() == before && !isVacant_ && !isOver_) {
        changed_.wait(mutex_);
      }
    }
  }
}

int RequestLoop::read(fuse_buf& request) {
  for (;;) {
    int size = source_.receive(request);
    if (size == -EAGAIN) {
      inARow_ = 0;
      size = lookOut(request);
    } else {
      ++inARow_;
    }
    if (size != -EINTR && size != -EAGAIN) return size;
  }
}

int RequestLoop::lookOut(fuse_buf& request) {
  const auto began = Clock::now();
  while (Clock::now() - began < lookOut_) {
    (void)sched_yield();
    const int size = source_.receive(request);
    if (size != -EAGAIN) return size;
  }
  if (lookOut_.count() > 0) {
    lookOut_ = lookOut_ / 2 < kShortestLookOut ? std::chrono::microseconds(0) : lookOut_ / 2;
  }
  pollfd device{.fd = source_.device, .events = POLLIN, .revents = 0};
  (void)poll(&device, 1, -1);
  if (Clock::now() - began < longestLookOut()) lookOut_ = longestLookOut();
  return source_.receive(request);
}

bool RequestLoop::answer(const fuse_buf& request) {
  if (inARow_ >= kQueue || source_.mayTakeLong(request)) {
    passOn();
    source_.answer(request);
    return false;
  }
  const State answering = (state_.load() + kNext) | kAnswering;
  state_.store(answering);
  if (!isWatched_.load()) wakeWatcher();
  source_.answer(request);
  State mine = answering;
  return state_.compare_exchange_strong(mine, answering + 1);
}

void RequestLoop::wakeWatcher() {
  LockGuard guard(mutex_);
  if (isWatched_.exchange(true)) return;
  changed_.notifyAll();
}

void RequestLoop::passOn() {
  LockGuard guard(mutex_);
  isVacant_ = true;
  if (idle_ > 0) {
    changed_.notifyOne();
  } else {
    addThread();
  }
}

void RequestLoop::end(int failure) {
  LockGuard guard(mutex_);
  isOver_ = true;
  failure_ = failure;
  changed_.notifyAll();
}

}  // namespace yomber
