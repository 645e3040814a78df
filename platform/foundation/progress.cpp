#include "platform/foundation/progress.h"

#include <algorithm>
#include <utility>
#include <vector>

#include "platform/foundation/lock.h"

namespace yomber {
namespace {

struct Child {
  NSProgressRef progress;
  std::int64_t pendingUnitCount = 0;
};

}  // namespace

struct NSProgress::State {
  mutable Mutex mutex;
  std::int64_t total GUARDED_BY(mutex) = 0;
  std::int64_t completed GUARDED_BY(mutex) = 0;
  std::vector<Child> children GUARDED_BY(mutex);
  std::function<void()> cancellationHandler GUARDED_BY(mutex);
  std::shared_ptr<const std::function<void()>> updateHandler GUARDED_BY(mutex);
  bool cancellable GUARDED_BY(mutex) = true;
  bool cancelled GUARDED_BY(mutex) = false;
};

NSProgress::NSProgress(std::int64_t unitCount) : state_(std::make_unique<State>()) {
  setTotalUnitCount(unitCount);
}

NSProgress::~NSProgress() = default;

NSProgressRef NSProgress::progressWithTotalUnitCount(std::int64_t unitCount) {
  return NSProgressRef(new NSProgress(unitCount));
}

std::int64_t NSProgress::totalUnitCount() const {
  LockGuard guard(state_->mutex);
  return state_->total;
}

void NSProgress::setTotalUnitCount(std::int64_t count) { set(&State::total, count); }

std::int64_t NSProgress::completedUnitCount() const {
  LockGuard guard(state_->mutex);
  return state_->completed;
}

void NSProgress::setCompletedUnitCount(std::int64_t count) { set(&State::completed, count); }

void NSProgress::set(std::int64_t State::* count, std::int64_t value) {
  std::shared_ptr<const std::function<void()>> handler;
  {
    LockGuard guard(state_->mutex);
    (*state_).*count = value;
    handler = state_->updateHandler;
  }
  if (handler != nullptr) (*handler)();
}

void NSProgress::setUpdateHandler(std::function<void()> handler) {
  auto next = handler ? std::make_shared<const std::function<void()>>(std::move(handler)) : nullptr;
  LockGuard guard(state_->mutex);
  state_->updateHandler.swap(next);
}

double NSProgress::fractionCompleted() const {
  std::vector<Child> children;
  double total = 0;
  double completed = 0;
  {
    LockGuard guard(state_->mutex);
    children = state_->children;
    total = static_cast<double>(state_->total);
    completed = static_cast<double>(state_->completed);
  }
  if (total <= 0) return 0;
  for (const auto& child : children) {
    completed += child.progress->fractionCompleted() * static_cast<double>(child.pendingUnitCount);
  }
  return std::clamp(completed / total, 0.0, 1.0);
}

void NSProgress::addChild(const NSProgressRef& child, std::int64_t pendingUnitCount) {
  bool cancelled = false;
  {
    LockGuard guard(state_->mutex);
    state_->children.push_back({child, pendingUnitCount});
    cancelled = state_->cancelled;
  }
  if (cancelled) child->cancel();
}

bool NSProgress::isCancellable() const {
  LockGuard guard(state_->mutex);
  return state_->cancellable;
}

void NSProgress::setCancellable(bool cancellable) {
  LockGuard guard(state_->mutex);
  state_->cancellable = cancellable;
}

bool NSProgress::isCancelled() const {
  LockGuard guard(state_->mutex);
  return state_->cancelled;
}

void NSProgress::setCancellationHandler(std::function<void()> handler) {
  {
    LockGuard guard(state_->mutex);
    if (!state_->cancelled) {
      std::swap(state_->cancellationHandler, handler);
      return;
    }
  }
  if (handler) handler();
}

void NSProgress::cancel() {
  std::function<void()> handler;
  std::vector<Child> children;
  {
    LockGuard guard(state_->mutex);
    if (std::exchange(state_->cancelled, true)) return;
    handler = std::exchange(state_->cancellationHandler, nullptr);
    children = state_->children;
  }
  if (handler) handler();
  for (const auto& child : children) child.progress->cancel();
}

}  // namespace yomber
