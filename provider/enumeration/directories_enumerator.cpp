#include "provider/enumeration/directories_enumerator.h"

#include "platform/foundation/log.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "provider/enumeration/page_size.h"
#include "provider/enumeration/page_tokens.h"
#include "provider/extension/error_mapping.h"

namespace yomber {

void QSDirectoriesEnumerator::enumerateItemsForObserver(
    NSFileProviderEnumerationObserverRef observer, NSFileProviderPage page) {
  const auto sortOrder = static_cast<std::uint8_t>(qs_pageTokenSortOrder(page));
  const QSDaemonProxyRef proxy =
      QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler(
          [observer](NSErrorRef error) { observer->finishEnumeratingWithError(std::move(error)); });
  proxy->enumerateAllFoldersWithSortOrder(
      sortOrder, qs_pageTokenOffset(page), kEnumerationPageSize,
      [observer, sortOrder](const QSQueryItems& items, std::uint64_t nextOffset,
                            const NSErrorRef& error) {
        if (error != nullptr) {
          log_error(qsc_default_log(), "[ERROR] there was an error when listing items: %@", error);
          observer->finishEnumeratingWithError(qs_fileProviderError(error));
          return;
        }
        observer->didEnumerateItems(fileProviderItems(items));
        observer->finishEnumeratingUpToPage(qs_pageTokenFromSortOrder(sortOrder, nextOffset));
      });
}

}  // namespace yomber
