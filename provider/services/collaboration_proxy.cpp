#include "provider/services/collaboration_proxy.h"

#include <cstdint>
#include <utility>

#include "platform/foundation/log.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/file_providing_operation.h"
#include "platform/ostrell/share_operations.h"
#include "provider/extension/extension.h"

namespace yomber {
namespace {

constexpr const char* kProviderIdentifier = "com.kelvo.Ostrell";

// What clients were built to: the bits 2, 16 and 64.
constexpr std::uint64_t kVersion = 1;
constexpr std::uint64_t kCapabilities = 82;

QSDaemonProxyRef daemonProxy(std::function<void(NSErrorRef)> errorHandler) {
  return QSDaemonConnection::defaultConnection().remoteObjectProxyWithErrorHandler(
      std::move(errorHandler));
}

}  // namespace

QSFileProviderPandrelCollaborationProxy::QSFileProviderPandrelCollaborationProxy(
    std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
    std::shared_ptr<NSOperationQueue> operationQueue)
    : _fileProviderExtension(std::move(fileProviderExtension)),
      _itemIdentifier(std::move(itemIdentifier)),
      _operationQueue(std::move(operationQueue)) {}

std::shared_ptr<QSFileProviderPandrelCollaborationProxy>
QSFileProviderPandrelCollaborationProxy::initWithFileProviderExtension(
    std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
    std::shared_ptr<NSOperationQueue> operationQueue) {
  return std::shared_ptr<QSFileProviderPandrelCollaborationProxy>(
      new QSFileProviderPandrelCollaborationProxy(
          std::move(fileProviderExtension), std::move(itemIdentifier), std::move(operationQueue)));
}

NSProgressRef QSFileProviderPandrelCollaborationProxy::_newProgressWithCancellationHandler(
    std::function<void()> handler) {
  auto progress = NSProgress::progressWithTotalUnitCount(0);
  progress->setCancellationHandler(std::move(handler));
  return progress;
}

void QSFileProviderPandrelCollaborationProxy::fetchVersionAndCapabilitiesWithCompletionHandler(
    VersionReply reply) {
  reply(kVersion, kCapabilities, nullptr);
}

void QSFileProviderPandrelCollaborationProxy::fetchFileProviderIdentifierWithCompletionHandler(
    StringReply reply) {
  reply(kProviderIdentifier, nullptr);
}

void QSFileProviderPandrelCollaborationProxy::fetchURLForSharingFileWithCompletionHandler(
    URLReply reply) {
  reply(nullptr, nullptr);
}

NSProgressRef QSFileProviderPandrelCollaborationProxy::fetchCollaborationTokenWithCompletionHandler(
    TokenReply reply) {
  const NSDate expirationDate = NSDate::distantFuture();
  const auto url = _fileProviderExtension->URLForItemWithPersistentIdentifier(_itemIdentifier);
  const auto operation = QSSharingCopyShareTokenOperation::initWithURL(url);
  operation->setShareAndBaseTokenCompletionBlock(
      [reply = std::move(reply), expirationDate](const std::optional<std::string>& shareToken,
                                                 const std::optional<std::string>& baseToken,
                                                 const NSErrorRef& error) {
        if (!reply) return;
        if (error) {
          reply(std::nullopt, std::nullopt, std::nullopt, std::nullopt, error);
        } else {
          reply(kProviderIdentifier, baseToken, shareToken, expirationDate, nullptr);
        }
      });
  _operationQueue->addOperation(operation);
  return _newProgressWithCancellationHandler([operation] { operation->cancel(); });
}

NSProgressRef QSFileProviderPandrelCollaborationProxy::fetchLatestRevisionWithCompletionHandler(
    ErrorReply reply) {
  const auto url = _fileProviderExtension->URLForItemWithPersistentIdentifier(_itemIdentifier);
  log_debug(qsc_default_log(), "[DEBUG] fetchLatestRevisionWithCompletionHandler: %@, %@",
            _itemIdentifier, url);
  const auto operation = QSFileProvidingOperation::initWithURL(url, 0);
  operation->setWantsCurrentVersion(true);
  operation->setFileProvidingCompletion(
      [reply = std::move(reply)](const NSErrorRef& error) { reply(error); });
  _operationQueue->addOperation(operation);
  return _newProgressWithCancellationHandler([operation] { operation->cancel(); });
}

NSProgressRef QSFileProviderPandrelCollaborationProxy::refreshSharingStateWithCompletionHandler(
    ErrorReply reply) {
  daemonProxy([reply](const NSErrorRef& error) { reply(error); })
      ->refreshSharingStateForItemIdentifier(_itemIdentifier, [reply, identifier = _itemIdentifier](
                                                                  const NSErrorRef& error) {
        if (error) {
          log_debug(qsc_default_log(), "[DEBUG] error refreshing state for item identifier %@: %@",
                    identifier, error);
        } else {
          log_debug(qsc_default_log(), "[DEBUG] finished refreshing state for item identifier: %@",
                    identifier);
        }
        reply(error);
      });
  return NSProgress::progressWithTotalUnitCount(0);
}

NSProgressRef QSFileProviderPandrelCollaborationProxy::fetchFolderSharingStateWithCompletionHandler(
    FolderStateReply reply) {
  daemonProxy([reply](const NSErrorRef& error) { reply(false, error); })
      ->getShareOptionsOfItemIdentifier(
          _itemIdentifier, [reply](bool first, bool /*second*/, bool third,
                                   const std::optional<std::string>& /*string*/,
                                   const NSErrorRef& error) { reply(first && !third, error); });
  return nullptr;
}

NSProgressRef QSFileProviderPandrelCollaborationProxy::fetchSharedFolderInfoWithCompletionHandler(
    FolderInfoReply reply) {
  daemonProxy([reply](const NSErrorRef& error) { reply(false, std::nullopt, error); })
      ->getShareOptionsOfItemIdentifier(
          _itemIdentifier,
          [reply](bool first, bool /*second*/, bool third, const std::optional<std::string>& string,
                  const NSErrorRef& error) { reply(first && !third, string, error); });
  return nullptr;
}

}  // namespace yomber
