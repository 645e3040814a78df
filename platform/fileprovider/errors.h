#pragma once

#include <cstdint>
#include <string>

#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"

namespace yomber {

/// Cocoa domain: the extension does not implement the operation.
inline constexpr std::int64_t NSFeatureUnsupportedError = 3328;

/// NSFileProviderErrorNoSuchItem that carries the identifier (empty: none is named).
[[nodiscard]] NSErrorRef fileProviderErrorForNonExistentItemWithIdentifier(
    const NSFileProviderItemIdentifier& identifier);

/// NSFileProviderErrorFilenameCollision that carries the item in the way (nil: none is named).
[[nodiscard]] NSErrorRef fileProviderErrorForCollisionWithItem(NSFileProviderItemRef existingItem);

/// NSFeatureUnsupportedError that names the operation: the framework's default answer.
[[nodiscard]] NSErrorRef fileProviderErrorForUnsupportedFeature(const std::string& operation);

}  // namespace yomber
