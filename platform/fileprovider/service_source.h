#pragma once

#include <memory>
#include <string>

#include "platform/foundation/error.h"
#include "platform/xpc/listener_endpoint.h"

namespace yomber {

using NSFileProviderServiceName = std::string;

/// What vends one service of one item.
///
/// Ownership: shared; the framework keeps it until each endpoint that it made was connected or has
/// gone everywhere. Thread-safety: every operation may be called on any thread.
class NSFileProviderServiceSource {
 public:
  virtual ~NSFileProviderServiceSource() = default;
  [[nodiscard]] virtual NSFileProviderServiceName serviceName() const = 0;
  /// Of a new listener each time. Nil with an error when there is none to be had.
  virtual NSXPCListenerEndpointRef makeListenerEndpointAndReturnError(
      NSErrorRef* error = nullptr) = 0;
};

using NSFileProviderServiceSourceRef = std::shared_ptr<NSFileProviderServiceSource>;

}  // namespace yomber
