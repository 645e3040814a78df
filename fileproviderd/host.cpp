#include "fileproviderd/host.h"

#include <algorithm>
#include <utility>

#include "fileproviderd/host_errors.h"
#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/errors.h"
#include "platform/foundation/log.h"

namespace yomber {
namespace {

constexpr int kAttempts = 2;

/// Why the extension answered nil: what was asked for is missing, unless the root says that nothing
/// can be had at all (nobody is signed in, say). `session` must live until the answer.
void explainNil(ExtensionSession& session, NSErrorRef missing, AnswerHandler<std::string> handler) {
  session.item(
      NSFileProviderRootContainerItemIdentifier,
      [missing = std::move(missing), handler = std::move(handler)](
          const std::optional<ItemFields>& /*root*/, const NSErrorRef& error, bool isUnanswered) {
        const bool isRootKnown = error == nullptr || isNoSuchItemError(error);
        handler(std::nullopt, isRootKnown ? missing : error, isUnanswered);
      });
}

NSErrorRef noItemAtPathError(const std::string& path) {
  return NSError::errorWithDomain(
      NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem,
      {{NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey, "the drive has no item at " + path}});
}

bool isInterruption(const NSErrorRef& error) {
  return error != nullptr && error->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted);
}

}  // namespace

Host::Host(Options options)
    : options_(std::move(options)),
      launcher_({.program = options_.extensionProgram,
                 .home = options_.paths.home,
                 .callLimit = options_.callLimit}) {}

std::shared_ptr<Host> Host::create(Options options) {
  std::shared_ptr<Host> host(new Host(std::move(options)));
  host->wire();
  return host;
}

void Host::wire() {
  const std::weak_ptr<Host> weak = weak_from_this();
  const auto didSignal = [weak](const std::string& container) {
    if (const auto self = weak.lock()) self->didSignal(container);
  };
  const auto didConnect = [weak] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    for (const auto& watch : self->watches()) watch->wake();
  };
  const auto didEnd = [weak](const NSErrorRef& reason) {
    const auto self = weak.lock();
    if (self == nullptr) return;
    for (const auto& watch : self->watches()) watch->extensionDidEnd(reason);
  };
  zarn_ = std::make_shared<ZarnLink>(options_.paths, clock_,
                                     ZarnLink::Events{didConnect, didSignal}, random_);
  supervisor_ = std::make_shared<ExtensionSupervisor>(
      launcher_, *zarn_, clock_, ExtensionSupervisor::Events{didEnd, didSignal}, random_,
      options_.supervision);
}

void Host::start() { zarn_->start(); }

void Host::didSignal(const std::string& container) {
  // The root is signalled when the account changes, and with each of its own changes.
  const bool mayBeSignIn = container == NSFileProviderRootContainerItemIdentifier;
  for (const auto& watch : watches()) {
    if (watch->container() == container) watch->signalled();
    if (mayBeSignIn) watch->accountMayHaveChanged();
  }
}

std::vector<std::shared_ptr<ContainerWatch>> Host::watches() {
  std::erase_if(watches_, [](const auto& watch) { return watch.expired(); });
  std::vector<std::shared_ptr<ContainerWatch>> living;
  for (const auto& weak : watches_) {
    if (auto watch = weak.lock()) living.push_back(std::move(watch));
  }
  return living;
}

std::uint32_t Host::watchCount() const {
  return static_cast<std::uint32_t>(std::count_if(
      watches_.begin(), watches_.end(), [](const auto& watch) { return !watch.expired(); }));
}

std::shared_ptr<ContainerWatch> Host::watch(const std::string& container,
                                            std::shared_ptr<ContainerWatcher> watcher) {
  if (watches().size() >= options_.maximumWatches) return nullptr;
  auto watch = std::make_shared<ContainerWatch>(container, *this, clock_, std::move(watcher),
                                                random_, options_.watching);
  watches_.push_back(watch);
  watch->start();
  return watch;
}

std::shared_ptr<ThumbnailFetch> Host::thumbnailFetch(
    ThumbnailFetch::Request request, ipc::Remote<protocol::ThumbnailReceiver> receiver) {
  std::erase_if(thumbnailFetches_, [](const auto& fetch) { return fetch.expired(); });
  if (thumbnailFetches_.size() >= options_.maximumThumbnailFetches) return nullptr;
  const auto explainError = [weak = weak_from_this()](const NSErrorRef& error,
                                                      std::function<void(NSErrorRef)> handler) {
    const auto self = weak.lock();
    if (self == nullptr) return handler(error);
    self->explain(error, std::move(handler));
  };
  auto fetch = std::make_shared<ThumbnailFetch>(*supervisor_, explainError, std::move(request),
                                                std::move(receiver));
  thumbnailFetches_.push_back(fetch);
  return fetch;
}

void Host::enumerator(const std::string& container, EnumeratorHandler handler) {
  supervisor_->acquire([container, handler = std::move(handler)](const ExtensionSessionRef& session,
                                                                 const NSErrorRef& error) {
    if (session == nullptr) return handler(nullptr, error);
    session->enumerator(container, handler);
  });
}

void Host::isGone(const std::string& container, std::function<void(bool)> handler) {
  zarn_->isGone(container, std::move(handler));
}

template <typename Answer, typename Ask>
void Host::ask(Ask ask, std::function<void(std::optional<Answer>, NSErrorRef)> handler,
               int attempts) {
  supervisor_->acquire([weak = weak_from_this(), ask, handler = std::move(handler), attempts](
                           const ExtensionSessionRef& session, const NSErrorRef& error) {
    if (session == nullptr) return handler(std::nullopt, error);
    // The answer's handler keeps the session.
    ask(*session, [weak, ask, handler, attempts, session](std::optional<Answer> answer,
                                                          NSErrorRef failure, bool isUnanswered) {
      const auto self = weak.lock();
      if (self == nullptr) return handler(std::nullopt, failure);
      const bool wasLost = isUnanswered && isInterruption(failure);
      if (wasLost) {
        self->supervisor_->sessionWasLost(session, failure);
        if (attempts > 1) return self->ask<Answer>(ask, handler, attempts - 1);
      }
      if (failure == nullptr) return handler(std::move(answer), nullptr);
      self->explain(failure, wasLost, [handler](NSErrorRef explained) {
        handler(std::nullopt, std::move(explained));
      });
    });
  });
}

void Host::item(const std::string& identifier, ItemHandler handler) {
  ask<ItemFields>(
      [identifier](ExtensionSession& session, AnswerHandler<ItemFields> answer) {
        session.item(identifier, std::move(answer));
      },
      std::move(handler), kAttempts);
}

void Host::locate(const std::string& identifier, TextHandler handler) {
  ask<std::string>(
      [identifier, limit = options_.callLimit](ExtensionSession& session,
                                               AnswerHandler<std::string> answer) {
        session.locate(identifier, limit,
                       [identifier, &session, answer = std::move(answer)](
                           std::optional<std::string> path, NSErrorRef error, bool isUnanswered) {
                         if (path || error != nullptr) {
                           return answer(std::move(path), std::move(error), isUnanswered);
                         }
                         explainNil(session,
                                    fileProviderErrorForNonExistentItemWithIdentifier(identifier),
                                    answer);
                       });
      },
      std::move(handler), kAttempts);
}

void Host::identify(const std::string& path, TextHandler handler) {
  ask<std::string>(
      [path](ExtensionSession& session, AnswerHandler<std::string> answer) {
        session.identify(
            path, [path, &session, answer = std::move(answer)](
                      std::optional<std::string> identifier, NSErrorRef error, bool isUnanswered) {
              if (identifier || error != nullptr) {
                return answer(std::move(identifier), std::move(error), isUnanswered);
              }
              explainNil(session, noItemAtPathError(path), answer);
            });
      },
      std::move(handler), kAttempts);
}

void Host::services(const ServicesRequest& request, VendedServicesHandler handler) {
  const auto answer = [weak = weak_from_this(), handler = std::move(handler)](
                          std::optional<std::vector<VendedService>> services, NSErrorRef error) {
    const auto self = weak.lock();
    const bool isStuck = error != nullptr && error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut);
    if (self != nullptr && isStuck) self->supervisor_->suspect();
    handler(std::move(services), std::move(error));
  };
  ask<std::vector<VendedService>>(
      [request, limit = options_.callLimit](ExtensionSession& session, ServicesHandler each) {
        askForServices(session, request, limit, std::move(each));
      },
      answer, kAttempts);
}

void Host::explain(const NSErrorRef& error, std::function<void(NSErrorRef)> handler) {
  explain(error, isInterruption(error), std::move(handler));
}

void Host::explain(const NSErrorRef& error, bool wasLost, std::function<void(NSErrorRef)> handler) {
  // The extension cannot tell a missing item from a missing zarn.
  if (!isConnectionError(error) && !isNoSuchItemError(error)) return handler(error);
  zarn_->probe([error, wasLost, handler = std::move(handler)](const NSErrorRef& missing) {
    if (missing != nullptr) return handler(zarnNotRunningError(error));
    if (!wasLost) return handler(error);
    handler(extensionUnavailableError("ended in the middle of the request", error));
  });
}

}  // namespace yomber
