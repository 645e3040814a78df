#pragma once

#include <string>
#include <string_view>

#include "platform/foundation/error.h"

namespace yomber {

/// NSCocoaErrorDomain 4: there is no item at that location.
[[nodiscard]] NSErrorRef noSuchLocationError(const std::string& path);
/// NSCocoaErrorDomain 4: there is no item of that identifier.
[[nodiscard]] NSErrorRef noSuchItemError(const std::string& identifier);
/// QSOstrellErrorDomain 3.
[[nodiscard]] NSErrorRef invalidParameterError(const char* parameter, std::string_view value);

}  // namespace yomber
