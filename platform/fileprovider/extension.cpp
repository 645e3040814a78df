#include "platform/fileprovider/extension.h"

#include <utility>

#include "platform/fileprovider/errors.h"

namespace yomber {
namespace {

void answerUnsupported(const ErrorHandler& completionHandler, const char* operation) {
  if (completionHandler) completionHandler(fileProviderErrorForUnsupportedFeature(operation));
}

/// For handlers that take a result before the error.
template <typename Result>
void answerUnsupported(const std::function<void(Result, NSErrorRef)>& completionHandler,
                       const char* operation) {
  if (completionHandler) {
    completionHandler(Result(), fileProviderErrorForUnsupportedFeature(operation));
  }
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

void NSFileProviderExtension::startProvidingItemAtURL(
    const NSURLRef& url, NSFileCoordinatorReadingOptions /*readingOptions*/,
    ErrorHandler completionHandler) {
  startProvidingItemAtURL(url, std::move(completionHandler));
}

void NSFileProviderExtension::stopProvidingItemAtURL(const NSURLRef& /*url*/) {}

void NSFileProviderExtension::itemChangedAtURL(const NSURLRef& /*url*/) {}

void NSFileProviderExtension::movingItemAtURL(const NSURLRef& /*url*/,
                                              const NSURLRef& /*destinationURL*/,
                                              MoveHandler completionHandler) {
  answerUnsupported(completionHandler, "moving items");
}

void NSFileProviderExtension::importDocumentAtURL(
    const NSURLRef& /*url*/, const NSFileProviderItemIdentifier& /*toParentItemIdentifier*/,
    ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "importing documents");
}

void NSFileProviderExtension::createDirectoryWithName(
    const std::string& /*name*/, const NSFileProviderItemIdentifier& /*inParentItemIdentifier*/,
    ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "creating folders");
}

void NSFileProviderExtension::renameItemWithIdentifier(
    const NSFileProviderItemIdentifier& /*identifier*/, const std::string& /*toName*/,
    ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "renaming items");
}

void NSFileProviderExtension::reparentItemWithIdentifier(
    const NSFileProviderItemIdentifier& /*identifier*/,
    const NSFileProviderItemIdentifier& /*toParentItemWithIdentifier*/,
    const std::optional<std::string>& /*newName*/, ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "moving items");
}

void NSFileProviderExtension::trashItemWithIdentifier(
    const NSFileProviderItemIdentifier& /*identifier*/, ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "trashing items");
}

void NSFileProviderExtension::untrashItemWithIdentifier(
    const NSFileProviderItemIdentifier& /*identifier*/,
    const std::optional<NSFileProviderItemIdentifier>& /*toParentItemIdentifier*/,
    ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "putting items back");
}

void NSFileProviderExtension::deleteItemWithIdentifier(
    const NSFileProviderItemIdentifier& /*identifier*/, ErrorHandler completionHandler) {
  answerUnsupported(completionHandler, "deleting items");
}

void NSFileProviderExtension::_trashItemAtURLWithoutCoordination(const NSURLRef& /*url*/,
                                                                 URLHandler completionHandler) {
  answerUnsupported(completionHandler, "trashing locations");
}

void NSFileProviderExtension::setLastUsedDate(
    const std::optional<NSDate>& /*date*/,
    const NSFileProviderItemIdentifier& /*forItemIdentifier*/, ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "last-used dates");
}

void NSFileProviderExtension::setTagData(const NSDataRef& /*tagData*/,
                                         const NSFileProviderItemIdentifier& /*forItemIdentifier*/,
                                         ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "tags");
}

void NSFileProviderExtension::setFavoriteRank(
    const std::optional<std::int64_t>& /*rank*/,
    const NSFileProviderItemIdentifier& /*forItemIdentifier*/, ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "favourites");
}

NSProgressRef NSFileProviderExtension::fetchThumbnailsForItemIdentifiers(
    const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
    TypedThumbnailHandler perThumbnailCompletionHandlerWithType, ErrorHandler completionHandler) {
  ThumbnailHandler handler;
  if (perThumbnailCompletionHandlerWithType) {
    handler = [typed = std::move(perThumbnailCompletionHandlerWithType)](
                  const NSFileProviderItemIdentifier& identifier, NSDataRef imageData,
                  NSErrorRef error) {
      typed(identifier, std::move(imageData), std::nullopt, std::move(error));
    };
  }
  return fetchThumbnailsForItemIdentifiers(identifiers, requestedSize, std::move(handler),
                                           std::move(completionHandler));
}

NSProgressRef NSFileProviderExtension::fetchThumbnailsForItemIdentifiers(
    const std::vector<NSFileProviderItemIdentifier>& /*identifiers*/, CGSize /*requestedSize*/,
    ThumbnailHandler /*perThumbnailCompletionHandler*/, ErrorHandler completionHandler) {
  answerUnsupported(completionHandler, "thumbnails");
  return NSProgress::progressWithTotalUnitCount(0);
}

std::vector<NSFileProviderServiceSourceRef>
NSFileProviderExtension::supportedServiceSourcesForItemIdentifier(
    const NSFileProviderItemIdentifier& /*identifier*/, NSErrorRef* /*error*/) {
  return {};
}

void NSFileProviderExtension::_defaultApplicationContainerForBundleIdentifier(
    const std::optional<std::string>& /*bundleIdentifier*/, ItemHandler completionHandler) {
  answerUnsupported(completionHandler, "applications' folders");
}

}  // namespace yomber
