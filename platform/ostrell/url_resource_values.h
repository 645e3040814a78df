#pragma once

#include <optional>
#include <string>

#include "platform/foundation/error.h"
#include "platform/foundation/url.h"

namespace yomber {

// What the drive knows of the item at a location. A nil location answers false or nil, and stores
// no error.

/// Whether the item belongs to a share.
inline constexpr const char* NSURLUbiquitousItemIsSharedKey = "NSURLUbiquitousItemIsSharedKey";
/// Whether the item is a bookmark.
inline constexpr const char* NSURLIsAliasFileKey = "NSURLIsAliasFileKey";

/// Reads a value that the daemon knows; a synchronous daemon call. False and an error when it
/// cannot be read, also for a key that is not among those above.
[[nodiscard]] bool getResourceValue(const NSURLRef& url, std::optional<bool>& value,
                                    const std::string& forKey, NSErrorRef* error = nullptr);
/// The same, also for items whose content, or file, is not here. Asks the daemon only for what the
/// file itself does not say.
[[nodiscard]] bool getPromisedItemResourceValue(const NSURLRef& url, std::optional<bool>& value,
                                                const std::string& forKey,
                                                NSErrorRef* error = nullptr);
/// The item's content type; nil and an error when there is none. A synchronous daemon call.
[[nodiscard]] std::optional<std::string> qs_typeIdentifierWithError(const NSURLRef& url,
                                                                    NSErrorRef* error);

}  // namespace yomber
