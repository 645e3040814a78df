#pragma once

#include <kj/async.h>

#include <functional>
#include <memory>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "zarn/content_engine.h"

namespace yomber {

/// An operation of the content engine that a call waits for: it begins on the pool, completes on
/// any thread, and is taken back when the call is dropped.
///
/// Ownership: shared by the call, the pool and the engine's completion.
class PendingWish : public std::enable_shared_from_this<PendingWish> {
 public:
  /// Begins an operation with the completion that it is given; answers what stands for it, which
  /// may be null where it cannot be taken back.
  using Begin =
      std::function<std::unique_ptr<ContentWish>(ContentEngine&, ContentEngine::Completion)>;

  /// Begins on the pool; the promise is the completion's error. The engine is kept until the wish
  /// has ended. Loop thread only.
  [[nodiscard]] static kj::Promise<NSErrorRef> start(std::shared_ptr<ContentEngine> engine,
                                                     Begin begin);

  explicit PendingWish(std::shared_ptr<ContentEngine> engine) : engine_(std::move(engine)) {}

 private:
  void complete(NSErrorRef error);
  void keep(std::unique_ptr<ContentWish> wish);
  void drop();

  const std::shared_ptr<ContentEngine> engine_;
  kj::Own<kj::PromiseFulfiller<NSErrorRef>> fulfiller_;  // loop thread; null when nobody waits
  Mutex mutex_;
  std::unique_ptr<ContentWish> wish_ GUARDED_BY(mutex_);
  bool isDropped_ GUARDED_BY(mutex_) = false;
};

}  // namespace yomber
