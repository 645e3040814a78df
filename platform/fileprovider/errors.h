#pragma once

#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"

namespace yomber {

/// NSFileProviderErrorNoSuchItem that carries the identifier.
[[nodiscard]] NSErrorRef fileProviderErrorForNonExistentItemWithIdentifier(const NSFileProviderItemIdentifier& identifier);

/// NSFileProviderErrorFilenameCollision that carries the item in the way.
[[nodiscard]] NSErrorRef fileProviderErrorForCollisionWithItem(NSFileProviderItemRef existingItem);

}  // namespace yomber
