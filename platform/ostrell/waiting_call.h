#pragma once

#include "platform/foundation/error.h"
#include "platform/foundation/url.h"
#include "platform/ostrell/daemon_connection.h"

namespace yomber {

// Synchronous calls about one location, for the additions to platform classes. For this room's
// sources only. A nil location fails with Cocoa error 4 and asks nobody.

/// `call(daemon, reply)` makes the call. Answers its failure, or nil.
template <typename Call>
[[nodiscard]] NSErrorRef waitForReply(const NSURLRef& url, const Call& call) {
  if (!url) return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError);
  const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
  call(*proxy, [&](const NSErrorRef& failure) { proxy->setBoolResult(!failure, failure); });
  return proxy->error();
}

/// The same for a call that replies a location; nil and an error, or a location.
template <typename Call>
[[nodiscard]] NSURLRef waitForURL(const NSURLRef& url, const Call& call, NSErrorRef* error) {
  if (!url) {
    storeError(error, NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError));
    return nullptr;
  }
  const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
  NSURLRef result;
  call(*proxy, [&](const NSURLRef& location, const NSErrorRef& failure) {
    result = location;
    proxy->setObjResult(location, failure);
  });
  if (const auto failure = proxy->error()) storeError(error, failure);
  return result;
}

}  // namespace yomber
