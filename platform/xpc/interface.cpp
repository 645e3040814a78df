#include "platform/xpc/interface.h"

#include <utility>

#include "platform/xpc/interface_coding.h"

namespace yomber {

NSXPCInterface::NSXPCInterface(const std::type_info& protocol,
                               std::shared_ptr<const InterfaceCoding> coding)
    : protocol_(protocol), coding_(std::move(coding)) {}

NSXPCInterface::~NSXPCInterface() = default;

}  // namespace yomber
