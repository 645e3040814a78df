#include <utility>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/file_operations.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {

void QSFileProviderExtension::importDocumentAtURL(
    const NSURLRef& url, const NSFileProviderItemIdentifier& toParentItemIdentifier,
    ItemHandler completionHandler) {
  const NSURLRef parentURL = URLForItemWithPersistentIdentifier(toParentItemIdentifier);
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx importing document at %@ to %@", section.id(), url,
            parentURL);
  if (parentURL == nullptr) {
    if (completionHandler) {
      completionHandler(nullptr,
                        fileProviderErrorForNonExistentItemWithIdentifier(toParentItemIdentifier));
    }
    return;
  }
  fp_importUnderFolder(
      url, parentURL,
      [self = shared_from_this(), completionHandler = std::move(completionHandler)](
          const NSURLRef& newURL, const NSErrorRef& error) {
        log_debug(qsc_default_log(), "[DEBUG] got new URL %@; %@", newURL, error);
        if (const NSErrorRef mapped = self->fileProviderErrorFromFSError(error)) {
          if (completionHandler) completionHandler(nullptr, mapped);
          return;
        }
        NSErrorRef lookupError;
        const QSQueryItemRef item = self->_propertiesForNewItemAtURL(newURL, &lookupError);
        if (item == nullptr) {
          log_debug(qsc_default_log(), "[DEBUG] couldn't find item after importing it: %@",
                    lookupError);
        }
        // The document is in the drive, whatever became of the lookup.
        if (completionHandler) completionHandler(item, nullptr);
      });
}

void QSFileProviderExtension::createDirectoryWithName(
    const std::string& name, const NSFileProviderItemIdentifier& inParentItemIdentifier,
    ItemHandler completionHandler) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx creating directory %@ under %@", section.id(), name,
            inParentItemIdentifier);
  const NSURLRef parentURL = URLForItemWithPersistentIdentifier(inParentItemIdentifier);
  if (parentURL == nullptr) {
    if (completionHandler) {
      completionHandler(nullptr,
                        fileProviderErrorForNonExistentItemWithIdentifier(inParentItemIdentifier));
    }
    return;
  }
  fp_createSubFolder(parentURL, name,
                     [self = shared_from_this(), completionHandler = std::move(completionHandler)](
                         const NSURLRef& newURL, const NSErrorRef& error) {
                       log_debug(qsc_default_log(), "[DEBUG] got new URL %@; %@", newURL, error);
                       if (const NSErrorRef mapped = self->fileProviderErrorFromFSError(error)) {
                         if (completionHandler) completionHandler(nullptr, mapped);
                         return;
                       }
                       NSErrorRef lookupError;
                       const QSQueryItemRef item =
                           self->_propertiesForNewItemAtURL(newURL, &lookupError);
                       if (completionHandler) completionHandler(item, lookupError);
                     });
}

}  // namespace yomber
