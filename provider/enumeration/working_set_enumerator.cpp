#include "provider/enumeration/working_set_enumerator.h"

#include "platform/fileprovider/manager.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_connection.h"
#include "provider/enumeration/page_size.h"
#include "provider/extension/error_mapping.h"

namespace yomber {
namespace {

/// What the framework gets for a daemon error of this enumerator: here a signed-out daemon is a
/// bare "not authenticated".
NSErrorRef workingSetError(const NSErrorRef& error) {
  if (!error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut)) return qs_fileProviderError(error);
  return qs_fileProviderError(
      NSError::errorWithDomain(NSFileProviderErrorDomain, NSFileProviderErrorNotAuthenticated));
}

std::vector<NSFileProviderItemIdentifier> identifiers(const std::vector<QSFileObjectIDRef>& ids) {
  std::vector<NSFileProviderItemIdentifier> result;
  result.reserve(ids.size());
  for (const QSFileObjectIDRef& id : ids) result.push_back(id->asString());
  return result;
}

template <typename ObserverRef>
QSDaemonProxyRef proxyFinishing(const ObserverRef& observer) {
  return QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler(
      [observer](NSErrorRef error) { observer->finishEnumeratingWithError(std::move(error)); });
}

void signalWorkingSet() {
  NSFileProviderManager::defaultManager().signalEnumeratorForContainerItemIdentifier(
      NSFileProviderWorkingSetContainerItemIdentifier, [](const NSErrorRef& /*error*/) {});
}

}  // namespace

NSFileProviderSyncAnchor QSWorkingSetEnumerator::initialSyncAnchor() {
  return NSData::dataWithString("initialSyncAnchor");
}

void QSWorkingSetEnumerator::enumerateItemsForObserver(
    NSFileProviderEnumerationObserverRef observer, NSFileProviderPage /*page*/) {
  // The rank does not matter, only whether the daemon answers.
  proxyFinishing(observer)->currentNotifRankWithReply(
      [observer](std::uint64_t /*rank*/, const NSErrorRef& error) {
        if (error != nullptr) {
          observer->finishEnumeratingWithError(workingSetError(error));
          return;
        }
        observer->finishEnumeratingUpToPage(nullptr);
        signalWorkingSet();
      });
}

void QSWorkingSetEnumerator::enumerateChangesForObserver(NSFileProviderChangeObserverRef observer,
                                                         NSFileProviderSyncAnchor anchor) {
  const bool fromTheBeginning = anchor != nullptr && anchor->isEqualToData(initialSyncAnchor());
  const QSDaemonProxyRef proxy = proxyFinishing(observer);
  proxy->enumerateWorkingSetChangesFromChangeToken(
      fromTheBeginning ? nullptr : anchor, kEnumerationPageSize,
      [observer, anchor](const QSQueryItems& updated, const std::vector<QSFileObjectIDRef>& deleted,
                         NSDataRef token, const NSErrorRef& error) {
        if (error != nullptr) {
          observer->finishEnumeratingWithError(workingSetError(error));
          return;
        }
        observer->didUpdateItems(fileProviderItems(updated));
        observer->didDeleteItemsWithIdentifiers(identifiers(deleted));
        // The framework keeps asking until the daemon gives back the anchor that was asked for.
        const bool moreComing = token == nullptr || !token->isEqualToData(anchor);
        observer->finishEnumeratingChangesUpToSyncAnchor(std::move(token), moreComing);
      });
}

void QSWorkingSetEnumerator::currentSyncAnchorWithCompletionHandler(
    std::function<void(NSFileProviderSyncAnchor)> completionHandler) {
  if (completionHandler) completionHandler(initialSyncAnchor());
}

}  // namespace yomber
