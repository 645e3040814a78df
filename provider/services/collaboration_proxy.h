#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/foundation/operation.h"
#include "platform/ostrell/collaboration_service.h"

namespace yomber {

class QSFileProviderExtension;

/// What a client of the collaboration service talks to: answers for one document, some with fixed
/// values, the rest by the daemon's client library. Three of the protocol's operations are left
/// out. Each connection has one of its own.
///
/// Ownership: shared; what it starts outlives it until it completes. Thread-safety: every operation
/// may be called on any thread. Errors reach the reply unchanged.
/// REQUIRES: a reply, except where a token is fetched.
class QSFileProviderPandrelCollaborationProxy final : public QSFileProviderPandrelCollaboration {
 public:
  /// Never nil.
  static std::shared_ptr<QSFileProviderPandrelCollaborationProxy> initWithFileProviderExtension(
      std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
      std::shared_ptr<NSOperationQueue> operationQueue);

  void fetchVersionAndCapabilitiesWithCompletionHandler(VersionReply reply) override;
  NSProgressRef fetchCollaborationTokenWithCompletionHandler(TokenReply reply) override;
  NSProgressRef fetchLatestRevisionWithCompletionHandler(ErrorReply reply) override;
  /// Cannot be cancelled.
  NSProgressRef refreshSharingStateWithCompletionHandler(ErrorReply reply) override;
  void fetchFileProviderIdentifierWithCompletionHandler(StringReply reply) override;
  /// No location is ever supplied.
  void fetchURLForSharingFileWithCompletionHandler(URLReply reply) override;
  NSProgressRef fetchFolderSharingStateWithCompletionHandler(FolderStateReply reply) override;
  NSProgressRef fetchSharedFolderInfoWithCompletionHandler(FolderInfoReply reply) override;

  [[nodiscard]] static NSProgressRef _newProgressWithCancellationHandler(
      std::function<void()> handler);

 private:
  QSFileProviderPandrelCollaborationProxy(
      std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
      std::shared_ptr<NSOperationQueue> operationQueue);

  // In this order: they are released from the last to the first.
  const std::shared_ptr<QSFileProviderExtension> _fileProviderExtension;
  const std::string _itemIdentifier;
  const std::shared_ptr<NSOperationQueue> _operationQueue;
};

}  // namespace yomber
