#include "platform/fileprovider/errors.h"

#include <utility>

namespace yomber {

NSErrorRef fileProviderErrorForNonExistentItemWithIdentifier(
    const NSFileProviderItemIdentifier& identifier) {
  if (identifier.empty()) {
    return NSError::errorWithDomain(
        NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem,
        {{NSLocalizedDescriptionKey, std::string("there is no such item in the drive")}});
  }
  return NSError::errorWithDomain(
      NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem,
      {{NSFileProviderErrorNonExistentItemIdentifierKey, identifier},
       {NSLocalizedDescriptionKey, "there is no item " + identifier + " in the drive"}});
}

NSErrorRef fileProviderErrorForCollisionWithItem(NSFileProviderItemRef existingItem) {
  NSErrorUserInfo info;
  if (existingItem != nullptr) {
    info.emplace(NSLocalizedDescriptionKey,
                 "an item named \"" + existingItem->filename() + "\" is already there");
    info.emplace(NSFileProviderErrorItemKey, NSObjectRef(std::move(existingItem)));
  }
  return NSError::errorWithDomain(NSFileProviderErrorDomain, NSFileProviderErrorFilenameCollision,
                                  std::move(info));
}

NSErrorRef fileProviderErrorForUnsupportedFeature(const std::string& operation) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFeatureUnsupportedError,
      {{NSLocalizedDescriptionKey, "this drive's extension does not support " + operation}});
}

}  // namespace yomber
