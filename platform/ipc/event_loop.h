#pragma once

#include <kj/async-io.h>
#include <kj/async-unix.h>
#include <kj/function.h>

#include <exception>
#include <memory>
#include <optional>
#include <type_traits>
#include <utility>

#include "platform/ipc/gate.h"

namespace yomber::ipc {

class Deadlines;

/// The process's one loop thread: the only thread that touches KJ and Cap'n Proto objects.
///
/// The only crossing between it and other threads is a mailbox: a locked list of closures, woken by
/// an eventfd that the loop observes. Closures run in the order in which they were posted.
///
/// Nothing that runs on the loop thread may block: work that may goes to a pool (server_call.h).
/// The thread takes no signals, and what it forks would take none either: start programs elsewhere.
///
/// Thread-safety: `post`, `isCurrent`, `assertElsewhere` and `runAndWait` on any thread; everything
/// else on the loop thread only.
/// Ownership: lives until the process ends. A child made by fork without exec has no loop thread.
class EventLoop {
 public:
  /// Starts the thread on first use.
  static EventLoop& shared();

  /// Runs `work` on the loop thread later, also when called there. What it throws is logged. The
  /// closure is destroyed on the loop thread.
  void post(kj::Function<void()> work);

  [[nodiscard]] bool isCurrent() const;
  /// Aborts with a message that names `what` when called on the loop thread, where waiting for the
  /// loop's own work would never end.
  void assertElsewhere(const char* what) const;
  /// Aborts with a message that names `what` when called on any other thread.
  void assertCurrent(const char* what) const;

  kj::Timer& timer();
  kj::LowLevelAsyncIoProvider& io();
  kj::UnixEventPort& port();
  /// Keeps `task` until it is done; a failure is logged.
  void detach(kj::Promise<void> task);
  /// Lets go of `object` a moment later, from the loop's top level: for what must outlive the
  /// callback that is done with it. Answered calls go this way too, so that the goodbyes to many
  /// travel together and wake the peer once.
  void retire(std::shared_ptr<void> object);
  Deadlines& deadlines();

  /// Runs `work` on the loop thread and answers its result, or throws what it threw. Other threads
  /// only.
  template <typename Work>
  std::invoke_result_t<Work&> runAndWait(Work&& work);

  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

 private:
  struct State;
  EventLoop();
  ~EventLoop() = delete;
  std::unique_ptr<State> state_;
};

template <typename Work>
std::invoke_result_t<Work&> EventLoop::runAndWait(Work&& work) {
  using Result = std::invoke_result_t<Work&>;
  using Stored = std::conditional_t<std::is_void_v<Result>, bool, Result>;
  assertElsewhere("runAndWait");
  Gate done;
  std::optional<Stored> result;
  std::exception_ptr failure;
  post([&] {
    try {
      if constexpr (std::is_void_v<Result>) {
        work();
      } else {
        result.emplace(work());
      }
    } catch (...) {
      failure = std::current_exception();
    }
    done.open();
  });
  done.wait();
  if (failure) std::rethrow_exception(failure);
  if constexpr (!std::is_void_v<Result>) return std::move(*result);
}

}  // namespace yomber::ipc
