#include "platform/fileprovider/extension.h"

#include "platform/fileprovider/errors.h"

namespace yomber {
namespace {

void answerUnsupported(const ErrorHandler& completionHandler, const char* operation) {
  if (completionHandler) completionHandler(fileProviderErrorForUnsupportedFeature(operation));
}

}  // namespace

NSFileProviderExtension::NSFileProviderExtension() = default;
NSFileProviderExtension::~NSFileProviderExtension() = default;

NSURLRef NSFileProviderExtension::URLForItemWithPersistentIdentifier(
    const NSFileProviderItemIdentifier& /*identifier*/) {
  return nullptr;
}

std::optional<NSFileProviderItemIdentifier>
NSFileProviderExtension::persistentIdentifierForItemAtURL(const NSURLRef& /*url*/) {
  return std::nullopt;
}

NSFileProviderItemRef NSFileProviderExtension::itemForIdentifier(
    const NSFileProviderItemIdentifier& /*identifier*/, NSErrorRef* error) {
  storeError(error, fileProviderErrorForUnsupportedFeature("looking items up"));
  return nullptr;
}

NSFileProviderEnumeratorRef NSFileProviderExtension::enumeratorForContainerItemIdentifier(
    const NSFileProviderItemIdentifier& /*identifier*/, NSErrorRef* error) {
  storeError(error, fileProviderErrorForUnsupportedFeature("listing"));
  return nullptr;
}

void NSFileProviderExtension::providePlaceholderAtURL(const NSURLRef& /*url*/,
                                                      ErrorHandler completionHandler) {
  answerUnsupported(completionHandler, "placeholders");
}

void NSFileProviderExtension::startProvidingItemAtURL(const NSURLRef& /*url*/,
                                                      ErrorHandler completionHandler) {
  answerUnsupported(completionHandler, "providing content");
}

void NSFileProviderExtension::stopProvidingItemAtURL(const NSURLRef& /*url*/) {}

void NSFileProviderExtension::itemChangedAtURL(const NSURLRef& /*url*/) {}

}  // namespace yomber
