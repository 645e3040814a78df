#pragma once

#include <functional>
#include <memory>

#include "platform/fileprovider/constants.h"
#include "platform/foundation/error.h"

namespace yomber {

/// The extension's way to speak to the host unasked.
///
/// Thread-safety: every operation may be called on any thread; handlers run on the framework's
/// reply queue.
class NSFileProviderManager {
 public:
  /// How signals reach the host. `NSExtensionMain` installs the connection to it; a process that
  /// has none answers every signal with NSXPCConnectionInvalid.
  class Transport {
   public:
    virtual ~Transport() = default;
    virtual void signalEnumerator(const NSFileProviderItemIdentifier& container,
                                  std::function<void(NSErrorRef)> completionHandler) = 0;
  };

  static NSFileProviderManager& defaultManager();

  /// Tells the host that a container has changes; the host will ask for them. Never blocks.
  void signalEnumeratorForContainerItemIdentifier(
      const NSFileProviderItemIdentifier& container,
      std::function<void(NSErrorRef)> completionHandler);

  void setTransport(std::shared_ptr<Transport> transport);

  NSFileProviderManager();
  ~NSFileProviderManager();

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace yomber
