#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/service_source.h"
#include "platform/foundation/drive_paths.h"
#include "platform/foundation/error.h"
#include "platform/xpc/connection.h"

namespace yomber {

class NSFileProviderService;
class ServiceHost;
using NSFileProviderServiceRef = std::shared_ptr<const NSFileProviderService>;

/// One service of one item, as an application sees it.
///
/// Ownership: shared. Thread-safety: every operation may be called on any thread.
class NSFileProviderService final {
 public:
  using ConnectionHandler = std::function<void(NSXPCConnectionRef connection, NSErrorRef error)>;

  NSFileProviderService(std::shared_ptr<ServiceHost> host, NSFileProviderItemIdentifier identifier,
                        NSFileProviderServiceName name, NSXPCListenerEndpointRef endpoint);

  [[nodiscard]] const NSFileProviderServiceName& name() const { return name_; }

  /// Calls `handler` once, on any thread: with a connection straight to the extension, whose remote
  /// object interface and handlers are still to be set and which is still to be resumed; or with
  /// why there is none. The first connection asks nobody, unless the extension was lost
  /// since; each further one asks the host.
  void getFileProviderConnectionWithCompletionHandler(ConnectionHandler handler) const;
  /// The same, waiting for the host if it has to be asked. Nil with an error.
  [[nodiscard]] NSXPCConnectionRef fileProviderConnection(NSErrorRef* error = nullptr) const;

 private:
  const std::shared_ptr<ServiceHost> host_;
  const NSFileProviderItemIdentifier identifier_;
  const NSFileProviderServiceName name_;
  const NSXPCListenerEndpointRef endpoint_;  ///< for the first connection
};

/// The services that the extension of the drive at `paths` has for items, as its host tells.
///
/// Ownership: shared with the services that it answers. Connects to the host when first asked, and
/// again after the host was started afresh. Thread-safety: every operation may be called on any
/// thread. Errors: what the host says; a drive that is not up is a connection error that says so.
class NSFileProviderServices final {
 public:
  /// `patience` is how long the host may take for an answer.
  explicit NSFileProviderServices(DrivePaths paths,
                                  std::chrono::milliseconds patience = std::chrono::minutes(1));

  /// All services of an item; none, without an error, when it has none. Waits for the host.
  std::vector<NSFileProviderServiceRef> servicesForItemIdentifier(
      const NSFileProviderItemIdentifier& identifier, NSErrorRef* error = nullptr) const;
  /// The one of that name; nil with an error when the item does not have it. Waits for the host.
  NSFileProviderServiceRef serviceForItemIdentifier(const NSFileProviderItemIdentifier& identifier,
                                                    const NSFileProviderServiceName& name,
                                                    NSErrorRef* error = nullptr) const;

 private:
  const std::shared_ptr<ServiceHost> host_;
};

}  // namespace yomber
