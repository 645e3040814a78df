#include <algorithm>
#include <memory>
#include <utility>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/file_operations.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/file_providing_operation.h"
#include "platform/ostrell/item_additions.h"
#include "platform/ostrell/reading_options.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {
namespace {

constexpr std::int64_t kPermissionDenied = 13;  // EACCES

NSErrorRef invalidMove() {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileWriteUnknownError,
      {{NSUnderlyingErrorKey, qs_errorWithPOSIXCode(kPermissionDenied,
                                                    "The move between those locations is "
                                                    "invalid")}});
}

}  // namespace

/// One request to move an item. Its steps follow each other; only one thread at a time has it.
struct QSFileProviderExtension::Reparenting {
  NSFileProviderItemIdentifier identifier;
  NSURLRef sourceURL;
  NSURLRef parentURL;
  std::optional<std::string> newName;
  ItemHandler completionHandler;
  /// Of the capability call, and later of the lookup.
  NSErrorRef error;

  void answer(const NSFileProviderItemRef& item, const NSErrorRef& answered) const {
    if (completionHandler) completionHandler(item, answered);
  }
};

void QSFileProviderExtension::_answerItemAtNewURL(const NSURLRef& url, const NSErrorRef& error,
                                                  const ItemHandler& completionHandler) {
  if (const NSErrorRef mapped = fileProviderErrorFromFSError(error)) {
    if (completionHandler) completionHandler(nullptr, qs_fileProviderError(mapped));
    return;
  }
  NSErrorRef lookupError;
  const QSQueryItemRef item = _propertiesForNewItemAtURL(url, &lookupError);
  if (completionHandler) completionHandler(item, lookupError);
}

void QSFileProviderExtension::renameItemWithIdentifier(
    const NSFileProviderItemIdentifier& identifier, const std::string& toName,
    ItemHandler completionHandler) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx renaming %@ to %@", section.id(), identifier, toName);
  const NSURLRef url =
      _URLForItemWithPersistentIdentifier(identifier, ResolveAliases::Yes, AttachPhysical::Yes);
  log_debug(qsc_default_log(), "[DEBUG] source URL: %@", url);
  if (url == nullptr) {
    if (completionHandler) {
      completionHandler(nullptr, fileProviderErrorForNonExistentItemWithIdentifier(identifier));
    }
    return;
  }
  fp_renameWithNewName(
      url, toName,
      [self = shared_from_this(), completionHandler = std::move(completionHandler)](
          const NSURLRef& newURL, const NSErrorRef& error) {
        log_debug(qsc_default_log(), "[DEBUG] got new URL %@; %@", newURL, error);
        self->_answerItemAtNewURL(newURL, error, completionHandler);
      });
}

void QSFileProviderExtension::reparentItemWithIdentifier(
    const NSFileProviderItemIdentifier& identifier,
    const NSFileProviderItemIdentifier& toParentItemWithIdentifier,
    const std::optional<std::string>& newName, ItemHandler completionHandler) {
  const LogSection section(LogSectionLevel::Debug);
  log_debug(qsc_default_log(), "[DEBUG] ┏%llx reparenting %@ under %@", section.id(), identifier,
            toParentItemWithIdentifier);
  const auto request = std::make_shared<Reparenting>();
  request->identifier = identifier;
  request->newName = newName;
  request->completionHandler = std::move(completionHandler);

  request->sourceURL =
      _URLForItemWithPersistentIdentifier(identifier, ResolveAliases::No, AttachPhysical::Yes);
  if (request->sourceURL == nullptr) {
    request->answer(nullptr, fileProviderErrorForNonExistentItemWithIdentifier(identifier));
    return;
  }
  request->parentURL = URLForItemWithPersistentIdentifier(toParentItemWithIdentifier);
  if (request->parentURL == nullptr) {
    request->answer(nullptr,
                    fileProviderErrorForNonExistentItemWithIdentifier(toParentItemWithIdentifier));
    return;
  }
  log_debug(qsc_default_log(), "[DEBUG] reparenting url %@ under %@", request->sourceURL,
            request->parentURL);

  // Whether a move is allowed is asked with the name that the item has, not with the new one.
  const NSURLRef probeURL =
      request->parentURL->URLByAppendingPathComponent(request->sourceURL->lastPathComponent());
  const std::uint32_t capability =
      qs_capabilityToMoveToURL(request->sourceURL, probeURL, &request->error);
  if ((capability & QSMoveCapabilityAllowedMask) == 0) {
    _refuseReparenting(request);
  } else if ((capability & QSMoveCapabilityNeedsContentMask) != 0) {
    _provideForReparenting(request);
  } else {
    _reparent(request);
  }
}

void QSFileProviderExtension::_refuseReparenting(const std::shared_ptr<Reparenting>& request) {
  if (request->error == nullptr) request->error = invalidMove();
  log_error(qsc_default_log(), "[ERROR] can't move %@ to %@; %@", request->sourceURL,
            request->parentURL, request->error);
  request->answer(nullptr, qs_fileProviderError(request->error));
}

void QSFileProviderExtension::_provideForReparenting(const std::shared_ptr<Reparenting>& request) {
  log_debug(qsc_default_log(),
            "[DEBUG] Taking coordinated read on source url %@ because it needs downloading",
            request->sourceURL->path());
  const auto operation = QSFileProvidingOperation::initWithURL(
      request->sourceURL, QSFileCoordinatorReadingForcesProviding);
  // A queue of its own: moves download beside each other, and beside what is only read.
  NSOperationQueue queue;
  {
    LockGuard guard(_itemsForcedDownloadLock);
    _itemsForcedDownload.push_back(request->identifier);
  }
  operation->setFileProvidingCompletion(
      [self = shared_from_this(), request](const NSErrorRef& error) {
        self->_didProvideForReparenting(request, error);
      });
  queue.addOperation(operation);
}

void QSFileProviderExtension::_didProvideForReparenting(const std::shared_ptr<Reparenting>& request,
                                                        const NSErrorRef& error) {
  log_debug(qsc_default_log(), "[DEBUG] Finished providing %@ with error %@",
            request->sourceURL->path(), error);
  if (error != nullptr) {
    request->answer(nullptr, error);
  } else {
    _reparent(request);
  }
  LockGuard guard(_itemsForcedDownloadLock);
  const auto found = std::ranges::find(_itemsForcedDownload, request->identifier);
  if (found != _itemsForcedDownload.end()) _itemsForcedDownload.erase(found);
}

void QSFileProviderExtension::_reparent(const std::shared_ptr<Reparenting>& request) {
  fp_reparentUnderFolder(
      request->sourceURL, request->parentURL, request->newName,
      [self = shared_from_this(), request](const NSURLRef& newURL, const NSErrorRef& error) {
        log_debug(qsc_default_log(), "[DEBUG] got new URL %@; %@", newURL, error);
        if (const NSErrorRef mapped = self->fileProviderErrorFromFSError(error)) {
          request->answer(nullptr, qs_fileProviderError(mapped));
          return;
        }
        const QSQueryItemRef item = self->_propertiesForNewItemAtURL(newURL, &request->error);
        request->answer(item, request->error);
      });
}

}  // namespace yomber
