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
/// QSOstrellErrorDomain 3: the location is not inside the drive's tree.
[[nodiscard]] NSErrorRef outsideTreeError(std::string_view path);
/// NSCocoaErrorDomain 512: what was asked for cannot be done, for the errno that it would have as a
/// system call. `reason` says why and what to do instead.
[[nodiscard]] NSErrorRef refusedError(int number, std::string_view path, const std::string& reason);
/// NSCocoaErrorDomain 3072.
[[nodiscard]] NSErrorRef cancelledError(std::string_view path);

}  // namespace yomber
