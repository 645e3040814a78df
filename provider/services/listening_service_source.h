#pragma once

#include <cstddef>
#include <memory>
#include <set>
#include <string>

#include "platform/fileprovider/service_source.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/operation.h"
#include "platform/xpc/listener.h"

namespace yomber {

class QSFileProviderExtension;

/// What the extension's service sources have in common: each endpoint is that of a new listener,
/// and each connection gets an object of its own.
///
/// A listener is kept here until its client has connected, and from then on by that connection
/// until it ends. Nothing here keeps connections or their objects. Everybody is accepted: who may
/// connect at all is decided below.
///
/// Ownership: shared. Thread-safety: every operation may be called on any thread.
class ListeningServiceSource : public NSFileProviderServiceSource,
                               public NSXPCListenerDelegate,
                               public std::enable_shared_from_this<ListeningServiceSource> {
 public:
  /// Never nil; the error is never written.
  NSXPCListenerEndpointRef makeListenerEndpointAndReturnError(NSErrorRef* error = nullptr) override;
  bool listener(const NSXPCListenerRef& listener,
                const NSXPCConnectionRef& shouldAcceptNewConnection) override;

  /// The listeners that were handed out and have no client yet.
  [[nodiscard]] std::size_t waitingListenerCount();

 protected:
  /// Lines of a connection's end. They outlive the source.
  struct EndLog {
    void (*invalidated)();
    void (*interrupted)();
  };

  ListeningServiceSource(std::shared_ptr<QSFileProviderExtension> fileProviderExtension,
                         std::string itemIdentifier,
                         std::shared_ptr<NSOperationQueue> operationQueue);
  /// Sets the interface that the connection exports, and a new object.
  virtual void exportObjectTo(NSXPCConnection& connection) = 0;
  [[nodiscard]] virtual EndLog endLog() const = 0;

  // In this order: they are released from the last to the first.
  const std::shared_ptr<QSFileProviderExtension> _fileProviderExtension;
  const std::string _itemIdentifier;
  const std::shared_ptr<NSOperationQueue> _operationQueue;

 private:
  /// "The lock of the object itself". Never held while calling out.
  RecursiveMutex _lock;
  std::set<NSXPCListenerRef> _listeners GUARDED_BY(_lock);
};

}  // namespace yomber
