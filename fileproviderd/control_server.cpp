#include "fileproviderd/control_server.h"

#include <climits>
#include <optional>
#include <utility>

#include "fileproviderd/host_errors.h"
#include "fileproviderd/listing.h"
#include "fileproviderd/remote_watcher.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/process_usage.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Control;

/// No identifier is longer.
constexpr std::size_t kMaximumIdentifierLength = 1'024;

/// A value or an error, on its way into a reply.
template <typename Value>
struct Outcome {
  std::optional<Value> value;
  NSErrorRef error;
};

/// The promise of what `start` hands to its handler.
template <typename Value, typename Start>
kj::Promise<Outcome<Value>> outcomeOf(Start start) {
  auto pair = kj::newPromiseAndFulfiller<Outcome<Value>>();
  auto fulfiller =
      std::make_shared<kj::Own<kj::PromiseFulfiller<Outcome<Value>>>>(kj::mv(pair.fulfiller));
  start([fulfiller](std::optional<Value> value, NSErrorRef error) {
    (*fulfiller)->fulfill({std::move(value), std::move(error)});
  });
  return kj::mv(pair.promise);
}

/// Keeps a watch for as long as its client holds it.
class WatchServer final : public protocol::Watch::Server {
 public:
  explicit WatchServer(std::shared_ptr<ContainerWatch> watch) : watch_(std::move(watch)) {}

 private:
  const std::shared_ptr<ContainerWatch> watch_;
};

class ControlServer final : public Control::Server {
 public:
  explicit ControlServer(std::shared_ptr<Host> host) : host_(std::move(host)) {}

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

 private:
  template <typename Context>
  static kj::Promise<void> refuse(Context& context, const char* what) {
    const auto error = invalidRequestError(std::string(what) + " is too long");
    ipc::encodeError(error, context.getResults().initResult().initError());
    return kj::READY_NOW;
  }

  const std::shared_ptr<Host> host_;
};

}  // namespace

Control::Client makeControlServer(std::shared_ptr<Host> host) {
  return kj::heap<ControlServer>(std::move(host));
}

}  // namespace yomber
