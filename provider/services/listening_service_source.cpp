#include "provider/services/listening_service_source.h"

#include <utility>

#include "provider/extension/extension.h"

namespace yomber {

ListeningServiceSource::ListeningServiceSource(
    std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
    std::shared_ptr<NSOperationQueue> operationQueue)
    : _fileProviderExtension(std::move(fileProviderExtension)),
      _itemIdentifier(std::move(itemIdentifier)),
      _operationQueue(std::move(operationQueue)) {}

NSXPCListenerEndpointRef ListeningServiceSource::makeListenerEndpointAndReturnError(
    NSErrorRef* /*error*/) {
  const auto listener = NSXPCListener::anonymousListener();
  listener->setDelegate(weak_from_this());
  auto endpoint = listener->endpoint();
  listener->resume();
  {
    LockGuard guard(_lock);
    _listeners.insert(listener);
  }
  return endpoint;
}

bool ListeningServiceSource::listener(const NSXPCListenerRef& listener,
                                      const NSXPCConnectionRef& shouldAcceptNewConnection) {
  const NSXPCConnectionRef& connection = shouldAcceptNewConnection;
  exportObjectTo(*connection);
  {
    LockGuard guard(_lock);
    _listeners.erase(listener);
  }
  const EndLog log = endLog();
  connection->setInvalidationHandler([listener, log] {
    log.invalidated();
    listener->invalidate();
  });
  connection->setInterruptionHandler(
      [weakConnection = std::weak_ptr<NSXPCConnection>(connection), log] {
        log.interrupted();
        if (const auto held = weakConnection.lock()) held->invalidate();
      });
  connection->resume();
  return true;
}

std::size_t ListeningServiceSource::waitingListenerCount() {
  LockGuard guard(_lock);
  return _listeners.size();
}

}  // namespace yomber
