#pragma once

#include <string>

#include "platform/foundation/size.h"

namespace yomber {

/// The size for logs and keys, e.g. "{1024.00, 768.00}", whatever the process's locale is.
[[nodiscard]] std::string qs_stringWithSize(const CGSize& size);

}  // namespace yomber
