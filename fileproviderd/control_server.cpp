#include "fileproviderd/control_server.h"

#include <climits>
#include <cmath>
#include <string>
#include <utility>

#include "fileproviderd/change_forwarder.h"
#include "fileproviderd/host_errors.h"
#include "fileproviderd/listing.h"
#include "fileproviderd/outcome.h"
#include "fileproviderd/remote_watcher.h"
#include "fileproviderd/thumbnail_fetch.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/process_usage.h"
#include "platform/foundation/url.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Control;

/// No identifier is longer.
constexpr std::size_t kMaximumIdentifierLength = 1'024;
constexpr std::size_t kMaximumThumbnails = 100'000;

/// Keeps a watch for as long as its client holds it.
class WatchServer final : public protocol::Watch::Server {
 public:
  explicit WatchServer(std::shared_ptr<ContainerWatch> watch) : watch_(std::move(watch)) {}

 private:
  const std::shared_ptr<ContainerWatch> watch_;
};

/// Keeps a need for as long as its client holds it.
class NeedServer final : public protocol::Need::Server {
 public:
  explicit NeedServer(ContentNeeds::NeedRef need) : need_(std::move(need)) {}

 private:
  const ContentNeeds::NeedRef need_;
};

/// The location in its one form; empty for what is none.
std::string locationOf(capnp::Data::Reader path) {
  if (path.size() > PATH_MAX) return {};
  const NSURLRef url = NSURL::fileURLWithPath(stringFromWire(path));
  return url != nullptr ? url->path() : std::string();
}

NSErrorRef noLocationError() {
  return invalidRequestError("a location has to be an absolute path");
}

/// Why it cannot be carried out, or nil.
NSErrorRef thumbnailRequestOf(Control::FetchThumbnailsParams::Reader params,
                              ThumbnailFetch::Request& request) {
  request.width = params.getWidth();
  request.height = params.getHeight();
  const auto isSide = [](double side) { return std::isfinite(side) && side >= 1; };
  if (!isSide(request.width) || !isSide(request.height)) {
    return invalidRequestError("a thumbnail is at least one point wide and high");
  }
  if (!params.hasReceiver()) return invalidRequestError("somebody has to receive the thumbnails");
  const auto identifiers = params.getIdentifiers();
  if (identifiers.size() > kMaximumThumbnails) {
    return invalidRequestError("at most " + std::to_string(kMaximumThumbnails) +
                               " thumbnails can be asked for at a time");
  }
  request.identifiers.reserve(identifiers.size());
  for (const auto each : identifiers) {
    if (each.size() > kMaximumIdentifierLength) {
      return invalidRequestError("the identifier is too long");
    }
    request.identifiers.push_back(stringFromWire(each));
  }
  return nullptr;
}

/// The promise of the error that `start` hands to its handler.
template <typename Start>
kj::Promise<NSErrorRef> failureOf(Start start) {
  return outcomeOf<bool>([&](auto handler) {
           start([handler](NSErrorRef error) { handler(true, std::move(error)); });
         })
      .then([](Outcome<bool> outcome) { return std::move(outcome.error); });
}

class ControlServer final : public Control::Server {
 public:
  ControlServer(std::shared_ptr<Host> host, std::uint32_t client)
      : host_(std::move(host)), client_(client) {}

 protected:
  kj::Promise<void> item(ItemContext context) override {
    context.allowCancellation();
    const auto given = context.getParams().getIdentifier();
    if (given.size() > kMaximumIdentifierLength) return refuse(context, "the identifier");
    return outcomeOf<ItemFields>(
               [&](auto handler) { host_->item(stringFromWire(given), std::move(handler)); })
        .then([context](Outcome<ItemFields> outcome) mutable {
          auto result = context.getResults().initResult();
          if (!outcome.value) return ipc::encodeError(outcome.error, result.initError());
          encodeItem(*outcome.value, result.initItem());
        });
  }

  kj::Promise<void> locate(LocateContext context) override {
    context.allowCancellation();
    const auto given = context.getParams().getIdentifier();
    if (given.size() > kMaximumIdentifierLength) return refuse(context, "the identifier");
    return outcomeOf<std::string>(
               [&](auto handler) { host_->locate(stringFromWire(given), std::move(handler)); })
        .then([context](Outcome<std::string> outcome) mutable {
          auto result = context.getResults().initResult();
          if (!outcome.value) return ipc::encodeError(outcome.error, result.initError());
          result.setPath(wireData(*outcome.value));
        });
  }

  kj::Promise<void> identify(IdentifyContext context) override {
    context.allowCancellation();
    const auto given = context.getParams().getPath();
    if (given.size() > PATH_MAX) return refuse(context, "the path");
    return outcomeOf<std::string>(
               [&](auto handler) { host_->identify(stringFromWire(given), std::move(handler)); })
        .then([context](Outcome<std::string> outcome) mutable {
          auto result = context.getResults().initResult();
          if (!outcome.value) return ipc::encodeError(outcome.error, result.initError());
          result.setIdentifier(wireText(*outcome.value));
        });
  }

  kj::Promise<void> list(ListContext context) override {
    const auto params = context.getParams();
    // What is too long for an identifier names nothing.
    auto container = params.getContainer().size() > kMaximumIdentifierLength
                         ? std::string("-")
                         : stringFromWire(params.getContainer());
    const auto explain = [host = host_](const NSErrorRef& error,
                                        std::function<void(NSErrorRef)> handler) {
      host->explain(error, std::move(handler));
    };
    context.getResults().setListing(makeListing(host_->supervisor(), explain, std::move(container),
                                                params.getSortOrder(), host_->callLimit()));
    return kj::READY_NOW;
  }

  kj::Promise<void> watch(WatchContext context) override {
    const auto params = context.getParams();
    auto watcher = makeRemoteWatcher(params.getWatcher());
    std::shared_ptr<ContainerWatch> watch;
    if (params.getContainer().size() <= kMaximumIdentifierLength) {
      watch = host_->watch(stringFromWire(params.getContainer()), watcher);
    }
    if (watch == nullptr) {
      watcher->didEnd(invalidRequestError("there are too many watches, or no such container"),
                      [] {});
    }
    context.getResults().setRegistration(kj::heap<WatchServer>(std::move(watch)));
    return kj::READY_NOW;
  }

  kj::Promise<void> status(StatusContext context) override {
    auto status = context.getResults().initStatus();
    auto& supervisor = host_->supervisor();
    if (const auto& session = supervisor.session()) {
      status.setExtensionPid(static_cast<std::uint32_t>(session->pid()));
      status.setEnumerators(static_cast<std::uint32_t>(session->enumeratorCount()));
    }
    status.setExtensionStarts(supervisor.startCount());
    status.setDaemonReachable(host_->isDaemonReachable());
    status.setWatches(host_->watchCount());
    const auto usage = processUsage();
    status.setResidentBytes(usage.residentBytes);
    status.setOpenDescriptors(usage.openDescriptors);
    ipc::encodeOptional(supervisor.lastFailure(), status.initLastFailure());
    return kj::READY_NOW;
  }

  kj::Promise<void> changes(ChangesContext context) override {
    context.getResults().setChanges(makeChangeForwarder(host_));
    return kj::READY_NOW;
  }

  kj::Promise<void> startProviding(StartProvidingContext context) override {
    context.allowCancellation();
    const auto params = context.getParams();
    const std::string path = locationOf(params.getPath());
    if (path.empty()) return fail(context, noLocationError());
    ContentNeeds::NeedRef need;
    auto failure = failureOf([&](ContentNeeds::Handler handler) {
      need = host_->contentNeeds().need(path, params.getOptions(), std::move(handler));
    });
    if (need == nullptr) return fail(context, invalidRequestError("too many items are in use"));
    return failure.then([context, need = std::move(need)](const NSErrorRef& error) mutable {
      auto results = context.getResults();
      ipc::encodeOptional(error, results.initFailure());
      if (error == nullptr) results.setNeed(kj::heap<NeedServer>(std::move(need)));
    });
  }

  kj::Promise<void> stopProviding(StopProvidingContext context) override {
    const std::string path = locationOf(context.getParams().getPath());
    if (path.empty()) return fail(context, noLocationError());
    return failureOf([&](ContentNeeds::Handler handler) {
             host_->contentNeeds().stop(path, std::move(handler));
           })
        .then([context](const NSErrorRef& error) mutable {
          ipc::encodeOptional(error, context.getResults().initFailure());
        });
  }

  kj::Promise<void> itemChanged(ItemChangedContext context) override {
    const std::string path = locationOf(context.getParams().getPath());
    if (path.empty()) return fail(context, noLocationError());
    return failureOf([&](ContentNeeds::Handler handler) {
             host_->content().itemChanged(path, std::move(handler));
           })
        .then([context](const NSErrorRef& error) mutable {
          ipc::encodeOptional(error, context.getResults().initFailure());
        });
  }

  kj::Promise<void> movingItem(MovingItemContext context) override {
    context.allowCancellation();
    const std::string path = locationOf(context.getParams().getPath());
    const std::string destination = locationOf(context.getParams().getDestination());
    if (path.empty() || destination.empty()) return fail(context, noLocationError());
    return outcomeOf<bool>([&](auto handler) {
             host_->content().movingItem(path, destination, std::move(handler));
           })
        .then([context](const Outcome<bool>& outcome) mutable {
          auto results = context.getResults();
          results.setRequiresProviding(outcome.value.value_or(false));
          ipc::encodeOptional(outcome.error, results.initFailure());
        });
  }

  kj::Promise<void> fetchThumbnails(FetchThumbnailsContext context) override {
    context.allowCancellation();
    const auto params = context.getParams();
    ThumbnailFetch::Request request;
    if (const NSErrorRef error = thumbnailRequestOf(params, request)) return fail(context, error);
    ipc::Remote<protocol::ThumbnailReceiver> receiver(params.getReceiver());
    context.releaseParams();
    auto fetch = host_->thumbnailFetch(std::move(request), std::move(receiver));
    if (fetch == nullptr) {
      return fail(context, invalidRequestError("too many thumbnails are asked for at a time"));
    }
    return failureOf([&](ThumbnailFetch::Handler handler) { fetch->start(std::move(handler)); })
        .then([context, fetch](const NSErrorRef& error) mutable {
          ipc::encodeOptional(error, context.getResults().initFailure());
        });
  }

  kj::Promise<void> services(ServicesContext context) override {
    context.allowCancellation();
    const auto given = context.getParams().getIdentifier();
    if (given.size() > kMaximumIdentifierLength) return fail(context, tooLongError());
    return vended(stringFromWire(given), std::nullopt).then([context](Vended outcome) mutable {
      auto results = context.getResults();
      ipc::encodeOptional(outcome.error, results.initFailure());
      if (!outcome.value) return;
      auto services = results.initServices(static_cast<unsigned>(outcome.value->size()));
      for (unsigned i = 0; i < services.size(); ++i) {
        services[i].setName(wireText((*outcome.value)[i].name));
        services[i].setEndpoint((*outcome.value)[i].endpoint.client());
      }
    });
  }

  kj::Promise<void> service(ServiceContext context) override {
    context.allowCancellation();
    const auto params = context.getParams();
    if (params.getIdentifier().size() > kMaximumIdentifierLength ||
        params.getName().size() > kMaximumIdentifierLength) {
      return fail(context, tooLongError());
    }
    return vended(stringFromWire(params.getIdentifier()), stringFromWire(params.getName()))
        .then([context](Vended outcome) mutable {
          auto results = context.getResults();
          ipc::encodeOptional(outcome.error, results.initFailure());
          if (!outcome.value || outcome.value->empty()) return;
          results.setEndpoint(outcome.value->front().endpoint.client());
        });
  }

 private:
  using Vended = Outcome<std::vector<VendedService>>;

  kj::Promise<Vended> vended(const std::string& identifier,
                             const std::optional<std::string>& name) {
    return outcomeOf<std::vector<VendedService>>(
        [&](auto handler) { host_->services({identifier, name, client_}, std::move(handler)); });
  }

  static NSErrorRef tooLongError() {
    return invalidRequestError("the identifier or the service's name is too long");
  }

  template <typename Context>
  static kj::Promise<void> fail(Context& context, const NSErrorRef& error) {
    ipc::encodeOptional(error, context.getResults().initFailure());
    return kj::READY_NOW;
  }

  template <typename Context>
  static kj::Promise<void> refuse(Context& context, const char* what) {
    const auto error = invalidRequestError(std::string(what) + " is too long");
    ipc::encodeError(error, context.getResults().initResult().initError());
    return kj::READY_NOW;
  }

  const std::shared_ptr<Host> host_;
  const std::uint32_t client_;
};

}  // namespace

Control::Client makeControlServer(std::shared_ptr<Host> host, std::uint32_t client) {
  return kj::heap<ControlServer>(std::move(host), client);
}

}  // namespace yomber
