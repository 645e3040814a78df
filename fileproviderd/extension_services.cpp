#include "fileproviderd/extension_services.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using Endpoint = ipc::Remote<protocol::ServiceEndpoint>;
using protocol::Extension;

void askForAll(ExtensionSession& session, const ServicesRequest& request,
               std::chrono::milliseconds limit, ServicesHandler handler) {
  (void)ipc::call(
      session.remote(), &Extension::Client::servicesRequest,
      [request](Extension::ServicesParams::Builder params) {
        params.setIdentifier(wireText(request.identifier));
        params.setClient(request.client);
      },
      [handler = std::move(handler)](NSErrorRef error,
                                     const Extension::ServicesResults::Reader* results) {
        if (results != nullptr) error = ipc::decodeOptional(results->getFailure());
        if (error != nullptr) {
          return handler(std::nullopt, std::move(error), results == nullptr);
        }
        std::vector<VendedService> services;
        services.reserve(results->getServices().size());
        for (const auto each : results->getServices()) {
          services.push_back({stringFromWire(each.getName()), Endpoint(each.getEndpoint())});
        }
        handler(std::move(services), nullptr, false);
      },
      {.timeout = limit});
}

void askForOne(ExtensionSession& session, const ServicesRequest& request, const std::string& name,
               std::chrono::milliseconds limit, ServicesHandler handler) {
  (void)ipc::call(
      session.remote(), &Extension::Client::serviceRequest,
      [request, name](Extension::ServiceParams::Builder params) {
        params.setIdentifier(wireText(request.identifier));
        params.setName(wireText(name));
        params.setClient(request.client);
      },
      [name, handler = std::move(handler)](NSErrorRef error,
                                           const Extension::ServiceResults::Reader* results) {
        if (results != nullptr) error = ipc::decodeOptional(results->getFailure());
        if (error != nullptr) {
          return handler(std::nullopt, std::move(error), results == nullptr);
        }
        handler(std::vector<VendedService>{{name, Endpoint(results->getEndpoint())}}, nullptr,
                false);
      },
      {.timeout = limit});
}

}  // namespace

void askForServices(ExtensionSession& session, const ServicesRequest& request,
                    std::chrono::milliseconds limit, ServicesHandler handler) {
  if (!request.name) return askForAll(session, request, limit, std::move(handler));
  askForOne(session, request, *request.name, limit, std::move(handler));
}

}  // namespace yomber
