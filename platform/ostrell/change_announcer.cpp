#include "platform/ostrell/change_announcer.h"

#include "platform/foundation/notification_center.h"
#include "platform/ostrell/constants.h"

namespace yomber {

ChangeAnnouncer::ChangeAnnouncer() : queue_(SerialQueue::create("qs-announcements")) {}

void ChangeAnnouncer::accountDidChange() {
  if (isAccountPending_.exchange(true)) return;
  queue_->async([self = shared_from_this()] {
    self->isAccountPending_ = false;
    if (self->isStopped_) return;
    NSNotificationCenter::defaultCenter().postNotificationName(QSAccountTokenDidChangeNotification);
  });
}

void ChangeAnnouncer::containersDidChange() {
  if (areContainersPending_.exchange(true)) return;
  queue_->async([self = shared_from_this()] {
    self->areContainersPending_ = false;
    if (self->isStopped_) return;
    NSNotificationCenter::defaultCenter().postNotificationName(
        QSContainerListDidChangeNotification);
  });
}

}  // namespace yomber
