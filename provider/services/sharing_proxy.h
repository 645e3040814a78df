#pragma once

#include <memory>
#include <string>

#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/object.h"
#include "platform/foundation/operation.h"
#include "platform/ostrell/sharing_service.h"

namespace yomber {

class QSFileProviderExtension;

/// What a client of the sharing service talks to: shares one item by asking its location and the
/// daemon's client library. Each connection has one of its own.
///
/// Ownership: shared by the connection and by the operations that it starts, which outlive the
/// connection until they complete. Thread-safety: every operation may be called on any thread; they
/// block theirs for the reads of the item's resource values. Errors reach the reply unchanged. A
/// missing reply is tolerated.
class QSSharingProxy final : public NSObject,
                             public QSSharingServiceV1,
                             public std::enable_shared_from_this<QSSharingProxy> {
 public:
  /// Never nil.
  static std::shared_ptr<QSSharingProxy> initWithFileProviderExtension(
      std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
      std::shared_ptr<NSOperationQueue> operationQueue);

  void fetchSharingInfo(QSSharingInfoReply reply) override;
  /// Answers on the calling thread; item and lists are always nil.
  NSProgressRef preflightCheckIfCurrentlyShareableWithCompletion(
      QSShareablePreflightReply completion) override;
  NSProgressRef fetchParticipantListAndPublicPermission(QSParticipantsReply reply) override;
  void startPreparingForShareWhenForcing(bool forcing) override;
  /// Answers at once, and nil, when a share was fetched or saved before. The progress never shows
  /// completion.
  NSProgressRef fetchShareWithCompletion(QSShareReply completion) override;
  NSProgressRef fetchShareURLWithCompletion(QSShareURLReply completion) override;
  NSProgressRef saveShare(const RZShareRef& share, QSShareReply completion) override;
  /// A folder's share only by an identifier that begins with "i".
  NSProgressRef unshareWithCompletion(QSErrorReply completion) override;

  [[nodiscard]] std::string description() const override;

 private:
  struct Unsharing;

  QSSharingProxy(std::shared_ptr<QSFileProviderExtension> fileProviderExtension,
                 std::string itemIdentifier, std::shared_ptr<NSOperationQueue> operationQueue);

  /// Whether the item is shared now; no, and an error, when that cannot be read.
  bool _isShared(NSErrorRef* error);
  void _didCopyShare(const RZShareRef& share, const NSErrorRef& error, const NSURLRef& itemURL,
                     const QSShareReply& completion);
  void _didFetchShareToUnshare(const std::shared_ptr<Unsharing>& unsharing, const RZShareRef& share,
                               const NSErrorRef& error);

  // Each writes its line and then replies.
  void _reply(const QSShareReply& reply, const RZShareRef& share, const NSErrorRef& error) const;
  void _reply(const QSShareURLReply& reply, const NSURLRef& url, const NSErrorRef& error) const;
  void _reply(const QSErrorReply& reply, const NSErrorRef& error) const;

  // In this order: they are released from the last to the first.
  const std::shared_ptr<QSFileProviderExtension> _fileProviderExtension;
  const std::string _itemIdentifier;
  const std::shared_ptr<NSOperationQueue> _operationQueue;
  /// What was last fetched or saved on this connection.
  AtomicCell<RZShareRef> _cachedShare;
};

}  // namespace yomber
