#include "fileproviderd/extension_content.h"

#include <chrono>
#include <utility>

#include "fileproviderd/host_errors.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/thread_pool.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/event_loop.h"

namespace yomber {
namespace {

using protocol::Extension;

/// So often the extension may end under a request for content.
constexpr int kAttempts = 4;
constexpr ipc::CallOptions kUnlimited{.timeout = std::chrono::milliseconds::zero()};

NSErrorRef givenUpError() {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError);
}

}  // namespace

void ExtensionContent::withExtension(std::function<void(const ExtensionSessionRef& session)> work,
                                     std::function<void(NSErrorRef error)> missing) {
  supervisor_.acquire([work = std::move(work), missing = std::move(missing)](
                          const ExtensionSessionRef& session, const NSErrorRef& error) {
    if (session == nullptr) return missing(error);
    work(session);
  });
}

void ExtensionContent::fail(const ExtensionSessionRef& session, const NSErrorRef& error,
                            Handler handler) {
  if (isConnectionError(error)) supervisor_.sessionWasLost(session, error);
  explain_(error, std::move(handler));
}

void ExtensionContent::startProviding(const Request& request, Handler handler) {
  start(request, std::move(handler), kAttempts);
}

void ExtensionContent::start(const Request& request, Handler handler, int attempts) {
  const auto ask = [weak = weak_from_this(), request, handler,
                    attempts](const ExtensionSessionRef& session) {
    const auto self = weak.lock();
    if (self == nullptr) return;
    // It may have been given up while there was no extension; nobody would stop what begins now.
    if (!request.isWanted()) return handler(givenUpError());
    self->startOn(session, request, handler, attempts);
  };
  withExtension(ask, handler);
}

void ExtensionContent::startOn(const ExtensionSessionRef& session, const Request& request,
                               Handler handler, int attempts) {
  const auto fill = [request](Extension::StartProvidingParams::Builder params) {
    params.setPath(wireData(request.path));
    params.setOptions(request.options);
  };
  const auto reply = [weak = weak_from_this(), session, request, handler = std::move(handler),
                      attempts](NSErrorRef error,
                                const Extension::StartProvidingResults::Reader* results) {
    const auto self = weak.lock();
    if (self == nullptr) return;
    if (results != nullptr) error = ipc::decodeOptional(results->getFailure());
    if (error == nullptr) return handler(nullptr);
    if (results != nullptr) return self->explain_(error, handler);
    const bool mayRepeat = attempts > 1 && isConnectionError(error) && request.isWanted();
    if (!mayRepeat) return self->fail(session, error, handler);
    self->supervisor_.sessionWasLost(session, error);
    self->start(request, handler, attempts - 1);
  };
  (void)ipc::call(session->remote(), &Extension::Client::startProvidingRequest, fill, reply,
                  kUnlimited);
}

void ExtensionContent::stopProviding(const std::string& path, Handler handler) {
  const auto ask = [weak = weak_from_this(), path, handler](const ExtensionSessionRef& session) {
    (void)ipc::call(
        session->remote(), &Extension::Client::stopProvidingRequest,
        [path](Extension::StopProvidingParams::Builder params) { params.setPath(wireData(path)); },
        [weak, session, handler](const NSErrorRef& error,
                                 const Extension::StopProvidingResults::Reader*) {
          const auto self = weak.lock();
          if (self == nullptr) return;
          if (error == nullptr) return handler(nullptr);
          self->fail(session, error, handler);
        },
        kUnlimited);
  };
  withExtension(ask, handler);
}

void ExtensionContent::isGone(const std::string& path, std::function<void(bool)> handler) {
  ThreadPool::shared().async([path, handler = std::move(handler)]() mutable {
    const bool isFault = isFaultAtPath(path);
    ipc::EventLoop::shared().post([isFault, handler = std::move(handler)] { handler(isFault); });
  });
}

void ExtensionContent::itemChanged(const std::string& path, Handler handler) {
  const auto ask = [weak = weak_from_this(), path, handler](const ExtensionSessionRef& session) {
    (void)ipc::call(
        session->remote(), &Extension::Client::itemChangedRequest,
        [path](Extension::ItemChangedParams::Builder params) { params.setPath(wireData(path)); },
        [weak, session, handler](const NSErrorRef& error,
                                 const Extension::ItemChangedResults::Reader*) {
          const auto self = weak.lock();
          if (self == nullptr) return;
          if (error == nullptr) return handler(nullptr);
          self->fail(session, error, handler);
        },
        kUnlimited);
  };
  withExtension(ask, handler);
}

void ExtensionContent::movingItem(const std::string& path, const std::string& destination,
                                  MoveHandler handler) {
  const auto refused = [handler](NSErrorRef error) { handler(false, std::move(error)); };
  const auto ask = [weak = weak_from_this(), path, destination, handler,
                    refused](const ExtensionSessionRef& session) {
    const auto fill = [path, destination](Extension::MovingItemParams::Builder params) {
      params.setPath(wireData(path));
      params.setDestination(wireData(destination));
    };
    const auto reply = [weak, session, handler, refused](
                           const NSErrorRef& error,
                           const Extension::MovingItemResults::Reader* results) {
      const auto self = weak.lock();
      if (self == nullptr) return;
      if (results == nullptr) return self->fail(session, error, refused);
      const NSErrorRef failure = ipc::decodeOptional(results->getFailure());
      if (failure != nullptr) return self->explain_(failure, refused);
      handler(results->getRequiresProviding(), nullptr);
    };
    (void)ipc::call(session->remote(), &Extension::Client::movingItemRequest, fill, reply,
                    kUnlimited);
  };
  withExtension(ask, refused);
}

}  // namespace yomber
