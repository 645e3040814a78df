#include "provider/services/sharing_proxy.h"

#include <cstdint>
#include <optional>
#include <utility>
#include <vector>

#include "platform/fileprovider/errors.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/share_operations.h"
#include "platform/ostrell/url_resource_values.h"
#include "provider/extension/extension.h"
#include "provider/extension/log_sections.h"

namespace yomber {
namespace {

/// The section of one call, with its opening line.
class CallSection {
 public:
  CallSection(const QSSharingProxy& proxy, const char* methodName,
              const std::string& itemIdentifier)
      : _section(LogSectionLevel::Info) {
    log_info(qsc_default_log(), "[INFO] ┏%llx %@ %s %@", _section.id(), proxy, methodName,
             itemIdentifier);
  }

 private:
  const LogSection _section;
};

bool isOfFolder(const RZShare& share) {
  const auto* const type = share.valueForKey<std::string>(RZShareTypeKey);
  return type != nullptr && *type == RZShareTypeFolder;
}

/// The item has no share on the server.
bool meansNotShared(const NSErrorRef& error) {
  return qsc_isRozzelUnknownItemError(error) ||
         qs_isOstrellErrorCode(error, QSOstrellErrorNotShared);
}

/// Cancelling the progress cancels the operation, if it is still there.
void cancelAlong(const NSProgressRef& progress, const NSOperationRef& operation) {
  progress->setCancellationHandler([weakOperation = std::weak_ptr<NSOperation>(operation)] {
    if (const auto strongOperation = weakOperation.lock()) strongOperation->cancel();
  });
}

}  // namespace

/// An unsharing under way.
struct QSSharingProxy::Unsharing {
  explicit Unsharing(QSErrorReply reply) : completion(std::move(reply)) {}

  const NSProgressRef progress = NSProgress::progressWithTotalUnitCount(2);
  const QSErrorReply completion;
  /// Set when the share is being destroyed.
  AtomicCell<NSOperationRef> destruction;
};

QSSharingProxy::QSSharingProxy(std::shared_ptr<QSFileProviderExtension> fileProviderExtension,
                               std::string itemIdentifier,
                               std::shared_ptr<NSOperationQueue> operationQueue)
    : _fileProviderExtension(std::move(fileProviderExtension)),
      _itemIdentifier(std::move(itemIdentifier)),
      _operationQueue(std::move(operationQueue)) {}

std::shared_ptr<QSSharingProxy> QSSharingProxy::initWithFileProviderExtension(
    std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
    std::shared_ptr<NSOperationQueue> operationQueue) {
  return std::shared_ptr<QSSharingProxy>(new QSSharingProxy(
      std::move(fileProviderExtension), std::move(itemIdentifier), std::move(operationQueue)));
}

std::string QSSharingProxy::description() const {
  return "<QSSharingProxy " + _itemIdentifier + ">";
}

bool QSSharingProxy::_isShared(NSErrorRef* error) {
  const auto url = _fileProviderExtension->URLForItemWithPersistentIdentifier(_itemIdentifier);
  if (!url) {
    storeError(error, fileProviderErrorForNonExistentItemWithIdentifier(_itemIdentifier));
    return false;
  }
  std::optional<bool> isShared;
  return getResourceValue(url, isShared, NSURLUbiquitousItemIsSharedKey, error) &&
         isShared.value_or(false);
}

void QSSharingProxy::fetchSharingInfo(QSSharingInfoReply reply) {
  const CallSection section(*this, "-[QSSharingProxy fetchSharingInfo:]", _itemIdentifier);
  NSErrorRef error;
  const bool isShared = _isShared(&error);
  log_debug(qsc_default_log(), "[DEBUG] %@: reply(%d, %@, %@)", *this, isShared, nullptr, error);
  if (reply) reply(isShared, nullptr, error);
}

NSProgressRef QSSharingProxy::preflightCheckIfCurrentlyShareableWithCompletion(
    QSShareablePreflightReply completion) {
  const CallSection section(*this,
                            "-[QSSharingProxy preflightCheckIfCurrentlyShareableWithCompletion:]",
                            _itemIdentifier);
  NSErrorRef error;
  const bool isShared = _isShared(&error);
  log_debug(qsc_default_log(), "[DEBUG] %@: reply(%d, %@, %@, %@, %@)", *this, isShared, nullptr,
            nullptr, nullptr, error);
  if (completion) completion(isShared, nullptr, {}, {}, error);
  return nullptr;
}

NSProgressRef QSSharingProxy::fetchParticipantListAndPublicPermission(QSParticipantsReply reply) {
  const CallSection section(*this, "-[QSSharingProxy fetchParticipantListAndPublicPermission:]",
                            _itemIdentifier);
  return fetchShareWithCompletion([self = shared_from_this(), reply = std::move(reply)](
                                      const RZShareRef& share, const NSErrorRef& error) {
    std::optional<std::vector<RZShareParticipant>> participants;
    if (share) participants = share->participants();
    const std::int64_t permission = share ? std::to_underlying(share->publicPermission()) : 0;
    log_debug(qsc_default_log(), "[DEBUG] %@: reply(%@, %ld, %@)", *self, participants, permission,
              error);
    if (reply)
      reply(participants ? *participants : std::vector<RZShareParticipant>(), permission, error);
  });
}

void QSSharingProxy::startPreparingForShareWhenForcing(bool /*forcing*/) {
  const CallSection section(*this, "-[QSSharingProxy startPreparingForShareWhenForcing:]",
                            _itemIdentifier);
}

NSProgressRef QSSharingProxy::fetchShareWithCompletion(QSShareReply completion) {
  const CallSection section(*this, "-[QSSharingProxy fetchShareWithCompletion:]", _itemIdentifier);
  if (const RZShareRef cached = _cachedShare.load()) {
    _reply(completion, cached, nullptr);
    return nullptr;
  }
  const auto itemURL = _fileProviderExtension->URLForItemWithPersistentIdentifier(_itemIdentifier);
  const auto progress = NSProgress::progressWithTotalUnitCount(1);
  const auto operation = QSShareCopyOperation::initWithURL(itemURL);
  operation->setRootShareCopyCompletionBlock(
      [self = shared_from_this(), progress, itemURL, completion = std::move(completion)](
          const RZShareRef& share, const NSURLRef& url, const NSErrorRef& error) {
        if (!url) self->_cachedShare.store(share);
        // The total, not what is completed: clients know this progress as one that never ends.
        progress->setTotalUnitCount(1);
        self->_didCopyShare(share, error, itemURL, completion);
      });
  progress->setCancellable(true);
  cancelAlong(progress, operation);
  _operationQueue->addOperation(operation);
  return progress;
}

NSProgressRef QSSharingProxy::fetchShareURLWithCompletion(QSShareURLReply completion) {
  const CallSection section(*this, "-[QSSharingProxy fetchShareURLWithCompletion:]",
                            _itemIdentifier);
  const auto itemURL = _fileProviderExtension->URLForItemWithPersistentIdentifier(_itemIdentifier);
  NSErrorRef typeError;
  const auto type = qs_typeIdentifierWithError(itemURL, &typeError);
  if (typeError) {
    _reply(completion, NSURLRef(), typeError);
    return nullptr;
  }
  const auto progress = NSProgress::progressWithTotalUnitCount(1);
  const auto operation = QSShareCopyShareURLOperation::initWithFileURL(itemURL, type);
  operation->setCopyShareURLCompletionBlock(
      [self = shared_from_this(), progress, completion = std::move(completion)](
          const NSURLRef& shareURL, const NSErrorRef& error) {
        progress->setCompletedUnitCount(1);
        self->_reply(completion, shareURL, error);
      });
  progress->setCancellable(true);
  cancelAlong(progress, operation);
  _operationQueue->addOperation(operation);
  return progress;
}

NSProgressRef QSSharingProxy::saveShare(const RZShareRef& share, QSShareReply completion) {
  const CallSection section(*this, "-[QSSharingProxy saveShare:completion:]", _itemIdentifier);
  if (share && isOfFolder(*share)) {
    _reply(completion, RZShareRef(), qs_errorWithPOSIXCode(QSPOSIXErrorNotSupported));
    return nullptr;
  }
  _cachedShare.store(share);
  const auto operation = QSShareSaveOperation::initWithShare(share);
  const auto progress = NSProgress::progressWithTotalUnitCount(1);
  operation->setShareSaveCompletionBlock(
      [self = shared_from_this(), progress, completion = std::move(completion)](
          const RZShareRef& savedShare, const NSErrorRef& error) {
        progress->setCompletedUnitCount(1);
        self->_cachedShare.store(savedShare);
        self->_reply(completion, savedShare, error);
      });
  progress->setCancellable(true);
  cancelAlong(progress, operation);
  _operationQueue->addOperation(operation);
  return progress;
}

NSProgressRef QSSharingProxy::unshareWithCompletion(QSErrorReply completion) {
  const CallSection section(*this, "-[QSSharingProxy unshareWithCompletion:]", _itemIdentifier);
  const auto unsharing = std::make_shared<Unsharing>(std::move(completion));
  const auto progress = unsharing->progress;
  progress->setCancellable(true);
  const auto fetchProgress = fetchShareWithCompletion(
      [self = shared_from_this(), unsharing](const RZShareRef& share, const NSErrorRef& error) {
        self->_didFetchShareToUnshare(unsharing, share, error);
      });
  if (progress->completedUnitCount() == 0) {
    progress->setCancellationHandler([fetchProgress] {
      if (fetchProgress) fetchProgress->cancel();
    });
    // It may have begun to destroy since: that must stay what a cancellation ends.
    if (const auto destruction = unsharing->destruction.load()) cancelAlong(progress, destruction);
  }
  return progress;
}

void QSSharingProxy::_didCopyShare(const RZShareRef& share, const NSErrorRef& error,
                                   const NSURLRef& itemURL, const QSShareReply& completion) {
  if (qsc_checkErrorsFromRozzel(error, meansNotShared)) {
    NSErrorRef creationError;
    const auto created = QSSharingCreateShareForItemAtURL(itemURL, &creationError);
    _reply(completion, created, creationError);
  } else if (error) {
    _reply(completion, RZShareRef(), error);
  } else {
    _reply(completion, share, nullptr);
  }
}

void QSSharingProxy::_didFetchShareToUnshare(const std::shared_ptr<Unsharing>& unsharing,
                                             const RZShareRef& share, const NSErrorRef& error) {
  if (error) {
    _reply(unsharing->completion, error);
    return;
  }
  if (!share || !share->isKnownToServer()) {
    _reply(unsharing->completion, NSErrorRef());
    return;
  }
  if (isOfFolder(*share) && !_itemIdentifier.starts_with('i')) {
    _reply(unsharing->completion, qs_errorWithPOSIXCode(QSPOSIXErrorNotSupported));
    return;
  }
  _cachedShare.store(nullptr);
  unsharing->progress->setCompletedUnitCount(1);
  const auto operation = QSShareDestroyOperation::initWithShare(share);
  operation->setShareDestroyCompletionBlock(
      [self = shared_from_this(), unsharing](const NSErrorRef& destroyError) {
        self->_reply(unsharing->completion, destroyError);
        unsharing->progress->setCompletedUnitCount(2);
        unsharing->destruction.store(nullptr);
      });
  unsharing->destruction.store(operation);
  cancelAlong(unsharing->progress, operation);
  _operationQueue->addOperation(operation);
}

void QSSharingProxy::_reply(const QSShareReply& reply, const RZShareRef& share,
                            const NSErrorRef& error) const {
  log_debug(qsc_default_log(), "[DEBUG] %@: reply(%@, %@)", *this, share, error);
  if (reply) reply(share, error);
}

void QSSharingProxy::_reply(const QSShareURLReply& reply, const NSURLRef& url,
                            const NSErrorRef& error) const {
  log_debug(qsc_default_log(), "[DEBUG] %@: reply(%@, %@)", *this, url, error);
  if (reply) reply(url, error);
}

void QSSharingProxy::_reply(const QSErrorReply& reply, const NSErrorRef& error) const {
  log_debug(qsc_default_log(), "[DEBUG] %@: reply(%@)", *this, error);
  if (reply) reply(error);
}

}  // namespace yomber
