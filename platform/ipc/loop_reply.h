#pragma once

#include <kj/async.h>

#include <atomic>
#include <functional>
#include <memory>
#include <utility>

#include "platform/ipc/event_loop.h"
#include "platform/ipc/remote.h"

namespace yomber::ipc {

/// A promise of the loop, and the function that keeps it from any thread. The first call counts.
template <typename T>
struct LoopReply {
  kj::Promise<T> promise = nullptr;
  std::function<void(T)> fulfill;

  /// Loop thread only.
  static LoopReply make() {
    auto pair = kj::newPromiseAndFulfiller<T>();
    using Fulfiller = kj::Own<kj::PromiseFulfiller<T>>;
    auto slot =
        std::shared_ptr<Fulfiller>(new Fulfiller(kj::mv(pair.fulfiller)), detail::DeleteOnLoop());
    LoopReply reply;
    reply.promise = kj::mv(pair.promise);
    reply.fulfill = [slot = std::move(slot)](T value) {
      EventLoop::shared().post(
          [slot, value = std::move(value)]() mutable { (*slot)->fulfill(std::move(value)); });
    };
    return reply;
  }

  /// The same for a handler that may be forgotten: when its last copy goes without having been
  /// called, `forgotten` is the reply.
  static LoopReply makeFor(T forgotten) {
    struct Answered {
      std::function<void(T)> fulfill;
      T forgotten;
      std::atomic<bool> done{false};

      void answer(T value) {
        if (!done.exchange(true)) fulfill(std::move(value));
      }
      Answered(std::function<void(T)> function, T value)
          : fulfill(std::move(function)), forgotten(std::move(value)) {}
      Answered(const Answered&) = delete;
      Answered& operator=(const Answered&) = delete;
      ~Answered() { answer(std::move(forgotten)); }
    };
    LoopReply reply = make();
    auto answered = std::make_shared<Answered>(std::move(reply.fulfill), std::move(forgotten));
    reply.fulfill = [answered = std::move(answered)](T value) {
      answered->answer(std::move(value));
    };
    return reply;
  }
};

}  // namespace yomber::ipc
