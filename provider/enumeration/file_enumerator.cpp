#include "provider/enumeration/file_enumerator.h"

#include "platform/foundation/log.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "provider/enumeration/change_tokens.h"
#include "provider/enumeration/page_size.h"
#include "provider/enumeration/page_tokens.h"
#include "provider/extension/error_mapping.h"
#include "provider/extension/log_sections.h"

namespace yomber {
namespace {

UUID freshUUID() {
  UUID uuid;
  uuid_generate(uuid);
  return uuid;
}

}  // namespace

std::shared_ptr<QSFileEnumerator> QSFileEnumerator::initWithFileObjectID(
    QSFileObjectIDRef fileObjectID, NSURLRef url, NSFileProviderItemIdentifier itemIdentifier,
    Recursive recursive) {
  if (url == nullptr) {
    log_error(qsc_default_log(), "[ERROR] can't create a file enumeration without a url");
    return nullptr;
  }
  return std::shared_ptr<QSFileEnumerator>(new QSFileEnumerator(
      std::move(fileObjectID), std::move(url), std::move(itemIdentifier), recursive));
}

QSFileEnumerator::QSFileEnumerator(QSFileObjectIDRef fileObjectID, NSURLRef url,
                                   NSFileProviderItemIdentifier itemIdentifier, Recursive recursive)
    : _itemIdentifier(std::move(itemIdentifier)),
      _fileObjectID(std::move(fileObjectID)),
      _url(std::move(url)),
      _isRecursive(recursive),
      _queue(SerialQueue::create("file-enumerator")),
      _uuid(freshUUID()) {}

void QSFileEnumerator::currentSyncAnchorWithCompletionHandler(
    std::function<void(NSFileProviderSyncAnchor)> completionHandler) {
  // Always rank 0: what a fresh listing starts from is valid only until a batch has been delivered.
  if (completionHandler) completionHandler(qs_changeTokenFromRank(0, _uuid.load()));
}

void QSFileEnumerator::enumerateItemsForObserver(NSFileProviderEnumerationObserverRef observer,
                                                 NSFileProviderPage page) {
  Log& log = qsc_default_log();
  const LogSection outer(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┏%llx listing items", outer.id());
  if (page != nullptr) log_debug(log, "[DEBUG] from page %lu", qs_pageTokenOffset(page));

  // Ends with the reply, not with this scope; never when the registration fails.
  const std::uint64_t inner = createLogSection(LogSectionLevel::Debug);
  log_debug(log, "[DEBUG] ┣%llx calling zarn", inner);
  const auto sortOrder = static_cast<std::uint8_t>(qs_pageTokenSortOrder(page));
  setupNotificationReceivingIfNeededWithCompletion(
      [self = shared_from_this(), observer, page, sortOrder, inner](const NSErrorRef& error) {
        if (error != nullptr) {
          observer->finishEnumeratingWithError(qs_fileProviderError(error));
        } else {
          self->_listPage(observer, page, sortOrder, inner);
        }
      });
}

void QSFileEnumerator::_listPage(const NSFileProviderEnumerationObserverRef& observer,
                                 const NSFileProviderPage& page, std::uint8_t sortOrder,
                                 std::uint64_t section) {
  const QSDaemonProxyRef proxy =
      QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler(
          [observer](const NSErrorRef& error) {
            observer->finishEnumeratingWithError(qs_fileProviderError(error));
          });
  proxy->enumerateItemsInFolder(
      _fileObjectID, sortOrder, qs_pageTokenOffset(page), kEnumerationPageSize,
      [observer, sortOrder, section](const QSQueryItems& items, std::uint64_t nextOffset,
                                     const NSErrorRef& error) {
        Log& log = qsc_default_log();
        log_debug(log, "[DEBUG] ┳%llx received next page %llu items=%@", section, nextOffset,
                  items);
        if (error != nullptr) {
          log_error(log, "[ERROR] there was an error when listing items: %@", error);
          observer->finishEnumeratingWithError(qs_fileProviderError(error));
        } else {
          observer->didEnumerateItems(fileProviderItems(items));
          observer->finishEnumeratingUpToPage(qs_pageTokenFromSortOrder(sortOrder, nextOffset));
        }
        closeLogSection(&section);
      });
}

}  // namespace yomber
