#include "platform/fileprovider/service_requests.h"

#include <map>
#include <utility>

#include "platform/fileprovider/errors.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/log.h"
#include "platform/xpc/listener.h"

namespace yomber {
namespace {

/// The endpoints that wait for their clients.
class WaitingEndpoints {
 public:
  /// Nil, or why there is no place for another one of that client.
  NSErrorRef enter(std::uint32_t client) {
    LockGuard guard(mutex_);
    if (total_ == kMaximumWaitingEndpoints) return tooMany(total_, "all programs together");
    const auto found = ofClients_.find(client);
    if (found != ofClients_.end() && found->second == kMaximumWaitingOfOneClient)
      return tooMany(found->second, "this program");
    ++ofClients_[client];
    ++total_;
    return nullptr;
  }
  void leave(std::uint32_t client) {
    LockGuard guard(mutex_);
    --total_;
    const auto found = ofClients_.find(client);
    if (--found->second == 0) ofClients_.erase(found);
  }

 private:
  static NSErrorRef tooMany(std::size_t count, const char* whose) {
    return NSError::errorWithDomain(
        NSCocoaErrorDomain, NSXPCConnectionInvalid,
        {{NSLocalizedDescriptionKey,
          std::to_string(count) + " services wait for " + whose +
              " to connect to them; connect to them, or let go of those that are not needed, and "
              "ask again"}});
  }

  Mutex mutex_;
  std::map<std::uint32_t, std::size_t> ofClients_ GUARDED_BY(mutex_);
  std::size_t total_ GUARDED_BY(mutex_) = 0;
};

/// Never destroyed: endpoints are let go of until the very end.
WaitingEndpoints& waitingEndpoints() {
  static auto* const all = new WaitingEndpoints();
  return *all;
}

/// A place among the endpoints that wait; free again when it goes.
class WaitingPlace {
 public:
  explicit WaitingPlace(std::uint32_t client)
      : client_(client), refusal_(waitingEndpoints().enter(client)) {}
  ~WaitingPlace() {
    if (!refusal_) waitingEndpoints().leave(client_);
  }
  WaitingPlace(const WaitingPlace&) = delete;
  WaitingPlace& operator=(const WaitingPlace&) = delete;
  [[nodiscard]] const NSErrorRef& refusal() const { return refusal_; }

 private:
  const std::uint32_t client_;
  const NSErrorRef refusal_;
};

/// The endpoint, and the source kept for as long as somebody may connect to it.
NSXPCListenerEndpointRef endpointOfSource(const NSFileProviderServiceSourceRef& source,
                                          std::uint32_t client, NSErrorRef* error) {
  const auto place = std::make_shared<const WaitingPlace>(client);
  if (place->refusal()) {
    storeError(error, place->refusal());
    return nullptr;
  }
  auto endpoint = source->makeListenerEndpointAndReturnError(error);
  if (endpoint == nullptr) return nullptr;
  if (!endpoint->isUsable()) {
    storeError(error, NSError::errorWithDomain(
                          NSCocoaErrorDomain, NSXPCConnectionInvalid,
                          {{NSLocalizedDescriptionKey,
                            std::string("the extension is out of descriptors; close services that "
                                        "are not needed, or raise the limit of open files")}}));
    return nullptr;
  }
  endpoint->whenSettled([source, place] { (void)source; });
  return endpoint;
}

}  // namespace

NSErrorRef noSuchServiceError(const NSFileProviderItemIdentifier& identifier,
                              const NSFileProviderServiceName& name) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFeatureUnsupportedError,
      {{NSLocalizedDescriptionKey, "the item " + identifier + " has no service \"" + name + "\""}});
}

VendedServices vendServices(NSFileProviderExtension& extension,
                            const NSFileProviderItemIdentifier& identifier,
                            const std::optional<NSFileProviderServiceName>& name,
                            std::uint32_t client) {
  VendedServices vended;
  const auto sources =
      extension.supportedServiceSourcesForItemIdentifier(identifier, &vended.error);
  if (vended.error != nullptr) return vended;
  for (const auto& source : sources) {
    if (source == nullptr || (name && source->serviceName() != *name)) continue;
    if (vended.services.size() == kMaximumServices) {
      log_error(defaultLog(), "[ERROR] %@ has more services than can be told of", identifier);
      break;
    }
    auto endpoint = endpointOfSource(source, client, &vended.error);
    if (endpoint == nullptr) {
      vended.services.clear();
      return vended;
    }
    vended.services.push_back({source->serviceName(), std::move(endpoint)});
  }
  if (name && vended.services.empty()) vended.error = noSuchServiceError(identifier, *name);
  return vended;
}

}  // namespace yomber
