#include <memory>
#include <optional>
#include <string>

#include "platform/foundation/file_manager.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/file_manager_additions.h"
#include "platform/ostrell/file_object_id.h"
#include "platform/ostrell/item_additions.h"
#include "provider/extension/extension.h"

namespace yomber {

void QSFileProviderExtension::stopProvidingItemAtURL(const NSURLRef& url) {
  const std::string path = url != nullptr ? url->path() : std::string();
  log_debug(qsc_default_log(), "[DEBUG] stop providing %@", path);
  if (_isDownloadingForMove(url)) return;

  std::shared_ptr<QSFileProvidingOperation> operation;
  {
    LockGuard guard(_lock);
    const auto found = _downloadOperationByPath.find(path);
    if (found != _downloadOperationByPath.end()) operation = found->second;
  }
  if (operation != nullptr) {
    operation->cancel();
    return;
  }
  NSErrorRef error;
  if (!evictUbiquitousItemAtURL(NSFileManager::defaultManager(), url, &error)) {
    log_error(qsc_default_log(), "[ERROR] can't evict item at url: %@", error);
  }
}

bool QSFileProviderExtension::_isDownloadingForMove(const NSURLRef& url) {
  if (url == nullptr) return false;
  LockGuard guard(_itemsForcedDownloadLock);
  for (const auto& identifier : _itemsForcedDownload) {
    const auto fileObjectID = QSFileObjectID::fileObjectIDWithString(identifier);
    const NSURLRef forcedURL = URLForItemWithPersistentIdentifier(identifier);
    if (fileObjectID == nullptr || forcedURL == nullptr) continue;
    if (fileObjectID->isFolderOrAliasID() && qs_isParentOfURL(forcedURL, url)) {
      log_default(qsc_default_log(),
                  "[WARNING] Can't cancel download of %@ which is inside a folder downloading for "
                  "CZM",
                  url->path());
      return true;
    }
    if (fileObjectID->isDocumentID() && forcedURL->path() == url->path()) {
      log_default(qsc_default_log(),
                  "[WARNING] Can't cancel download of %@ which is downloading for CZM",
                  url->path());
      return true;
    }
  }
  return false;
}

void QSFileProviderExtension::itemChangedAtURL(const NSURLRef& url) {
  log_debug(qsc_default_log(), "[DEBUG] Item changed at URL %@", url);
}

void QSFileProviderExtension::movingItemAtURL(const NSURLRef& url, const NSURLRef& destinationURL,
                                              MoveHandler completionHandler) {
  NSErrorRef error;
  const std::uint32_t capability = qs_capabilityToMoveToURL(url, destinationURL, &error);
  const bool needsContent = (capability & QSMoveCapabilityNeedsContentMask) != 0;
  if (completionHandler) completionHandler(needsContent, needsContent ? nullptr : error);
}

}  // namespace yomber
