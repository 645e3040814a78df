#pragma once

#include <kj/async.h>

#include <functional>
#include <memory>
#include <optional>
#include <type_traits>
#include <utility>

#include "platform/foundation/serial_queue.h"
#include "platform/foundation/thread_pool.h"
#include "platform/ipc/event_loop.h"

namespace yomber::ipc {

/// Says to work on another thread that nobody waits for its result any more.
///
/// Thread-safety: every operation may be called on any thread. Copies share one flag.
class CancelFlag {
 public:
  CancelFlag();
  [[nodiscard]] bool isSet() const;
  void set() const;
  /// Calls `handler` once, on a pool thread, when the flag is set, or soon when it has been. It is
  /// forgotten when the work has ended first.
  void whenSet(std::function<void()> handler) const;
  /// The work has ended: handlers that were not called never will be.
  void disarm() const;

 private:
  struct State;
  std::shared_ptr<State> state_;
};

// For methods of capnp servers, which run on the loop thread and must not block.
//
//   kj::Promise<void> page(PageContext context) override {
//     context.allowCancellation();
//     auto request = decode(context.getParams());        // copy the parameters out first
//     context.releaseParams();
//     return onPool([this, request](const CancelFlag& cancelled) { return list(request); })
//         .then([context](Page page) mutable { encode(page, context.getResults()); });
//   }
//
// With `allowCancellation` the call context is destroyed as soon as the client cancels or leaves:
// work on the pool must touch neither it nor its parameters and results, only what it owns. What
// the work refers to (the server object too) it must keep alive itself.

namespace detail {

/// What the two threads share. Everything but `cancelled` is touched on the loop thread only once
/// the work is done.
template <typename Result>
struct PooledCall {
  CancelFlag cancelled;
  kj::Own<kj::PromiseFulfiller<Result>> fulfiller;
  kj::Maybe<kj::Exception> failure;
  using Stored = std::conditional_t<std::is_void_v<Result>, bool, Result>;
  std::optional<Stored> result;

  void settle() {
    KJ_IF_MAYBE (exception, failure) {
      fulfiller->reject(kj::mv(*exception));
    } else if constexpr (std::is_void_v<Result>) {
      fulfiller->fulfill();
    } else {
      fulfiller->fulfill(std::move(*result));
    }
  }
};

/// Runs `work` in the place of the pool's thread; no exception leaves it.
void runCatching(const std::function<void()>& work, kj::Maybe<kj::Exception>& failure);

template <typename Submit, typename Work, typename Afterwards>
kj::Promise<std::invoke_result_t<Work&, const CancelFlag&>> runElsewhere(Submit submit, Work work,
                                                                         Afterwards afterwards) {
  using Result = std::invoke_result_t<Work&, const CancelFlag&>;
  EventLoop::shared().assertCurrent("onPool and onQueue");
  auto pair = kj::newPromiseAndFulfiller<Result>();
  auto shared = std::make_shared<PooledCall<Result>>();
  shared->fulfiller = kj::mv(pair.fulfiller);
  CancelFlag cancelled = shared->cancelled;
  submit([shared = std::move(shared), work = std::make_shared<Work>(std::move(work)),
          afterwards = std::move(afterwards)]() mutable {
    runCatching(
        [&] {
          if constexpr (std::is_void_v<Result>) {
            (*work)(shared->cancelled);
          } else {
            shared->result.emplace((*work)(shared->cancelled));
          }
        },
        shared->failure);
    shared->cancelled.disarm();
    work.reset();
    // The closure takes this thread's only reference along: the result dies on the loop thread.
    EventLoop::shared().post([owned = std::move(shared)] { owned->settle(); });
    afterwards();
  });
  return pair.promise.attach(kj::defer([cancelled] { cancelled.set(); }));
}

}  // namespace detail

/// Runs `work(cancelFlag)` on the thread pool and answers its result on the loop thread. When the
/// promise is dropped the flag is set, the work runs on, and its result is destroyed on the loop
/// thread. What the work throws becomes the promise's exception. `Work` may be move-only; it is
/// destroyed on the pool's thread. `afterwards()`, which must not throw, runs on the same thread
/// once the result is on its way, also when nobody waits for it. REQUIRES: on the loop thread.
template <typename Work, typename Afterwards>
auto onPool(Work work, Afterwards afterwards) {
  return detail::runElsewhere(
      [](std::function<void()> job) { ThreadPool::shared().async(std::move(job)); },
      std::move(work), std::move(afterwards));
}

template <typename Work>
auto onPool(Work work) {
  return onPool(std::move(work), [] {});
}

/// The same on `queue`, in order with what else is submitted there.
template <typename Work>
auto onQueue(const std::shared_ptr<SerialQueue>& queue, Work work) {
  return detail::runElsewhere([&queue](std::function<void()> job) { queue->async(std::move(job)); },
                              std::move(work), [] {});
}

}  // namespace yomber::ipc
