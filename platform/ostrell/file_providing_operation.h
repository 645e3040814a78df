#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "platform/fileprovider/extension.h"
#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/operation.h"
#include "platform/foundation/url.h"

namespace yomber {

class CancellableCall;
class DaemonLink;
class DaemonSession;

/// Asks the daemon to make a file's content present on disk.
///
/// It ends once: with no error when the content can be read; with the daemon's error; with
/// QSOstrellErrorConnectionLost when the daemon goes away meanwhile; or, when it is cancelled, also
/// before it starts, with NSUserCancelledError, and then the daemon is told that nobody here waits
/// any more. Content may be large and the store slow, so there is no time limit while the daemon
/// answers other questions; when it does not, NSXPCConnectionTimedOut.
///
/// Ownership: a queue keeps it until it is finished. Thread-safety: every public operation may be
/// called on any thread.
class QSFileProvidingOperation final : public NSOperation {
 public:
  static std::shared_ptr<QSFileProvidingOperation> initWithURL(
      const NSURLRef& url, NSFileCoordinatorReadingOptions readingOptions);
  ~QSFileProvidingOperation() override;

  /// Called once, on a pool thread, before an operation that was started is finished. Set before
  /// the start.
  void setFileProvidingCompletion(std::function<void(NSErrorRef error)> completion);
  /// Whether the content must be what the daemon has when the operation ends: what is going on with
  /// an item whose content is here is waited for. Set before the start.
  void setWantsCurrentVersion(bool wantsCurrentVersion);

  void cancel() override;
  [[nodiscard]] bool isAsynchronous() const override { return true; }

 protected:
  void main() override;

 private:
  QSFileProvidingOperation(const NSURLRef& url, NSFileCoordinatorReadingOptions readingOptions);
  std::shared_ptr<QSFileProvidingOperation> self();
  NSFileCoordinatorReadingOptions options();
  void ask(const std::shared_ptr<DaemonLink>& link, const std::shared_ptr<DaemonSession>& session);
  /// The first outcome counts; it is delivered elsewhere.
  void settle(const NSErrorRef& outcome);

  const NSURLRef url_;
  const NSFileCoordinatorReadingOptions readingOptions_;
  const std::unique_ptr<CancellableCall> call_;

  Mutex mutex_;
  bool isSettled_ GUARDED_BY(mutex_) = false;
  bool wantsCurrentVersion_ GUARDED_BY(mutex_) = false;
  std::function<void(NSErrorRef)> completion_ GUARDED_BY(mutex_);
};

}  // namespace yomber
