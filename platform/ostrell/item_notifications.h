#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/foundation/url.h"
#include "platform/ostrell/query_item.h"
#include "platform/xpc/proxy_creating.h"

namespace yomber {

/// Receives the daemon's notifications about items. Called on the connection's reply queue, one
/// call at a time.
class QSItemNotificationReceiving {
 public:
  virtual ~QSItemNotificationReceiving() = default;
  /// The daemon sends the next batch after `reply`.
  virtual void receiveUpdates(const QSQueryItems& items,
                              const std::vector<std::string>& logicalExtensions,
                              const std::vector<std::string>& physicalExtensions,
                              std::function<void()> reply) = 0;
  virtual void receiveProgressUpdates(const std::vector<std::string>& identifiers,
                                      std::function<void()> reply) = 0;
};

/// What can be told to stop.
class QSCancellable {
 public:
  virtual ~QSCancellable() = default;
  virtual void invalidate() = 0;
};

/// The daemon-side sender of one receiver's notifications, as a proxy. Calls never block; handlers
/// run on the connection's reply queue.
class QSItemNotificationSending : public QSCancellable {
 public:
  virtual void boostPriority(std::function<void()> completion) = 0;
  /// `gatherReply` brings no items, only whether the watch stands.
  virtual void watchItemAtURL(const NSURLRef& url, std::uint32_t options,
                              std::function<void(NSErrorRef)> gatherReply) = 0;
};

/// A sender reference that makes proxies of itself. The error handler of each proxy is called once,
/// with an error of QSOstrellErrorDomain, when the daemon ends the subscription or the connection
/// to it is lost, for as long as the proxy is held or a call on it is under way; it must not keep
/// its target alive.
class QSItemUpdateSender : public QSItemNotificationSending,
                           public NSXPCProxyCreating<QSItemUpdateSender> {};

using QSItemUpdateSenderRef = std::shared_ptr<QSItemUpdateSender>;

}  // namespace yomber
