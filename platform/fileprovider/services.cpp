#include "platform/fileprovider/services.h"

#include <poll.h>

#include <optional>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/thread_pool.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/error_codec.h"
#include "platform/xpc/endpoint_wire.h"
#include "protocols/control.capnp.h"

namespace yomber {

using protocol::Control;

/// The host's control socket.
class ServiceHost {
 public:
  struct Named {
    NSFileProviderServiceName name;
    NSXPCListenerEndpointRef endpoint;
  };
  struct Answer {
    std::vector<Named> services;
    NSErrorRef error;
  };

  ServiceHost(DrivePaths paths, std::chrono::milliseconds patience)
      : paths_(std::move(paths)), patience_(patience) {}

  /// Waits for the host.
  Answer services(const NSFileProviderItemIdentifier& identifier);
  Answer service(const NSFileProviderItemIdentifier& identifier,
                 const NSFileProviderServiceName& name);

 private:
  using Promised = kj::Promise<std::vector<Named>>;

  ipc::Remote<Control> control(NSErrorRef* error);
  template <typename Params, typename Results, typename Fill, typename Take>
  Answer ask(ipc::RequestMethod<Control::Client, Params, Results> method, Fill fill, Take take);

  const DrivePaths paths_;
  const std::chrono::milliseconds patience_;
  Mutex mutex_;
  ipc::Connection::Ref connection_ GUARDED_BY(mutex_);
};

namespace {

/// Waits for what the loop thread makes of the results, which may take it several turns.
struct Awaited {
  ipc::Gate done;
  ServiceHost::Answer answer;
};

kj::Promise<ServiceHost::Named> named(std::string name,
                                      protocol::ServiceEndpoint::Client capability) {
  return endpointOf(kj::mv(capability)).then([name = std::move(name)](auto endpoint) mutable {
    return ServiceHost::Named{std::move(name), std::move(endpoint)};
  });
}

kj::Promise<std::vector<ServiceHost::Named>> allOf(
    kj::Array<kj::Promise<ServiceHost::Named>> promises) {
  return kj::joinPromises(kj::mv(promises)).then([](kj::Array<ServiceHost::Named> all) {
    std::vector<ServiceHost::Named> services;
    services.reserve(all.size());
    for (auto& each : all) services.push_back(std::move(each));
    return services;
  });
}

}  // namespace

ipc::Remote<Control> ServiceHost::control(NSErrorRef* error) {
  LockGuard guard(mutex_);
  if (connection_ == nullptr || !connection_->isConnected()) {
    NSErrorRef failure;
    connection_ = ipc::Connection::connect(paths_.controlSocket, &failure);
    if (connection_ == nullptr) {
      storeError(error, NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionInvalid,
                                                 {{NSLocalizedDescriptionKey,
                                                   "the drive at " + paths_.home + " is not up: " +
                                                       failure->localizedDescription()},
                                                  {NSUnderlyingErrorKey, failure}}));
      return nullptr;
    }
  }
  return connection_->bootstrap<Control>();
}

template <typename Params, typename Results, typename Fill, typename Take>
ServiceHost::Answer ServiceHost::ask(ipc::RequestMethod<Control::Client, Params, Results> method,
                                     Fill fill, Take take) {
  const auto awaited = std::make_shared<Awaited>();
  const auto remote = control(&awaited->answer.error);
  if (!remote) return std::move(awaited->answer);
  (void)ipc::call(remote, method, std::move(fill),
                  [awaited, take](NSErrorRef error, const typename Results::Reader* results) {
                    if (results != nullptr) error = ipc::decodeOptional(results->getFailure());
                    if (error != nullptr) {
                      awaited->answer.error = std::move(error);
                      return awaited->done.open();
                    }
                    ipc::EventLoop::shared().detach(take(*results).then(
                        [awaited](std::vector<Named> services) {
                          awaited->answer.services = std::move(services);
                          awaited->done.open();
                        },
                        [awaited](kj::Exception&& exception) {
                          awaited->answer.error = ipc::connectionError(exception);
                          awaited->done.open();
                        }));
                  },
                  {.timeout = patience_});
  awaited->done.wait();
  return std::move(awaited->answer);
}

ServiceHost::Answer ServiceHost::services(const NSFileProviderItemIdentifier& identifier) {
  return ask(
      &Control::Client::servicesRequest,
      [identifier](Control::ServicesParams::Builder params) {
        params.setIdentifier(wireText(identifier));
      },
      [](Control::ServicesResults::Reader results) {
        auto promises = kj::heapArrayBuilder<kj::Promise<Named>>(results.getServices().size());
        for (const auto each : results.getServices()) {
          promises.add(named(stringFromWire(each.getName()), each.getEndpoint()));
        }
        return allOf(promises.finish());
      });
}

ServiceHost::Answer ServiceHost::service(const NSFileProviderItemIdentifier& identifier,
                                         const NSFileProviderServiceName& name) {
  return ask(
      &Control::Client::serviceRequest,
      [identifier, name](Control::ServiceParams::Builder params) {
        params.setIdentifier(wireText(identifier));
        params.setName(wireText(name));
      },
      [name](Control::ServiceResults::Reader results) {
        auto promises = kj::heapArrayBuilder<kj::Promise<Named>>(1);
        promises.add(named(name, results.getEndpoint()));
        return allOf(promises.finish());
      });
}

/// Whether nobody is at the other end.
bool isHungUp(const ipc::UniqueFd& socket) {
  pollfd look{.fd = socket.get(), .events = 0, .revents = 0};
  return ::poll(&look, 1, 0) == 1 && (look.revents & POLLHUP) != 0;
}

NSErrorRef noDescriptorError() {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSXPCConnectionInvalid,
      {{NSLocalizedDescriptionKey,
        std::string("the service's descriptor did not arrive: this process or the host may be out "
                    "of them; close connections that are not needed, or raise the limit of open "
                    "files, and ask again")}});
}

// ---- What applications see ---------------------------------------------------------------------

NSFileProviderService::NSFileProviderService(std::shared_ptr<ServiceHost> host,
                                             NSFileProviderItemIdentifier identifier,
                                             NSFileProviderServiceName name,
                                             NSXPCListenerEndpointRef endpoint)
    : host_(std::move(host)),
      identifier_(std::move(identifier)),
      name_(std::move(name)),
      endpoint_(std::move(endpoint)) {}

NSXPCConnectionRef NSFileProviderService::fileProviderConnection(NSErrorRef* error) const {
  if (ipc::UniqueFd socket = endpoint_->takeSocket(); socket && !isHungUp(socket)) {
    return NSXPCConnection::initWithListenerEndpoint(
        std::make_shared<NSXPCListenerEndpoint>(std::move(socket)));
  }
  auto answer = host_->service(identifier_, name_);
  if (answer.services.empty()) {
    storeError(error, std::move(answer.error));
    return nullptr;
  }
  auto& endpoint = answer.services.front().endpoint;
  if (!endpoint->isUsable()) {
    storeError(error, noDescriptorError());
    return nullptr;
  }
  return NSXPCConnection::initWithListenerEndpoint(std::move(endpoint));
}

void NSFileProviderService::getFileProviderConnectionWithCompletionHandler(
    ConnectionHandler handler) const {
  ThreadPool::shared().async([self = NSFileProviderService(*this), handler = std::move(handler)] {
    NSErrorRef error;
    auto connection = self.fileProviderConnection(&error);
    if (handler) handler(std::move(connection), std::move(error));
  });
}

NSFileProviderServices::NSFileProviderServices(DrivePaths paths, std::chrono::milliseconds patience)
    : host_(std::make_shared<ServiceHost>(std::move(paths), patience)) {}

std::vector<NSFileProviderServiceRef> NSFileProviderServices::servicesForItemIdentifier(
    const NSFileProviderItemIdentifier& identifier, NSErrorRef* error) const {
  auto answer = host_->services(identifier);
  if (answer.error != nullptr) storeError(error, std::move(answer.error));
  std::vector<NSFileProviderServiceRef> services;
  services.reserve(answer.services.size());
  for (auto& each : answer.services) {
    services.push_back(std::make_shared<NSFileProviderService>(
        host_, identifier, std::move(each.name), std::move(each.endpoint)));
  }
  return services;
}

NSFileProviderServiceRef NSFileProviderServices::serviceForItemIdentifier(
    const NSFileProviderItemIdentifier& identifier, const NSFileProviderServiceName& name,
    NSErrorRef* error) const {
  auto answer = host_->service(identifier, name);
  if (answer.services.empty()) {
    storeError(error, std::move(answer.error));
    return nullptr;
  }
  return std::make_shared<NSFileProviderService>(host_, identifier, name,
                                                 std::move(answer.services.front().endpoint));
}

}  // namespace yomber
