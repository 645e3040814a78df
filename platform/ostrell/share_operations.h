#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/operation.h"
#include "platform/foundation/url.h"
#include "platform/rozzel/share.h"

namespace yomber {

class CancellableCall;
class DaemonLink;
class DaemonSession;

/// What the operations on shares have in common: each asks the daemon one thing.
///
/// It ends once: with what the daemon answered; with QSOstrellErrorConnectionLost when the daemon
/// goes away meanwhile (a change may have been made or not); or, when it is cancelled, also before
/// it starts, with NSUserCancelledError, and then the daemon is told that nobody here waits any
/// more. The store may be slow, so there is no time limit while the daemon answers other questions;
/// when it does not, NSXPCConnectionTimedOut. Without a location it ends with Cocoa error 4,
/// without a share with QSOstrellErrorInvalidParameter, and asks nobody.
///
/// A completion is called once, on a pool thread, before an operation that was started is finished.
/// Set it before the start. Ownership: a queue keeps the operation until it is finished.
/// Thread-safety: every public operation may be called on any thread.
class QSSharingOperation : public NSOperation {
 public:
  ~QSSharingOperation() override;
  void cancel() override;
  [[nodiscard]] bool isAsynchronous() const override { return true; }

 protected:
  /// Of what an operation may answer, those that it does; an error, or nil.
  struct Outcome {
    RZShareRef share = {};
    NSURLRef url = {};
    std::optional<std::string> first = {};
    std::optional<std::string> second = {};
    NSErrorRef error = {};
  };
  class Sender;

  /// `subject` says in errors what it was about. `refusal` is what it ends with at once, or nil.
  QSSharingOperation(std::string subject, NSErrorRef refusal);
  void setCompletion(std::function<void(const Outcome& outcome)> completion);
  void main() override;
  /// Makes the call. Must not block.
  virtual void ask(Sender& sender) = 0;

 private:
  friend class Sender;
  std::shared_ptr<QSSharingOperation> self();
  /// The first outcome counts; it is delivered elsewhere.
  void settle(const Outcome& outcome);

  const std::string subject_;
  const NSErrorRef refusal_;
  const std::unique_ptr<CancellableCall> call_;

  Mutex mutex_;
  bool isSettled_ GUARDED_BY(mutex_) = false;
  std::function<void(const Outcome&)> completion_ GUARDED_BY(mutex_);
};

/// Fetches the share that an item belongs to. `url` is the location of the shared folder when the
/// item is not shared itself but lies in one, else nil. QSOstrellErrorNotShared: there is none.
class QSShareCopyOperation final : public QSSharingOperation {
 public:
  static std::shared_ptr<QSShareCopyOperation> initWithURL(const NSURLRef& url);
  void setRootShareCopyCompletionBlock(
      std::function<void(RZShareRef share, NSURLRef url, NSErrorRef error)> completion);

 protected:
  void ask(Sender& sender) override;

 private:
  explicit QSShareCopyOperation(const NSURLRef& url);
  const NSURLRef url_;
};

/// Fetches the link by which others accept the share of an item. QSOstrellErrorNotShared: there is
/// none.
class QSShareCopyShareURLOperation final : public QSSharingOperation {
 public:
  /// `documentType` is the item's content type.
  static std::shared_ptr<QSShareCopyShareURLOperation> initWithFileURL(
      const NSURLRef& url, const std::optional<std::string>& documentType);
  void setCopyShareURLCompletionBlock(
      std::function<void(NSURLRef shareURL, NSErrorRef error)> completion);

 protected:
  void ask(Sender& sender) override;

 private:
  QSShareCopyShareURLOperation(const NSURLRef& url, const std::optional<std::string>& documentType);
  const NSURLRef url_;
  const std::string documentType_;
};

/// Saves a share, that of a folder too; the first save shares the item. RZErrorServerRecordChanged:
/// somebody else saved it meanwhile; fetch it and change that. RZErrorPermissionFailure: it is
/// somebody else's.
class QSShareSaveOperation final : public QSSharingOperation {
 public:
  static std::shared_ptr<QSShareSaveOperation> initWithShare(const RZShareRef& share);
  void setShareSaveCompletionBlock(
      std::function<void(RZShareRef savedShare, NSErrorRef error)> completion);

 protected:
  void ask(Sender& sender) override;

 private:
  explicit QSShareSaveOperation(const RZShareRef& share);
  const RZShareRef share_;
};

/// Ends a share that is the account's own, or leaves one of somebody else.
class QSShareDestroyOperation final : public QSSharingOperation {
 public:
  static std::shared_ptr<QSShareDestroyOperation> initWithShare(const RZShareRef& share);
  void setShareDestroyCompletionBlock(std::function<void(NSErrorRef error)> completion);

 protected:
  void ask(Sender& sender) override;

 private:
  explicit QSShareDestroyOperation(const RZShareRef& share);
  const RZShareRef share_;
};

/// Fetches what names an item's share, and the version of the document that the store has.
class QSSharingCopyShareTokenOperation final : public QSSharingOperation {
 public:
  static std::shared_ptr<QSSharingCopyShareTokenOperation> initWithURL(const NSURLRef& url);
  /// Both tokens are nil when there is an error.
  void setShareAndBaseTokenCompletionBlock(
      std::function<void(const std::optional<std::string>& shareToken,
                         const std::optional<std::string>& baseToken, NSErrorRef error)>
          completion);

 protected:
  void ask(Sender& sender) override;

 private:
  explicit QSSharingCopyShareTokenOperation(const NSURLRef& url);
  const NSURLRef url_;
};

/// Accepts the share with a link, and answers the shared item's identifier when it is in the drive.
/// Accepting once more answers the same. RZErrorUnknownItem: there is no such share (any more);
/// RZErrorPermissionFailure: it is not for this account.
class QSShareAcceptOperation final : public QSSharingOperation {
 public:
  static std::shared_ptr<QSShareAcceptOperation> initWithShareURL(const NSURLRef& shareURL);
  /// The identifier is nil when there is an error.
  void setShareAcceptCompletionBlock(
      std::function<void(const std::optional<std::string>& identifier, NSErrorRef error)>
          completion);

 protected:
  void ask(Sender& sender) override;

 private:
  explicit QSShareAcceptOperation(const NSURLRef& shareURL);
  const NSURLRef url_;
};

/// A share of the item for `QSShareSaveOperation`, which the store knows nothing of yet; nil and an
/// error when there can be none. A synchronous daemon call.
[[nodiscard]] RZShareRef QSSharingCreateShareForItemAtURL(const NSURLRef& url, NSErrorRef* error);

}  // namespace yomber
