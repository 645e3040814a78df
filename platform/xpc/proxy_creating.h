#pragma once

#include <functional>
#include <memory>

#include "platform/foundation/error.h"

namespace yomber {

/// A reference to an object of another process, which makes proxies that report transport failures.
///
/// Thread-safety: callable on any thread.
template <typename Protocol>
class NSXPCProxyCreating {
 public:
  virtual ~NSXPCProxyCreating() = default;
  /// A new proxy of the same remote object. `errorHandler` is called at most once, on the
  /// connection's reply queue.
  virtual std::shared_ptr<Protocol> remoteObjectProxyWithErrorHandler(
      std::function<void(NSErrorRef)> errorHandler) = 0;
};

}  // namespace yomber
