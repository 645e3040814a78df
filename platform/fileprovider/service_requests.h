#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/fileprovider/extension.h"
#include "protocols/services.capnp.h"

namespace yomber {

/// The services of an item with an endpoint of each, or of the one that is asked for.
struct VendedServices {
  struct Service {
    NSFileProviderServiceName name;
    NSXPCListenerEndpointRef endpoint;
  };
  std::vector<Service> services;
  NSErrorRef error;
};

/// Descriptors travel with one message, so many services at most are told of an item.
inline constexpr std::size_t kMaximumServices = 8;

/// So many endpoints at most wait for their clients at a time, in the whole process: each is a
/// socket, whose other end is a descriptor of whoever asked.
inline constexpr std::size_t kMaximumWaitingEndpoints = 4'096;
/// And of these so many for one client: some that never connect must not keep the others out.
inline constexpr std::size_t kMaximumWaitingOfOneClient = kMaximumWaitingEndpoints / 4;

/// Asks the extension, on this thread, which may block. Each source is kept until its endpoint was
/// used or let go of. `client` stands for whoever asks. With a name, an item without that service
/// is an error; so is an endpoint too many (Cocoa domain, NSXPCConnectionInvalid).
[[nodiscard]] VendedServices vendServices(NSFileProviderExtension& extension,
                                          const NSFileProviderItemIdentifier& identifier,
                                          const std::optional<NSFileProviderServiceName>& name,
                                          std::uint32_t client);

/// Cocoa domain, NSFeatureUnsupportedError: the item has no such service.
[[nodiscard]] NSErrorRef noSuchServiceError(const NSFileProviderItemIdentifier& identifier,
                                            const NSFileProviderServiceName& name);

}  // namespace yomber
