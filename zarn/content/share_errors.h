#pragma once

#include <string>

#include "platform/foundation/error.h"

namespace yomber {

/// QSOstrellErrorDomain 2.
[[nodiscard]] NSErrorRef notSignedInError();
/// QSOstrellErrorDomain 20: the item is in no share.
[[nodiscard]] NSErrorRef notSharedError(const std::string& path);
/// Whether the store's answer is that there is no such share (any more), nor perhaps its zone.
[[nodiscard]] bool isNoShare(const NSErrorRef& error);
/// NSCocoaErrorDomain 4.
[[nodiscard]] NSErrorRef noSuchSharedItemError(const std::string& what);
/// NSCocoaErrorDomain 512, with the reason.
[[nodiscard]] NSErrorRef cannotBeSharedError(const std::string& reason);
/// NSCocoaErrorDomain 513: what the account may not do in a share.
[[nodiscard]] NSErrorRef mayOnlyReadError(const std::string& path, const std::string& title);

}  // namespace yomber
