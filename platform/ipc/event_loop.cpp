#include "platform/ipc/event_loop.h"

#include <signal.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <thread>
#include <utility>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/foundation/log.h"
#include "platform/ipc/deadlines.h"

namespace yomber::ipc {

namespace {

thread_local bool isLoopThread = false;

/// How long what was retired lives: so many answered calls say goodbye together.
constexpr auto kRetirement = 2 * kj::MILLISECONDS;
/// With so many retired the loop lets go of them at once.
constexpr std::size_t kMaximumRetired = 256;
/// Room for more posted work than this is given back after a burst.
constexpr std::size_t kKeptBatch = 1'024;
/// After so many events the loop looks for what else has come, though it has work left: else a peer
/// that never pauses would keep everybody else waiting.
constexpr kj::uint kEventsInOneGo = 1'000;

void logFailure(const char* where, const kj::Exception& exception) {
  log_error(defaultLog(), "%s on the loop thread failed: %s", where,
            exception.getDescription().cStr());
}

/// Signals are for the threads of the program itself.
void blockSignals() {
  sigset_t all;
  sigfillset(&all);
  for (const int fault : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGTRAP}) {
    sigdelset(&all, fault);
  }
  pthread_sigmask(SIG_BLOCK, &all, nullptr);
}

[[noreturn]] void abortWith(const char* what, const char* where) {
  std::fprintf(stderr, "%s must %s the loop thread.\n", what, where);
  std::abort();
}

struct LoggingErrorHandler final : kj::TaskSet::ErrorHandler {
  void taskFailed(kj::Exception&& exception) override { logFailure("A task", exception); }
};

}  // namespace

struct EventLoop::State {
  using Work = kj::Function<void()>;

  /// What exists on the loop thread only.
  struct Loop {
    explicit Loop(State& state)
        : context(kj::setupAsyncIo()),
          tasks(errorHandler),
          deadlines(context.unixEventPort.getTimer()),
          wake(context.unixEventPort, state.wakeFd, kj::UnixEventPort::FdObserver::OBSERVE_READ) {}

    kj::AsyncIoContext context;
    LoggingErrorHandler errorHandler;
    kj::TaskSet tasks;
    Deadlines deadlines;
    kj::UnixEventPort::FdObserver wake;
    std::vector<Work> batch;
    std::vector<std::shared_ptr<void>> retired;
    bool retirementArmed = false;

    void releaseRetired() {
      // Apart, since what goes may retire something in its turn.
      const auto gone = std::exchange(retired, {});
    }
  };

  Mutex mutex;
  std::vector<Work> mailbox GUARDED_BY(mutex);

  const int wakeFd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  Loop* loop = nullptr;  ///< set and read on the loop thread

  [[noreturn]] void run() {
    isLoopThread = true;
    pthread_setname_np(pthread_self(), "ipc loop");
    blockSignals();
    Loop own(*this);
    loop = &own;
    own.context.waitScope.setBusyPollInterval(kEventsInOneGo);
    for (;;) {
      // Observed before the mailbox is emptied, so that no wake-up falls between the two. The
      // eventfd is never read: every write to it is an edge of its own.
      kj::Promise<void> ready = own.wake.whenBecomesReadable();
      drain();
      ready.wait(own.context.waitScope);
    }
  }

  void drain() {
    {
      LockGuard guard(mutex);
      loop->batch.swap(mailbox);
    }
    for (Work& work : loop->batch) {
      KJ_IF_MAYBE (exception, kj::runCatchingExceptions([&] {
                     Work once = kj::mv(work);
                     once();
                   })) {
        logFailure("Posted work", *exception);
      }
    }
    loop->batch.clear();
    if (loop->batch.capacity() > kKeptBatch) std::vector<Work>().swap(loop->batch);
  }

  void armRetirement() {
    loop->retirementArmed = true;
    loop->tasks.add(loop->context.unixEventPort.getTimer().afterDelay(kRetirement).then([this] {
      loop->retirementArmed = false;
      loop->releaseRetired();
    }));
  }
};

EventLoop::EventLoop() : state_(std::make_unique<State>()) {
  if (state_->wakeFd < 0) {
    std::perror("No descriptor for the loop thread");
    std::abort();
  }
  std::thread([state = state_.get()] { state->run(); }).detach();
}

EventLoop& EventLoop::shared() {
  static EventLoop* const loop = new EventLoop();
  return *loop;
}

void EventLoop::post(kj::Function<void()> work) {
  bool wasEmpty = false;
  {
    LockGuard guard(state_->mutex);
    wasEmpty = state_->mailbox.empty();
    state_->mailbox.push_back(kj::mv(work));
  }
  if (wasEmpty) {
    const std::uint64_t one = 1;
    (void)!::write(state_->wakeFd, &one, sizeof one);
  }
}

bool EventLoop::isCurrent() const { return isLoopThread; }

void EventLoop::assertElsewhere(const char* what) const {
  if (isLoopThread) abortWith(what, "not be called on");
}

void EventLoop::assertCurrent(const char* what) const {
  if (!isLoopThread) abortWith(what, "be called on");
}

kj::Timer& EventLoop::timer() {
  assertCurrent("timer");
  return state_->loop->context.unixEventPort.getTimer();
}

kj::LowLevelAsyncIoProvider& EventLoop::io() {
  assertCurrent("io");
  return *state_->loop->context.lowLevelProvider;
}

kj::UnixEventPort& EventLoop::port() {
  assertCurrent("port");
  return state_->loop->context.unixEventPort;
}

Deadlines& EventLoop::deadlines() {
  assertCurrent("deadlines");
  return state_->loop->deadlines;
}

void EventLoop::detach(kj::Promise<void> task) {
  assertCurrent("detach");
  state_->loop->tasks.add(kj::mv(task));
}

void EventLoop::retire(std::shared_ptr<void> object) {
  assertCurrent("retire");
  State::Loop& loop = *state_->loop;
  loop.retired.push_back(std::move(object));
  if (loop.retired.size() == kMaximumRetired) post([&loop] { loop.releaseRetired(); });
  if (!loop.retirementArmed) state_->armRetirement();
}

}  // namespace yomber::ipc
