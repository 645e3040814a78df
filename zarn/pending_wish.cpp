#include "zarn/pending_wish.h"

#include <utility>

#include "platform/foundation/thread_pool.h"
#include "platform/ipc/event_loop.h"

namespace yomber {

kj::Promise<NSErrorRef> PendingWish::start(std::shared_ptr<ContentEngine> engine, Begin begin) {
  auto pair = kj::newPromiseAndFulfiller<NSErrorRef>();
  auto pending = std::make_shared<PendingWish>(std::move(engine));
  pending->fulfiller_ = kj::mv(pair.fulfiller);
  ThreadPool::shared().async([pending, begin = std::move(begin)] {
    pending->keep(begin(*pending->engine_,
                        [pending](NSErrorRef error) { pending->complete(std::move(error)); }));
  });
  return pair.promise.attach(kj::defer([pending] { pending->drop(); }));
}

void PendingWish::complete(NSErrorRef error) {
  ipc::EventLoop::shared().post([self = shared_from_this(), error = std::move(error)]() mutable {
    if (self->fulfiller_) self->fulfiller_->fulfill(std::move(error));
  });
}

void PendingWish::keep(std::unique_ptr<ContentWish> wish) {
  LockGuard guard(mutex_);
  // Nobody waits any more: the wish ends here.
  if (!isDropped_) wish_.swap(wish);
}

/// Answered, or given up by the client.
void PendingWish::drop() {
  fulfiller_ = nullptr;
  std::unique_ptr<ContentWish> wish;
  {
    LockGuard guard(mutex_);
    isDropped_ = true;
    wish = std::move(wish_);
  }
  if (!wish) return;
  // Taking a wish back may have to wait for the engine's locks.
  ThreadPool::shared().async(
      [taken = std::shared_ptr<ContentWish>(std::move(wish))]() mutable { taken.reset(); });
}

}  // namespace yomber
