#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "fileproviderd/extension_session.h"
#include "protocols/services.capnp.h"

namespace yomber {

/// A service that the extension vends, on its way to the client: passed on as it came, so that the
/// two speak directly.
struct VendedService {
  std::string name;
  ipc::Remote<protocol::ServiceEndpoint> endpoint;
};

using ServicesHandler = AnswerHandler<std::vector<VendedService>>;

/// What is asked for: an item's services, or the one of that name.
struct ServicesRequest {
  std::string identifier;
  std::optional<std::string> name;
  std::uint32_t client = 0;  ///< who asks, by its process
};

/// Asks the extension. Calls `handler` once, within the limit. Loop thread only.
void askForServices(ExtensionSession& session, const ServicesRequest& request,
                    std::chrono::milliseconds limit, ServicesHandler handler);

}  // namespace yomber
