#include "platform/fileprovider/manager.h"

#include <utility>

#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/serial_queue.h"

namespace yomber {

struct NSFileProviderManager::State {
  const std::shared_ptr<SerialQueue> replies = SerialQueue::create("fileprovider-replies");
  AtomicCell<std::shared_ptr<Transport>> transport;
};

NSFileProviderManager::NSFileProviderManager() : state_(std::make_unique<State>()) {}
NSFileProviderManager::~NSFileProviderManager() = default;

NSFileProviderManager& NSFileProviderManager::defaultManager() {
  // Never destroyed: enumerators signal until the process ends.
  static auto* const manager = new NSFileProviderManager;
  return *manager;
}

void NSFileProviderManager::signalEnumeratorForContainerItemIdentifier(
    const NSFileProviderItemIdentifier& container,
    std::function<void(NSErrorRef)> completionHandler) {
  auto answer = [replies = state_->replies,
                 handler = std::move(completionHandler)](NSErrorRef error) {
    if (!handler) return;
    replies->async([handler, error = std::move(error)] { handler(error); });
  };
  if (const auto transport = state_->transport.load()) {
    transport->signalEnumerator(container, std::move(answer));
    return;
  }
  answer(NSError::errorWithDomain(
      NSCocoaErrorDomain, NSXPCConnectionInvalid,
      {{NSLocalizedDescriptionKey, std::string("this process has no connection to the host")}}));
}

void NSFileProviderManager::setTransport(std::shared_ptr<Transport> transport) {
  state_->transport.store(std::move(transport));
}

}  // namespace yomber
