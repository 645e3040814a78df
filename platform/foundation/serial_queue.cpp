#include "platform/foundation/serial_queue.h"

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <deque>

#include "platform/foundation/lock.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {
namespace {

/// A thread that waits in `sync` for its turn. Lives on that thread's stack.
struct Waiter {
  Mutex mutex;
  Condition granted;
  bool isGranted GUARDED_BY(mutex) = false;

  void grant() {
    LockGuard guard(mutex);
    isGranted = true;
    granted.notifyOne();  // under the lock: once it is left, the waiter may be gone
  }
  void wait() {
    LockGuard guard(mutex);
    while (!isGranted) granted.wait(mutex);
  }
};

/// What stands in line: a work item, or a thread that runs its own work when its turn comes.
struct Entry {
  std::function<void()> work;
  Waiter* waiter = nullptr;
};

thread_local const SerialQueueFrame* currentFrame = nullptr;

bool isRunning(const void* queue) {
  for (const SerialQueueFrame* frame = currentFrame; frame != nullptr; frame = frame->outer) {
    if (frame->queue == queue) return true;
  }
  return false;
}

[[noreturn]] void fail(const std::string& label, const char* what) {
  std::fprintf(stderr, "serial queue \"%s\": %s\n", label.c_str(), what);
  std::abort();
}

/// One more round of the pool's other work after so many items.
constexpr int kItemsInOneGo = 64;

}  // namespace

/// Whoever moves the phase away from Idle owns the queue: runs an item, and then hands it on.
struct SerialQueue::State : std::enable_shared_from_this<SerialQueue::State> {
  /// Idle and Busy change into each other without the mutex, and nothing waits in either. Waiting
  /// is entered and left with the mutex held, by the owner or while it is busy.
  enum class Phase : std::uint8_t { Idle, Busy, Waiting };

  explicit State(std::string givenLabel) : label(std::move(givenLabel)) {}

  const std::string label;
  std::atomic<Phase> phase{Phase::Idle};
  Mutex mutex;
  std::deque<Entry> entries GUARDED_BY(mutex);

  bool tryEnter() {
    Phase expected = Phase::Idle;
    return phase.compare_exchange_strong(expected, Phase::Busy, std::memory_order_acquire,
                                         std::memory_order_relaxed);
  }

  /// Called by the owner after it ran its item.
  void leave() {
    Phase expected = Phase::Busy;
    if (!phase.compare_exchange_strong(expected, Phase::Idle, std::memory_order_release,
                                       std::memory_order_relaxed)) {
      handOn();
    }
  }

  /// Gives the queue to the next in line, or leaves it idle.
  void handOn() {
    Waiter* next = nullptr;
    {
      LockGuard guard(mutex);
      if (entries.empty()) {
        phase.store(Phase::Idle, std::memory_order_release);
        return;
      }
      next = entries.front().waiter;
      if (next != nullptr) entries.pop_front();
    }
    if (next != nullptr) {
      next->grant();
    } else {
      startDraining();
    }
  }

  void startDraining() {
    ThreadPool::shared().async([self = shared_from_this()] { self->drain(); });
  }

  /// Runs items on a thread of the pool, as the owner, until a waiting thread's turn comes.
  void drain() {
    for (int i = 0; i < kItemsInOneGo; ++i) {
      std::function<void()> work;
      {
        LockGuard guard(mutex);
        if (entries.empty() || entries.front().waiter != nullptr) break;
        work = std::move(entries.front().work);
        entries.pop_front();
      }
      const SerialQueueFrame frame{this, currentFrame};
      currentFrame = &frame;
      work();
      work = nullptr;  // what it holds goes while the queue is still ours
      currentFrame = frame.outer;
    }
    handOn();
  }

  /// Puts `entry` in line. False when the queue was idle: then the caller owns it instead.
  bool standInLine(Entry& entry) REQUIRES(mutex) {
    while (phase.load(std::memory_order_relaxed) != Phase::Waiting) {
      if (tryEnter()) return false;
      Phase expected = Phase::Busy;
      if (phase.compare_exchange_strong(expected, Phase::Waiting, std::memory_order_relaxed)) break;
    }
    entries.push_back(std::move(entry));
    return true;
  }

  void waitForTurn() {
    if (isRunning(this)) fail(label, "sync was called by an item of this very queue");
    Waiter waiter;
    Entry entry{{}, &waiter};
    {
      LockGuard guard(mutex);
      if (!standInLine(entry)) return;
    }
    waiter.wait();
  }
};

SerialQueue::SerialQueue(std::string label) : state_(std::make_shared<State>(std::move(label))) {}

SerialQueue::~SerialQueue() = default;

std::shared_ptr<SerialQueue> SerialQueue::create(std::string label) {
  return std::shared_ptr<SerialQueue>(new SerialQueue(std::move(label)));
}

void SerialQueue::async(std::function<void()> work) {
  Entry entry{std::move(work), nullptr};
  {
    LockGuard guard(state_->mutex);
    if (state_->standInLine(entry)) return;
    state_->phase.store(State::Phase::Waiting, std::memory_order_relaxed);
    state_->entries.push_back(std::move(entry));
  }
  state_->startDraining();
}

SerialQueue::Turn::Turn(State& state) : state_(state), frame_{&state, currentFrame} {
  if (!state.tryEnter()) state.waitForTurn();
  currentFrame = &frame_;
}

SerialQueue::Turn::~Turn() {
  currentFrame = frame_.outer;
  state_.leave();
}

bool SerialQueue::isCurrent() const { return isRunning(state_.get()); }

void SerialQueue::assertOnQueue() const {
  if (!isCurrent()) fail(state_->label, "this code must run on the queue and does not");
}

const std::string& SerialQueue::label() const { return state_->label; }

}  // namespace yomber
