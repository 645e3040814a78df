#pragma once

#include <functional>
#include <memory>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/ipc/remote.h"
#include "platform/xpc/connection.h"
#include "platform/xpc/interface.h"
#include "platform/xpc/served_object.h"

namespace yomber {

class ConnectionLink;

/// How the messages of one protocol travel. Not for extensions: this header shows Cap'n Proto
/// types.
///
/// Objects are handed over as pointers to the protocol's class. Immutable.
class InterfaceCoding {
 public:
  virtual ~InterfaceCoding() = default;
  /// What calls `object` on the connection's queue. Loop thread only.
  [[nodiscard]] virtual kj::Own<capnp::Capability::Server> serve(
      std::shared_ptr<void> object, std::shared_ptr<ConnectionLink> link) const = 0;
  /// What sends each call over the connection, which it keeps.
  [[nodiscard]] virtual std::shared_ptr<void> makeProxy(
      NSXPCConnectionRef connection, std::function<void(NSErrorRef)> errorHandler) const = 0;
};

/// The coding of `Protocol` by `Server`, made from a ServedObject<Protocol>, and by `Proxy`, made
/// from a connection and an error handler.
template <typename Protocol, typename Server, typename Proxy>
class CodingOf final : public InterfaceCoding {
 public:
  static NSXPCInterfaceRef makeInterface() {
    return std::make_shared<const NSXPCInterface>(typeid(Protocol), std::make_shared<CodingOf>());
  }

  [[nodiscard]] kj::Own<capnp::Capability::Server> serve(
      std::shared_ptr<void> object, std::shared_ptr<ConnectionLink> link) const override {
    return kj::heap<Server>(
        ServedObject<Protocol>(std::static_pointer_cast<Protocol>(object), std::move(link)));
  }
  [[nodiscard]] std::shared_ptr<void> makeProxy(
      NSXPCConnectionRef connection, std::function<void(NSErrorRef)> errorHandler) const override {
    return std::shared_ptr<Protocol>(
        std::make_shared<Proxy>(std::move(connection), std::move(errorHandler)));
  }
};

}  // namespace yomber
