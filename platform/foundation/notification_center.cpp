#include "platform/foundation/notification_center.h"

#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/foundation/lock.h"

namespace yomber {
namespace {

struct Registration {
  const void* address = nullptr;  ///< names the observer, also when it is gone
  std::weak_ptr<const void> observer;
  std::shared_ptr<const NSNotificationCenter::Handler> handler;
};

}  // namespace

struct NSNotificationCenter::State {
  Mutex mutex;
  std::unordered_map<std::string, std::vector<Registration>> byName GUARDED_BY(mutex);

  // What is taken out is destroyed by the caller, after the lock was left.
  void takeOut(const std::string& name, const void* observer, std::vector<Registration>& out)
      REQUIRES(mutex) {
    const auto found = byName.find(name);
    if (found == byName.end()) return;
    auto& list = found->second;
    std::vector<Registration> kept;
    for (auto& entry : list) {
      const bool goes = entry.address == observer || entry.observer.expired();
      (goes ? out : kept).push_back(std::move(entry));
    }
    list = std::move(kept);
    if (list.empty()) byName.erase(found);
  }
};

NSNotificationCenter::NSNotificationCenter() : state_(std::make_unique<State>()) {}

NSNotificationCenter::~NSNotificationCenter() = default;

NSNotificationCenter& NSNotificationCenter::defaultCenter() {
  static NSNotificationCenter& center = *new NSNotificationCenter;  // outlives every thread
  return center;
}

void NSNotificationCenter::addObserver(const std::shared_ptr<const void>& observer,
                                       const std::string& name, Handler handler) {
  auto held = std::make_shared<const Handler>(std::move(handler));
  std::vector<Registration> removed;
  LockGuard guard(state_->mutex);
  // An address that a destroyed observer had may be in use again: forget the dead ones first.
  state_->takeOut(name, nullptr, removed);
  state_->byName[name].push_back({observer.get(), observer, std::move(held)});
}

void NSNotificationCenter::removeObserver(const void* observer) {
  std::vector<Registration> removed;
  LockGuard guard(state_->mutex);
  std::vector<std::string> names;
  for (const auto& [name, list] : state_->byName) names.push_back(name);
  for (const auto& name : names) state_->takeOut(name, observer, removed);
}

void NSNotificationCenter::removeObserver(const void* observer, const std::string& name) {
  std::vector<Registration> removed;
  LockGuard guard(state_->mutex);
  state_->takeOut(name, observer, removed);
}

void NSNotificationCenter::postNotificationName(const std::string& name) {
  std::vector<Registration> snapshot;
  {
    LockGuard guard(state_->mutex);
    const auto found = state_->byName.find(name);
    if (found != state_->byName.end()) snapshot = found->second;
  }
  for (const auto& entry : snapshot) {
    const auto observer = entry.observer.lock();
    if (observer != nullptr && *entry.handler) (*entry.handler)();
  }
}

}  // namespace yomber
