#pragma once

#include <memory>
#include <typeinfo>

namespace yomber {

class InterfaceCoding;
class NSXPCInterface;
using NSXPCInterfaceRef = std::shared_ptr<const NSXPCInterface>;

/// What an object can be called for over a connection: a protocol (an abstract class), and how its
/// messages travel.
///
/// Ownership: shared, immutable. Thread-safety: immutable.
class NSXPCInterface final {
 public:
  /// Specialised beside each protocol that travels.
  template <typename Protocol>
  static NSXPCInterfaceRef interfaceWithProtocol();

  /// For those specialisations; see interface_coding.h.
  NSXPCInterface(const std::type_info& protocol, std::shared_ptr<const InterfaceCoding> coding);
  ~NSXPCInterface();
  NSXPCInterface(const NSXPCInterface&) = delete;
  NSXPCInterface& operator=(const NSXPCInterface&) = delete;

  [[nodiscard]] const std::type_info& protocol() const { return protocol_; }
  [[nodiscard]] const InterfaceCoding& coding() const { return *coding_; }

 private:
  const std::type_info& protocol_;
  const std::shared_ptr<const InterfaceCoding> coding_;
};

}  // namespace yomber
