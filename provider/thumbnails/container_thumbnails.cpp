#include "platform/fileprovider/errors.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/container.h"
#include "platform/ostrell/errors.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/extension.h"
#include "provider/extension/size_string.h"

namespace yomber {
namespace {

constexpr double kMaximumWidth = 120.0;
constexpr double kMaximumHeight = 120.0;
constexpr const char* kUndecoratedType = "com.kelvo.fileprovider.qs-undecorated-container";

}  // namespace

CGSize QSFileProviderExtension::_properSizeForContainerThumbnail(CGSize size) {
  Log& log = qsc_default_log();
  if (size.width > kMaximumWidth) {
    log_debug(log, "[DEBUG] width (%.2f) is greater than max width (%.2f)", size.width,
              kMaximumWidth);
    size.width = kMaximumWidth;
  }
  if (size.height > kMaximumHeight) {
    log_debug(log, "[DEBUG] height (%.2f) is greater than max height (%.2f)", size.height,
              kMaximumHeight);
    size.height = kMaximumHeight;
  }
  if (size.width > size.height || size.height > size.width) {
    log_debug(log,
              "[DEBUG] width (%.2f) and height (%.2f) should be equal for container's thumbnail",
              size.width, size.height);
    const double side = size.width > size.height ? size.height : size.width;
    size = {.width = side, .height = side};
  }
  return size;
}

void QSFileProviderExtension::_fetchThumbnailForContainerID(
    const std::string& containerID,
    const NSFileProviderItemIdentifier& representedByItemWithIdentifer, CGSize size,
    const std::map<std::string, QSContainerRef>& knownContainers,
    const TypedThumbnailHandler& perThumbnailCompletionHandler) {
  Log& log = qsc_default_log();
  const auto& identifier = representedByItemWithIdentifer;
  const auto answer = [&](const NSDataRef& data, const std::optional<std::string>& type,
                          const NSErrorRef& error) {
    if (perThumbnailCompletionHandler) perThumbnailCompletionHandler(identifier, data, type, error);
  };
  const auto found = knownContainers.find(containerID);
  if (found == knownContainers.end()) {
    log_error(log, "[ERROR] can't find container with ID %@", containerID);
    answer(nullptr, std::nullopt, fileProviderErrorForNonExistentItemWithIdentifier(identifier));
    return;
  }
  bool shouldTransformToAppIcon = false;
  const NSDataRef data =
      found->second->bestFittingImageDataForSize(size, &shouldTransformToAppIcon);
  if (data == nullptr) {
    const std::string sizeString = qs_stringWithSize(size);
    log_error(log, "[ERROR] can't find image with size %@ for %@", sizeString, containerID);
    answer(nullptr, std::nullopt,
           qs_fileProviderError(qsc_errorInvalidParameter("size", sizeString)));
    return;
  }
  answer(data,
         shouldTransformToAppIcon ? std::optional<std::string>(kUndecoratedType) : std::nullopt,
         nullptr);
}

}  // namespace yomber
