#include "platform/fileprovider/extension_server.h"

#include <atomic>
#include <cerrno>
#include <climits>
#include <cmath>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "platform/fileprovider/changes_server.h"
#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/extension_code.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/reply_observers.h"
#include "platform/fileprovider/service_requests.h"
#include "platform/fileprovider/thumbnail_request.h"
#include "platform/foundation/serial_queue.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/loop_reply.h"
#include "platform/ipc/server_call.h"
#include "platform/xpc/endpoint_wire.h"

namespace yomber {
namespace {

using ipc::CancelFlag;

NSErrorRef tokenTooLong() {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, EINVAL,
      {{NSLocalizedDescriptionKey,
        std::string("a page token or sync anchor is longer than any extension makes them")}});
}

NSFileProviderPage decodePage(protocol::Enumerator::Page::Reader page) {
  switch (page.which()) {
    case protocol::Enumerator::Page::NONE:
      return nullptr;
    case protocol::Enumerator::Page::INITIAL_BY_NAME:
      return NSFileProviderInitialPageSortedByName;
    case protocol::Enumerator::Page::INITIAL_BY_DATE:
      return NSFileProviderInitialPageSortedByDate;
    case protocol::Enumerator::Page::TOKEN:
      return NSData::dataWithString(stringFromWire(page.getToken()));
  }
  return nullptr;
}

std::uint64_t wordsOf(const NSFileProviderItems& items) {
  std::uint64_t words = 0;
  for (const auto& item : items) words += encodedItemWords(item->fields());
  return words;
}

capnp::MessageSize sizeHint(std::uint64_t words) { return {words + 64, 0}; }

/// The two replies' encoders; on the loop thread.
template <typename Context>
void encodePage(const EnumeratedPage& page, Context& context) {
  auto result = context.getResults(sizeHint(wordsOf(page.items))).initResult();
  if (page.error != nullptr) {
    ipc::encodeError(page.error, result.initError());
    return;
  }
  auto out = result.initPage();
  encodeItems(page.items, out.initItems(static_cast<unsigned>(page.items.size())));
  if (page.next != nullptr) out.initNext().setValue(wireData(page.next->bytes()));
}

template <typename Context>
void encodeChanges(const EnumeratedChanges& changes, Context& context) {
  auto result = context.getResults(sizeHint(wordsOf(changes.updated))).initResult();
  if (changes.error != nullptr) {
    ipc::encodeError(changes.error, result.initError());
    return;
  }
  auto out = result.initChanges();
  encodeItems(changes.updated, out.initUpdated(static_cast<unsigned>(changes.updated.size())));
  auto deleted = out.initDeleted(static_cast<unsigned>(changes.deleted.size()));
  for (unsigned i = 0; i < deleted.size(); ++i) deleted.set(i, wireText(changes.deleted[i]));
  out.setAnchor(wireData(changes.anchor->bytes()));
  out.setMoreComing(changes.moreComing);
}

/// An enumerator and whether it was told to end. Shared with the work on the pool.
class HeldEnumerator {
 public:
  explicit HeldEnumerator(NSFileProviderEnumeratorRef enumerator)
      : enumerator_(std::move(enumerator)),
        changes_(std::dynamic_pointer_cast<NSFileProviderChangeEnumerator>(enumerator_)) {}

  [[nodiscard]] NSFileProviderEnumerator& items() const { return *enumerator_; }
  /// Null when it tells no changes.
  [[nodiscard]] NSFileProviderChangeEnumerator* changes() const { return changes_.get(); }
  void invalidateOnce() {
    if (!invalidated_.exchange(true)) enumerator_->invalidate();
  }

 private:
  const NSFileProviderEnumeratorRef enumerator_;
  const std::shared_ptr<NSFileProviderChangeEnumerator> changes_;
  std::atomic<bool> invalidated_{false};
};

class EnumeratorServer final : public protocol::Enumerator::Server {
 public:
  explicit EnumeratorServer(NSFileProviderEnumeratorRef enumerator)
      : held_(std::make_shared<HeldEnumerator>(std::move(enumerator))) {}
  ~EnumeratorServer() noexcept {
    runExtensionCode("invalidate", [held = held_] { held->invalidateOnce(); });
  }

 protected:
  kj::Promise<void> enumerateItems(EnumerateItemsContext context) override {
    context.allowCancellation();
    const auto wanted = context.getParams().getPage();
    if (wanted.isToken() && wanted.getToken().size() > kMaximumTokenLength) {
      ipc::encodeError(tokenTooLong(), context.getResults().initResult().initError());
      return kj::READY_NOW;
    }
    auto page = decodePage(wanted);
    context.releaseParams();
    auto reply = ipc::LoopReply<EnumeratedPage>::make();
    runExtensionCode(
        "enumerateItemsForObserver",
        [held = held_, page = std::move(page),
         observer = std::make_shared<PageObserver>(std::move(reply.fulfill))]() mutable {
          held->items().enumerateItemsForObserver(std::move(observer), std::move(page));
        });
    return reply.promise.then(
        [context](EnumeratedPage told) mutable { encodePage(told, context); });
  }

  kj::Promise<void> enumerateChanges(EnumerateChangesContext context) override {
    context.allowCancellation();
    const auto given = context.getParams().getAnchor();
    if (given.size() > kMaximumTokenLength || held_->changes() == nullptr) {
      const auto error = held_->changes() == nullptr
                             ? fileProviderErrorForUnsupportedFeature("changes of this container")
                             : tokenTooLong();
      ipc::encodeError(error, context.getResults().initResult().initError());
      return kj::READY_NOW;
    }
    auto anchor = NSData::dataWithString(stringFromWire(given));
    context.releaseParams();
    auto reply = ipc::LoopReply<EnumeratedChanges>::make();
    runExtensionCode(
        "enumerateChangesForObserver",
        [held = held_, anchor = std::move(anchor),
         observer = std::make_shared<ChangesObserver>(std::move(reply.fulfill))]() mutable {
          held->changes()->enumerateChangesForObserver(std::move(observer), std::move(anchor));
        });
    return reply.promise.then(
        [context](EnumeratedChanges told) mutable { encodeChanges(told, context); });
  }

  kj::Promise<void> currentSyncAnchor(CurrentSyncAnchorContext context) override {
    context.allowCancellation();
    if (held_->changes() == nullptr) return kj::READY_NOW;
    auto reply = ipc::LoopReply<NSFileProviderSyncAnchor>::make();
    runExtensionCode("currentSyncAnchor", [held = held_, fulfill = std::move(reply.fulfill)] {
      held->changes()->currentSyncAnchorWithCompletionHandler(fulfill);
    });
    return reply.promise.then([context](NSFileProviderSyncAnchor anchor) mutable {
      if (anchor == nullptr) return;
      auto results = context.getResults();
      results.setSupported(true);
      results.setAnchor(wireData(anchor->bytes()));
    });
  }

  kj::Promise<void> invalidate(InvalidateContext /*context*/) override {
    return ipc::onPool([held = held_](const CancelFlag&) { held->invalidateOnce(); });
  }

 private:
  const std::shared_ptr<HeldEnumerator> held_;
};

/// Where the starts and stops of providing run: those of one location in the order in which they
/// came. A stop that overtook its start would find nothing to end, and the start would go on for
/// nobody. Those of different locations do not wait for each other.
///
/// Thread-safety: loop thread only.
class ProvidingQueues {
 public:
  /// To be kept by what runs there.
  std::shared_ptr<SerialQueue> of(const NSURLRef& url) {
    const auto found = queues_.find(url->path());
    if (found != queues_.end()) {
      if (auto queue = found->second.lock()) return queue;
    }
    std::erase_if(queues_, [](const auto& each) { return each.second.expired(); });
    auto queue = SerialQueue::create("providing");
    queues_[url->path()] = queue;
    return queue;
  }

 private:
  std::map<std::string, std::weak_ptr<SerialQueue>> queues_;
};

class ExtensionServer final : public protocol::Extension::Server {
 public:
  explicit ExtensionServer(std::shared_ptr<NSFileProviderExtension> extension)
      : extension_(std::move(extension)) {}

 protected:
  kj::Promise<void> urlForItem(UrlForItemContext context) override {
    auto identifier = takeIdentifier(context, context.getParams().getIdentifier());
    return ipc::onPool([extension = extension_, identifier](const CancelFlag&) {
             return extension->URLForItemWithPersistentIdentifier(identifier);
           })
        .then([context](NSURLRef url) mutable {
          if (url != nullptr) context.getResults().initPath().setValue(wireData(url->path()));
        });
  }

  kj::Promise<void> identifierForPath(IdentifierForPathContext context) override {
    context.allowCancellation();
    auto url = NSURL::fileURLWithPath(stringFromWire(context.getParams().getPath()));
    context.releaseParams();
    if (url == nullptr) return kj::READY_NOW;
    return ipc::onPool([extension = extension_, url = std::move(url)](const CancelFlag&) {
             return extension->persistentIdentifierForItemAtURL(url);
           })
        .then([context](std::optional<NSFileProviderItemIdentifier> identifier) mutable {
          if (!identifier) return;
          auto results = context.getResults();
          results.setFound(true);
          results.setIdentifier(wireText(*identifier));
        });
  }

  kj::Promise<void> itemForIdentifier(ItemForIdentifierContext context) override {
    auto identifier = takeIdentifier(context, context.getParams().getIdentifier());
    struct Answer {
      NSFileProviderItemRef item;
      NSErrorRef error;
    };
    return ipc::onPool([extension = extension_, identifier](const CancelFlag&) {
             Answer answer;
             answer.item = extension->itemForIdentifier(identifier, &answer.error);
             if (answer.item == nullptr) answer.error = orNonExistent(answer.error, identifier);
             return answer;
           })
        .then([context](Answer answer) mutable {
          auto result = context.getResults().initResult();
          if (answer.item == nullptr) return ipc::encodeError(answer.error, result.initError());
          encodeItem(answer.item->fields(), result.initItem());
        });
  }

  kj::Promise<void> enumerator(EnumeratorContext context) override {
    auto container = takeIdentifier(context, context.getParams().getContainer());
    struct Answer {
      NSFileProviderEnumeratorRef enumerator;
      NSErrorRef error;
    };
    return ipc::onPool([extension = extension_, container](const CancelFlag&) {
             Answer answer;
             answer.enumerator =
                 extension->enumeratorForContainerItemIdentifier(container, &answer.error);
             if (answer.enumerator == nullptr) {
               answer.error = orNonExistent(answer.error, container);
             }
             return answer;
           })
        .then([context](Answer answer) mutable {
          auto result = context.getResults().initResult();
          if (answer.enumerator == nullptr) {
            return ipc::encodeError(answer.error, result.initError());
          }
          result.setEnumerator(kj::heap<EnumeratorServer>(std::move(answer.enumerator)));
        });
  }

  kj::Promise<void> changes(ChangesContext context) override {
    context.getResults().setChanges(serveChanges(extension_));
    return kj::READY_NOW;
  }

  kj::Promise<void> startProviding(StartProvidingContext context) override {
    context.allowCancellation();
    const auto params = context.getParams();
    auto url = locationOf(params.getPath());
    if (url == nullptr) return refuse(context);
    auto reply = ipc::LoopReply<NSErrorRef>::makeFor(dropped());
    const auto queue = providing_.of(url);
    runExtensionCodeOn(*queue, "startProvidingItemAtURL",
                       [queue, extension = extension_, url = std::move(url),
                        options = params.getOptions(), handler = std::move(reply.fulfill)] {
                         extension->startProvidingItemAtURL(url, options, handler);
                       });
    context.releaseParams();
    return reply.promise.then([context](const NSErrorRef& error) mutable {
      ipc::encodeOptional(error, context.getResults().initFailure());
    });
  }

  kj::Promise<void> stopProviding(StopProvidingContext context) override {
    auto url = locationOf(context.getParams().getPath());
    context.releaseParams();
    if (url == nullptr) return kj::READY_NOW;
    const auto queue = providing_.of(url);
    return ipc::onQueue(queue, [queue, extension = extension_, url = std::move(url)](
                                   const CancelFlag&) { extension->stopProvidingItemAtURL(url); });
  }

  kj::Promise<void> itemChanged(ItemChangedContext context) override {
    auto url = locationOf(context.getParams().getPath());
    context.releaseParams();
    if (url == nullptr) return kj::READY_NOW;
    return ipc::onPool([extension = extension_, url = std::move(url)](const CancelFlag&) {
      extension->itemChangedAtURL(url);
    });
  }

  kj::Promise<void> movingItem(MovingItemContext context) override {
    context.allowCancellation();
    struct Answer {
      bool requiresProviding = false;
      NSErrorRef error;
    };
    const auto params = context.getParams();
    auto url = locationOf(params.getPath());
    auto destination = locationOf(params.getDestination());
    if (url == nullptr || destination == nullptr) return refuse(context);
    context.releaseParams();
    auto reply = ipc::LoopReply<Answer>::makeFor({false, dropped()});
    MoveHandler handler = [fulfill = std::move(reply.fulfill)](bool needed, NSErrorRef error) {
      fulfill({needed, std::move(error)});
    };
    runExtensionCode(
        "movingItemAtURL",
        [extension = extension_, url = std::move(url), destination = std::move(destination),
         handler = std::move(handler)] { extension->movingItemAtURL(url, destination, handler); });
    return reply.promise.then([context](const Answer& answer) mutable {
      auto results = context.getResults();
      results.setRequiresProviding(answer.requiresProviding);
      ipc::encodeOptional(answer.error, results.initFailure());
    });
  }

  kj::Promise<void> fetchThumbnails(FetchThumbnailsContext context) override {
    context.allowCancellation();
    const auto params = context.getParams();
    const CGSize size{.width = params.getWidth(), .height = params.getHeight()};
    const bool isSize = std::isfinite(size.width) && std::isfinite(size.height) && size.width > 0 &&
                        size.height > 0;
    if (!isSize || !params.hasReceiver()) {
      ipc::encodeOptional(invalid("thumbnails need a receiver and a size of at least one point"),
                          context.getResults().initFailure());
      return kj::READY_NOW;
    }
    std::vector<NSFileProviderItemIdentifier> identifiers;
    identifiers.reserve(params.getIdentifiers().size());
    for (const auto each : params.getIdentifiers()) identifiers.push_back(stringFromWire(each));
    ipc::Remote<protocol::ThumbnailReceiver> receiver(params.getReceiver());
    context.releaseParams();
    return requestThumbnails(extension_, std::move(identifiers), size, std::move(receiver))
        .then([context](const NSErrorRef& error) mutable {
          ipc::encodeOptional(error, context.getResults().initFailure());
        });
  }

  kj::Promise<void> services(ServicesContext context) override {
    const std::uint32_t client = context.getParams().getClient();
    auto identifier = takeIdentifier(context, context.getParams().getIdentifier());
    return ipc::onPool([extension = extension_, identifier, client](const CancelFlag&) {
             return vendServices(*extension, identifier, std::nullopt, client);
           })
        .then([context](VendedServices vended) mutable {
          auto results = context.getResults();
          ipc::encodeOptional(vended.error, results.initFailure());
          auto services = results.initServices(static_cast<unsigned>(vended.services.size()));
          for (unsigned i = 0; i < services.size(); ++i) {
            services[i].setName(wireText(vended.services[i].name));
            services[i].setEndpoint(serveEndpoint(std::move(vended.services[i].endpoint)));
          }
        });
  }

  kj::Promise<void> service(ServiceContext context) override {
    const std::uint32_t client = context.getParams().getClient();
    auto name = stringFromWire(context.getParams().getName());
    auto identifier = takeIdentifier(context, context.getParams().getIdentifier());
    return ipc::onPool([extension = extension_, identifier, name, client](const CancelFlag&) {
             return vendServices(*extension, identifier, name, client);
           })
        .then([context](VendedServices vended) mutable {
          auto results = context.getResults();
          ipc::encodeOptional(vended.error, results.initFailure());
          if (vended.services.empty()) return;
          results.setEndpoint(serveEndpoint(std::move(vended.services.front().endpoint)));
        });
  }

 private:
  static NSErrorRef invalid(const char* description) {
    return NSError::errorWithDomain(NSPOSIXErrorDomain, EINVAL,
                                    {{NSLocalizedDescriptionKey, std::string(description)}});
  }

  /// Nil for what is no location.
  static NSURLRef locationOf(capnp::Data::Reader path) {
    return path.size() > PATH_MAX ? nullptr : NSURL::fileURLWithPath(stringFromWire(path));
  }

  static NSErrorRef dropped() {
    return NSError::errorWithDomain(
        NSCocoaErrorDomain, NSXPCConnectionReplyInvalid,
        {{NSLocalizedDescriptionKey,
          std::string("the extension dropped the request without answering it")}});
  }

  template <typename Context>
  static kj::Promise<void> refuse(Context& context) {
    ipc::encodeOptional(invalid("a location has to be an absolute path"),
                        context.getResults().initFailure());
    return kj::READY_NOW;
  }

  template <typename Context>
  static std::string takeIdentifier(Context& context, capnp::Text::Reader text) {
    context.allowCancellation();
    auto identifier = stringFromWire(text);
    context.releaseParams();
    return identifier;
  }

  static NSErrorRef orNonExistent(const NSErrorRef& error, const std::string& identifier) {
    return error != nullptr ? error : fileProviderErrorForNonExistentItemWithIdentifier(identifier);
  }

  const std::shared_ptr<NSFileProviderExtension> extension_;
  ProvidingQueues providing_;
};

}  // namespace

protocol::Extension::Client serveExtension(std::shared_ptr<NSFileProviderExtension> extension) {
  return kj::heap<ExtensionServer>(std::move(extension));
}

}  // namespace yomber
