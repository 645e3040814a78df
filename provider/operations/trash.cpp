#include <utility>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/file_operations.h"
#include "platform/foundation/file_manager.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/container.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/file_manager_additions.h"
#include "platform/ostrell/item_additions.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {
namespace {

std::optional<std::string> pathOf(const NSURLRef& url) {
  return url != nullptr ? std::optional(url->path()) : std::nullopt;
}

}  // namespace

void QSFileProviderExtension::trashItemWithIdentifier(
    const NSFileProviderItemIdentifier& identifier, ItemHandler completionHandler) {
  Log& log = qsc_default_log();
  const LogSection section(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┏%llx trashing item %@", section.id(), identifier);
  const NSURLRef url =
      _URLForItemWithPersistentIdentifier(identifier, ResolveAliases::No, AttachPhysical::Yes);
  if (url == nullptr) {
    if (completionHandler) {
      completionHandler(nullptr, fileProviderErrorForNonExistentItemWithIdentifier(identifier));
    }
    return;
  }

  NSErrorRef error;
  NSURLRef coordinatedURL;
  fp_coordinatedDeleteWithHandler(url, [&](const NSURLRef& newURL, const NSErrorRef& failure) {
    if (failure != nullptr) {
      log_debug(log, "[DEBUG] failed to coordinate the deletion: %@", failure);
      error = failure;
    } else {
      coordinatedURL = newURL;
    }
  });
  if (error != nullptr) {
    if (completionHandler) completionHandler(nullptr, error);
    return;
  }

  log_debug(log, "[DEBUG] trashing %@", fp_obfuscatedPath(pathOf(coordinatedURL)));
  NSURLRef resultingURL;
  qs_trashItemAtURL(NSFileManager::defaultManager(), coordinatedURL, &resultingURL, &error);
  QSQueryItemRef item;
  if (resultingURL != nullptr && error == nullptr) {
    item = _propertiesForNewItemAtURL(resultingURL, &error);
  }
  if (completionHandler) completionHandler(item, error);
}

void QSFileProviderExtension::_trashItemAtURLWithoutCoordination(const NSURLRef& url,
                                                                 URLHandler completionHandler) {
  log_debug(qsc_default_log(), "[DEBUG] trashing %@", fp_obfuscatedPath(pathOf(url)));
  NSErrorRef error;
  NSURLRef resultingURL;
  qs_trashItemAtURL(NSFileManager::defaultManager(), url, &resultingURL, &error);
  if (completionHandler) completionHandler(resultingURL, error);
}

NSURLRef QSFileProviderExtension::_untrashDestination(
    const NSURLRef& url,
    const std::optional<NSFileProviderItemIdentifier>& toParentItemIdentifier) {
  if (toParentItemIdentifier) {
    if (NSURLRef parentURL = URLForItemWithPersistentIdentifier(*toParentItemIdentifier)) {
      return parentURL;
    }
  }
  const NSURLRef putBackURL =
      qs_putBackURLForTrashedItemAtURL(NSFileManager::defaultManager(), url);
  log_debug(qsc_default_log(), "[DEBUG] untrash with putback url: %@", putBackURL);
  if (putBackURL != nullptr) {
    NSURLRef folderURL = putBackURL->URLByDeletingLastPathComponent();
    if (folderURL->checkResourceIsReachableAndReturnError()) return folderURL;
  }
  log_debug(qsc_default_log(), "[DEBUG] couldn't use putback url, fallback to default container");
  const QSContainerRef container = qs_ostrellContainer(url);
  return container != nullptr ? container->documentsURL() : nullptr;
}

void QSFileProviderExtension::untrashItemWithIdentifier(
    const NSFileProviderItemIdentifier& identifier,
    const std::optional<NSFileProviderItemIdentifier>& toParentItemIdentifier,
    ItemHandler completionHandler) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx untrashing item %@", section.id(), identifier);
  const NSURLRef url =
      _URLForItemWithPersistentIdentifier(identifier, ResolveAliases::No, AttachPhysical::Yes);
  if (url == nullptr) {
    if (completionHandler) {
      completionHandler(nullptr, fileProviderErrorForNonExistentItemWithIdentifier(identifier));
    }
    return;
  }
  log_debug(qsc_default_log(), "[DEBUG] untrashing from url: %@", url);
  const NSURLRef destinationURL = _untrashDestination(url, toParentItemIdentifier);
  if (destinationURL == nullptr) {
    if (completionHandler) {
      completionHandler(nullptr, fileProviderErrorForNonExistentItemWithIdentifier(
                                     toParentItemIdentifier.value_or("")));
    }
    return;
  }
  log_debug(qsc_default_log(), "[DEBUG] untrashing item to %@", destinationURL);
  fp_reparentUnderFolder(
      url, destinationURL, Bouncing::Allowed,
      [self = shared_from_this(), completionHandler = std::move(completionHandler)](
          const NSURLRef& newURL, const NSErrorRef& error) {
        if (error != nullptr) {
          log_error(qsc_default_log(), "[ERROR] error untrashing item to %@: %@", newURL, error);
        } else {
          log_debug(qsc_default_log(), "[DEBUG] item was untrashed to %@", newURL);
        }
        self->_answerItemAtNewURL(newURL, error, completionHandler);
      });
}

void QSFileProviderExtension::deleteItemWithIdentifier(
    const NSFileProviderItemIdentifier& identifier, ErrorHandler completionHandler) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx deleting item %@", section.id(), identifier);
  const NSURLRef url =
      _URLForItemWithPersistentIdentifier(identifier, ResolveAliases::No, AttachPhysical::Yes);
  if (url == nullptr) {
    if (completionHandler) {
      completionHandler(fileProviderErrorForNonExistentItemWithIdentifier(identifier));
    }
    return;
  }
  const auto answer = [completionHandler = std::move(completionHandler)](const NSErrorRef& error) {
    if (completionHandler) completionHandler(qs_fileProviderError(error));
  };
  fp_deleteWithCompletionHandler(url, [url, answer](const NSErrorRef& error) {
    if (error == nullptr || !error->is(NSCocoaErrorDomain, NSFileNoSuchFileError)) {
      answer(error);
      return;
    }
    const NSURLRef physicalURL = qs_physicalURL(url);
    log_debug(qsc_default_log(), "[DEBUG] couldn't delete %@, retrying with physical url %@", url,
              physicalURL);
    fp_deleteWithCompletionHandler(physicalURL, answer);
  });
}

}  // namespace yomber
