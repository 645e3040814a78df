#include "platform/xpc/endpoint_wire.h"

#include <memory>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/log.h"

namespace yomber {
namespace {

FaultPoint outOfDescriptors("xpc.endpoint.duplicate");

class EndpointServer final : public protocol::ServiceEndpoint::Server {
 public:
  explicit EndpointServer(NSXPCListenerEndpointRef endpoint) : endpoint_(std::move(endpoint)) {}

  kj::Maybe<int> getFd() override {
    const int descriptor = endpoint_->descriptor();
    if (descriptor < 0) return nullptr;
    return descriptor;
  }

 private:
  const NSXPCListenerEndpointRef endpoint_;
};

}  // namespace

protocol::ServiceEndpoint::Client serveEndpoint(NSXPCListenerEndpointRef endpoint) {
  return kj::heap<EndpointServer>(std::move(endpoint));
}

kj::Promise<NSXPCListenerEndpointRef> endpointOf(protocol::ServiceEndpoint::Client capability) {
  auto descriptor = capability.getFd();
  return descriptor.then([capability = kj::mv(capability)](kj::Maybe<int> fd) mutable {
    ipc::UniqueFd own;
    KJ_IF_MAYBE (shared, fd) {
      NSErrorRef error;
      if (!outOfDescriptors.hit()) own = ipc::duplicateDescriptor(*shared, &error);
      if (!own) log_error(defaultLog(), "[ERROR] no descriptor for an endpoint: %@", error);
    }
    return std::make_shared<NSXPCListenerEndpoint>(std::move(own));
  });
}

}  // namespace yomber
