#include "platform/ipc/server_call.h"

#include <atomic>
#include <vector>

#include "platform/foundation/lock.h"

namespace yomber::ipc {

struct CancelFlag::State {
  std::atomic<bool> set{false};
  Mutex mutex;
  bool disarmed GUARDED_BY(mutex) = false;
  std::vector<std::function<void()>> handlers GUARDED_BY(mutex);
};

CancelFlag::CancelFlag() : state_(std::make_shared<State>()) {}

bool CancelFlag::isSet() const { return state_->set.load(std::memory_order_acquire); }

void CancelFlag::set() const {
  std::vector<std::function<void()>> due;
  {
    LockGuard guard(state_->mutex);
    state_->set.store(true, std::memory_order_release);
    due.swap(state_->handlers);
  }
  for (auto& handler : due) ThreadPool::shared().async(std::move(handler));
}

void CancelFlag::whenSet(std::function<void()> handler) const {
  {
    LockGuard guard(state_->mutex);
    if (state_->disarmed) return;
    if (!isSet()) {
      state_->handlers.push_back(std::move(handler));
      return;
    }
  }
  ThreadPool::shared().async(std::move(handler));
}

void CancelFlag::disarm() const {
  std::vector<std::function<void()>> forgotten;  // destroyed after the lock was left
  LockGuard guard(state_->mutex);
  state_->disarmed = true;
  forgotten.swap(state_->handlers);
}

namespace detail {

void runCatching(const std::function<void()>& work, kj::Maybe<kj::Exception>& failure) {
  failure = kj::runCatchingExceptions([&work] { work(); });
}

}  // namespace detail
}  // namespace yomber::ipc
