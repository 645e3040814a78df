#include "fileproviderd/watcher_outbox.h"

namespace yomber {

void WatcherOutbox::send(Call call) {
  waiting_.push_back(std::move(call));
  if (!isBusy_) sendNext();
}

void WatcherOutbox::sendNext() {
  isBusy_ = true;
  const Call call = std::move(waiting_.front());
  waiting_.pop_front();
  call(*watcher_, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    self->isBusy_ = false;
    if (!self->waiting_.empty()) {
      self->sendNext();
    } else if (self->onIdle_) {
      self->onIdle_();
    }
  });
}

}  // namespace yomber
