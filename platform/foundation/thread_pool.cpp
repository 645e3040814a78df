#include "platform/foundation/thread_pool.h"

#include <malloc.h>
#include <pthread.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <deque>
#include <optional>
#include <system_error>
#include <thread>
#include <utility>

#include "platform/foundation/lock.h"
#include "platform/foundation/log.h"

namespace yomber {

struct ThreadPool::State : std::enable_shared_from_this<ThreadPool::State> {
  explicit State(Limits givenLimits) : limits(givenLimits) {
    // Every submitted item must find a thread one day.
    limits.maximumThreads = std::max<std::size_t>(limits.maximumThreads, 1);
    limits.promptThreads = std::clamp<std::size_t>(limits.promptThreads, 1, limits.maximumThreads);
  }

  Limits limits;  // not changed after construction

  mutable Mutex mutex;
  Condition workArrived;    ///< for idle threads: there is work, or the pool closes
  Condition stallPossible;  ///< for the monitor: work waits, or the pool closes
  Condition threadEnded;    ///< for the destructor
  std::deque<std::function<void()>> work GUARDED_BY(mutex);
  std::size_t threads GUARDED_BY(mutex) = 0;
  std::size_t idle GUARDED_BY(mutex) = 0;
  std::size_t arriving GUARDED_BY(mutex) = 0;   ///< started, and not yet at the queue
  std::uint64_t started GUARDED_BY(mutex) = 0;  ///< items taken from the queue so far
  bool monitorRuns GUARDED_BY(mutex) = false;
  bool boundWasLogged GUARDED_BY(mutex) = false;
  bool closing GUARDED_BY(mutex) = false;
  /// When those that were more than are kept have ended: so much later, memory is given back.
  std::optional<std::chrono::steady_clock::time_point> burstEnded GUARDED_BY(mutex);
};

namespace {

using Limits = ThreadPool::Limits;

void nameThread(const char* name) { pthread_setname_np(pthread_self(), name); }

}  // namespace

/// The threads' own code; they share the state, so that it outlives the pool object.
class PoolThreads {
 public:
  using State = ThreadPool::State;

  /// Starts one more thread. False when the system refuses.
  static bool startThread(State& state) REQUIRES(state.mutex) {
    try {
      std::thread([held = state.shared_from_this()] { threadMain(*held); }).detach();
    } catch (const std::system_error&) {
      return false;
    }
    ++state.threads;
    ++state.arriving;
    return true;
  }

  static void startMonitorOnce(State& state) REQUIRES(state.mutex) {
    if (state.monitorRuns) return;
    try {
      std::thread([held = state.shared_from_this()] { monitorMain(*held); }).detach();
      state.monitorRuns = true;
    } catch (const std::system_error&) {
      return;  // tried again with the next item
    }
  }

 private:
  static void threadMain(State& state) {
    nameThread("yomber-pool");
    state.mutex.lock();
    --state.arriving;
    while (true) {
      if (!state.work.empty()) {
        runNext(state);
      } else if (state.closing || !waitForWork(state)) {
        break;
      }
    }
    --state.threads;
    state.burstEnded = std::chrono::steady_clock::now();
    state.threadEnded.notifyAll();
    state.workArrived.notifyOne();
    if (state.closing) state.stallPossible.notifyAll();
    state.mutex.unlock();
  }

  static void runNext(State& state) REQUIRES(state.mutex) {
    auto work = std::move(state.work.front());
    state.work.pop_front();
    ++state.started;
    if (state.work.empty()) state.boundWasLogged = false;
    state.mutex.unlock();
    work();
    work = nullptr;  // what it holds goes before the thread counts as free
    state.mutex.lock();
  }

  /// False when the thread has been idle for so long that it ends.
  static bool waitForWork(State& state) REQUIRES(state.mutex) {
    const auto deadline = std::chrono::steady_clock::now() + state.limits.idleTime;
    ++state.idle;
    bool timeLeft = true;
    while (state.work.empty() && !state.closing && timeLeft) {
      if (state.idle > state.limits.keptIdleThreads) {
        timeLeft = state.workArrived.waitUntil(state.mutex, deadline) ||
                   state.idle <= state.limits.keptIdleThreads;
      } else if (!state.burstEnded) {
        state.workArrived.wait(state.mutex);
      } else if (!state.workArrived.waitUntil(state.mutex,
                                              *state.burstEnded + state.limits.idleTime)) {
        giveMemoryBack(state);
      }
    }
    --state.idle;
    return timeLeft || !state.work.empty();
  }

  /// What many at once have freed lies between what is still in use, and would stay with us. Not
  /// when the last of them ends: the others may still be about to free theirs.
  static void giveMemoryBack(State& state) REQUIRES(state.mutex) {
    const bool isDue = state.burstEnded && std::chrono::steady_clock::now() >=
                                               *state.burstEnded + state.limits.idleTime;
    if (!isDue || !state.work.empty() || state.closing) return;
    state.burstEnded.reset();
    --state.idle;
    state.mutex.unlock();
    (void)malloc_trim(0);
    state.mutex.lock();
    ++state.idle;
  }

  /// Watches the queue: work that waits although nothing has moved means that every thread is
  /// blocked, and then more threads are started, twice as many each time while work waits.
  static void monitorMain(State& state) {
    nameThread("yomber-poolwtch");
    LockGuard guard(state.mutex);
    std::size_t step = 1;
    while (true) {
      while (state.work.empty() && !state.closing) {
        step = 1;
        state.stallPossible.wait(state.mutex);
      }
      if (state.closing && state.work.empty()) break;
      const std::uint64_t before = state.started;
      const auto until = std::chrono::steady_clock::now() + state.limits.stallTime;
      while (!(state.closing && state.work.empty()) &&
             state.stallPossible.waitUntil(state.mutex, until)) {
      }
      if (state.work.size() <= state.arriving || state.started != before) continue;
      grow(state, step);
      step = std::min<std::size_t>(step * 2, 32);
    }
    state.monitorRuns = false;
    state.threadEnded.notifyAll();
  }

  static void grow(State& state, std::size_t step) REQUIRES(state.mutex) {
    const std::size_t room = state.limits.maximumThreads - state.threads;
    const std::size_t wanted = std::min({step, room, state.work.size() - state.arriving});
    for (std::size_t i = 0; i < wanted; ++i) {
      if (!startThread(state)) {
        reportBound(state);
        return;
      }
    }
    if (room == 0) reportBound(state);
  }

  static void reportBound(State& state) REQUIRES(state.mutex) {
    if (std::exchange(state.boundWasLogged, true)) return;
    const std::uint64_t threads = state.threads;
    const std::uint64_t waiting = state.work.size();
    state.mutex.unlock();
    log_fault(defaultLog(),
              "[CRIT] all %llu threads of the pool are blocked and no more can be started; %llu "
              "items wait",
              threads, waiting);
    state.mutex.lock();
  }
};

ThreadPool::ThreadPool(Limits limits) : state_(std::make_shared<State>(limits)) {}

ThreadPool::~ThreadPool() {
  LockGuard guard(state_->mutex);
  state_->closing = true;
  state_->workArrived.notifyAll();
  state_->stallPossible.notifyAll();
  while (state_->threads > 0 || state_->monitorRuns) state_->threadEnded.wait(state_->mutex);
}

ThreadPool& ThreadPool::shared() {
  static ThreadPool& pool = *new ThreadPool([] {
    Limits limits;
    limits.promptThreads =
        std::max<std::size_t>(limits.promptThreads, 2 * std::thread::hardware_concurrency());
    return limits;
  }());
  return pool;
}

void ThreadPool::async(std::function<void()> work) {
  State& state = *state_;
  bool isThreadIdle = false;
  bool mayStall = false;
  {
    LockGuard guard(state.mutex);
    state.work.push_back(std::move(work));
    isThreadIdle = state.idle > 0;
    if (state.idle + state.arriving < state.work.size()) {
      mayStall = state.threads >= state.limits.promptThreads || !PoolThreads::startThread(state);
      if (mayStall) PoolThreads::startMonitorOnce(state);
    }
  }
  // Not under the lock: it is the first thing that whoever wakes up takes.
  if (isThreadIdle) state.workArrived.notifyOne();
  if (mayStall) state.stallPossible.notifyOne();
}

std::size_t ThreadPool::threadCount() const {
  LockGuard guard(state_->mutex);
  return state_->threads;
}

}  // namespace yomber
