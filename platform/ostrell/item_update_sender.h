#pragma once

#include <cstddef>
#include <memory>
#include <vector>

#include "platform/ipc/remote.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/error_handler_slot.h"
#include "platform/ostrell/item_notifications.h"
#include "protocols/daemon.capnp.h"

namespace yomber {

// The sender side of an item subscription. For this room's sources only.

/// One subscription, shared by the sender that was replied and by its proxies; the daemon's end is
/// released with the last of them, or when it is invalidated or fails.
///
/// Thread-safety: every operation may be called on any thread.
class ItemSubscription final : public DaemonLossObserver,
                               public std::enable_shared_from_this<ItemSubscription> {
 public:
  explicit ItemSubscription(const std::shared_ptr<DaemonLink>& link)
      : queue_(link->replyQueue()), callOptions_(link->callOptions()) {}

  /// The subscription stands: from now on it keeps `remote`, and `session` open.
  void begin(DaemonSessionRef session, ipc::Remote<protocol::ItemSender> remote);
  /// Ends it: lets go of the daemon's end, and fails the proxies, also those made later. Errors of
  /// other domains go under a QSOstrellErrorConnectionLost.
  void fail(const NSErrorRef& error);
  /// Ends it without telling the proxies; only calls made on them later fail.
  void invalidate();
  void daemonWasLost(const NSErrorRef& reason) override { fail(reason); }

  /// A slot for a proxy's handler; held weakly here.
  std::shared_ptr<ErrorHandlerSlot> addHandler(std::function<void(NSErrorRef)> handler);
  /// The daemon's end, or nil and what a call is to fail with.
  ipc::Remote<protocol::ItemSender> remote(NSErrorRef* error) const;

  [[nodiscard]] const std::shared_ptr<SerialQueue>& queue() const { return queue_; }
  [[nodiscard]] const ipc::CallOptions& callOptions() const { return callOptions_; }

 private:
  const std::shared_ptr<SerialQueue> queue_;
  const ipc::CallOptions callOptions_;

  mutable Mutex mutex_;
  DaemonSessionRef session_ GUARDED_BY(mutex_);
  ipc::Remote<protocol::ItemSender> remote_ GUARDED_BY(mutex_);
  /// Set when it has ended, however it did.
  NSErrorRef failure_ GUARDED_BY(mutex_);
  bool isInvalidated_ GUARDED_BY(mutex_) = false;
  std::vector<std::weak_ptr<ErrorHandlerSlot>> handlers_ GUARDED_BY(mutex_);
  std::size_t nextSweep_ GUARDED_BY(mutex_) = 8;
};

/// The sender as it is replied.
[[nodiscard]] QSItemUpdateSenderRef makeItemUpdateSender(
    const std::shared_ptr<ItemSubscription>& subscription);

/// What the daemon calls. Holds receiver and subscription weakly. Loop thread.
[[nodiscard]] protocol::ItemReceiver::Client makeItemReceiver(
    const std::shared_ptr<QSItemNotificationReceiving>& receiver,
    const std::shared_ptr<ItemSubscription>& subscription);

}  // namespace yomber
