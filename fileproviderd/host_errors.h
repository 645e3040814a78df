#pragma once

#include <string>

#include "platform/foundation/error.h"

namespace yomber {

// What the host says when something that it needs is not there.

[[nodiscard]] NSErrorRef zarnNotRunningError(const NSErrorRef& underlying = nullptr);
/// `reason` says what is wrong with it, e.g. "was ended by signal 9".
[[nodiscard]] NSErrorRef extensionUnavailableError(const std::string& reason,
                                                   const NSErrorRef& underlying = nullptr);
/// The extension was lost in the middle of a change.
[[nodiscard]] NSErrorRef changeInterruptedError(const NSErrorRef& underlying);
[[nodiscard]] NSErrorRef invalidRequestError(const std::string& what);

/// Whether the error says that a peer was lost, is not there, or did not answer in time.
[[nodiscard]] bool isConnectionError(const NSErrorRef& error);
/// Whether the error says that an item does not exist.
[[nodiscard]] bool isNoSuchItemError(const NSErrorRef& error);

}  // namespace yomber
