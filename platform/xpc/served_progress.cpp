#include "platform/xpc/served_progress.h"

#include <utility>

#include "platform/foundation/thread_pool.h"
#include "platform/ipc/event_loop.h"
#include "platform/xpc/connection_link.h"

namespace yomber {

ServedProgress::ServedProgress(std::weak_ptr<ConnectionLink> link, std::uint64_t call)
    : link_(std::move(link)), call_(call) {}

ServedProgress::~ServedProgress() {
  ipc::EventLoop::shared().post([link = link_, call = call_] {
    if (const auto held = link.lock()) held->forgetServed(call);
  });
}

void ServedProgress::attach(const NSProgressRef& progress) {
  if (progress == nullptr) return;
  bool isCancelled = false;
  {
    LockGuard guard(mutex_);
    progress_ = progress;
    if (!isClosed_) kept_ = progress;
    isCancelled = cancelled_;
  }
  progress->setUpdateHandler([self = shared_from_this()] { self->didChange(); });
  didChange();
  if (isCancelled) progress->cancel();
}

void ServedProgress::cancel() {
  NSProgressRef progress;
  {
    LockGuard guard(mutex_);
    cancelled_ = true;
    progress = progress_.lock();
  }
  if (progress == nullptr) return;
  ThreadPool::shared().async([progress = std::move(progress)] { progress->cancel(); });
}

void ServedProgress::didChange() {
  {
    LockGuard guard(mutex_);
    // The counts are kept, since the progress may be gone when the loop comes to it.
    const auto progress = progress_.lock();
    if (progress == nullptr) return;
    total_ = progress->totalUnitCount();
    completed_ = progress->completedUnitCount();
    if (std::exchange(changed_, true)) return;
  }
  ipc::EventLoop::shared().post([self = shared_from_this()] {
    self->stale_ = true;
    {
      LockGuard guard(self->mutex_);
      self->changed_ = false;
    }
    if (!self->telling_) self->tell();
  });
}

void ServedProgress::willReply() {
  NSProgressRef released;
  ipc::EventLoop::shared().post([self = shared_from_this()] {
    if (self->stale_) self->tell();
  });
  LockGuard guard(mutex_);
  isClosed_ = true;
  released = std::move(kept_);
}

void ServedProgress::close() {
  NSProgressRef released;
  {
    LockGuard guard(mutex_);
    isClosed_ = true;
    released = std::move(kept_);
  }
  if (released == nullptr) return;
  // What its handlers hold is the object's, and is not let go of on the loop thread.
  ThreadPool::shared().async([released = std::move(released)] {});
}

void ServedProgress::tell() {
  stale_ = false;
  const auto link = link_.lock();
  if (link == nullptr) return;
  std::int64_t total = 0;
  std::int64_t completed = 0;
  {
    LockGuard guard(mutex_);
    total = total_;
    completed = completed_;
  }
  telling_ = true;
  link->tellProgress(call_, total, completed, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    self->telling_ = false;
    if (self->stale_) self->tell();
  });
}

}  // namespace yomber
