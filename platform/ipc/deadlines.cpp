#include "platform/ipc/deadlines.h"

#include <algorithm>
#include <utility>

namespace yomber::ipc {

void Deadlines::Entry::clear() {
  if (list_ != nullptr) std::exchange(list_, nullptr)->entries_.erase(position_);
}

Deadlines::Deadlines(kj::Timer& timer) : timer_(timer), task_(nullptr) {
  task_ = watch().eagerlyEvaluate(nullptr);
}

void Deadlines::set(Entry& entry, std::chrono::milliseconds delay, std::function<void()> onExpiry) {
  entry.clear();
  const Clock::time_point when = Clock::now() + delay;
  // Most deadlines are equally far away, so the new one nearly always belongs at the end.
  entry.position_ =
      entries_.emplace_hint(entries_.end(), when, Pending{&entry, std::move(onExpiry)});
  entry.list_ = this;
  if (!watchedFor_ || when < *watchedFor_) lookAgain_->fulfill();
}

kj::Promise<void> Deadlines::watch() {
  expireDue();
  auto changed = kj::newPromiseAndFulfiller<void>();
  lookAgain_ = kj::mv(changed.fulfiller);
  watchedFor_.reset();
  kj::Promise<void> wait = kj::mv(changed.promise);
  if (!entries_.empty()) {
    watchedFor_ = entries_.begin()->first;
    const auto delay = std::max(*watchedFor_ - Clock::now(), Clock::duration::zero());
    // The timer's own clock stands still while handlers run, so that it may fire early; nothing is
    // due then, and the next look comes right.
    const auto nanoseconds = std::chrono::ceil<std::chrono::nanoseconds>(delay).count();
    wait = wait.exclusiveJoin(timer_.afterDelay(nanoseconds * kj::NANOSECONDS));
  }
  return wait.then([this] { return watch(); });
}

void Deadlines::expireDue() {
  const Clock::time_point now = Clock::now();
  while (!entries_.empty() && entries_.begin()->first <= now) {
    auto due = entries_.extract(entries_.begin());
    due.mapped().entry->list_ = nullptr;
    due.mapped().onExpiry();
  }
}

}  // namespace yomber::ipc
