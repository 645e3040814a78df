#include "platform/fileprovider/thumbnail_request.h"

#include <optional>
#include <string>
#include <utility>

#include "platform/fileprovider/extension_code.h"
#include "platform/fileprovider/thumbnail_sender.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/loop_reply.h"

namespace yomber {
namespace {

NSErrorRef dropped() {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSXPCConnectionReplyInvalid,
      {{NSLocalizedDescriptionKey,
        std::string("the extension dropped the request for thumbnails without completing it")}});
}

/// A request that is under way: its progress comes only when the extension has begun, which may
/// take as long as its lookups.
class RunningRequest {
 public:
  explicit RunningRequest(std::shared_ptr<ThumbnailSender> sender) : sender_(std::move(sender)) {}

  [[nodiscard]] const std::shared_ptr<ThumbnailSender>& sender() const { return sender_; }
  void didBegin(const NSProgressRef& progress) {
    {
      LockGuard guard(mutex_);
      progress_ = progress;
      if (!isDropped_) return;
    }
    if (progress != nullptr) progress->cancel();
  }
  /// On a thread that handlers of the extension may hold up.
  void drop() {
    sender_->end();
    NSProgressRef progress;
    {
      LockGuard guard(mutex_);
      isDropped_ = true;
      progress = progress_;
    }
    if (progress != nullptr) progress->cancel();
  }

 private:
  const std::shared_ptr<ThumbnailSender> sender_;
  Mutex mutex_;
  NSProgressRef progress_ GUARDED_BY(mutex_);
  bool isDropped_ GUARDED_BY(mutex_) = false;
};

}  // namespace

kj::Promise<NSErrorRef> requestThumbnails(std::shared_ptr<NSFileProviderExtension> extension,
                                          std::vector<NSFileProviderItemIdentifier> identifiers,
                                          CGSize size,
                                          ipc::Remote<protocol::ThumbnailReceiver> receiver) {
  const auto running =
      std::make_shared<RunningRequest>(std::make_shared<ThumbnailSender>(std::move(receiver)));
  auto reply = ipc::LoopReply<NSErrorRef>::makeFor(dropped());
  TypedThumbnailHandler handler =
      [sender = running->sender()](const NSFileProviderItemIdentifier& identifier, NSDataRef image,
                                   const std::optional<std::string>& type, NSErrorRef error) {
        sender->deliver({identifier, std::move(image), type, std::move(error)});
      };
  ErrorHandler completion = [sender = running->sender(),
                             fulfill = std::move(reply.fulfill)](NSErrorRef failure) {
    sender->finish([fulfill, failure = std::move(failure)](const NSErrorRef& unsent) {
      fulfill(failure != nullptr ? failure : unsent);
    });
  };
  runExtensionCode(
      "fetchThumbnailsForItemIdentifiers",
      [extension = std::move(extension), identifiers = std::move(identifiers), size, running,
       handler = std::move(handler), completion = std::move(completion)]() mutable {
        running->didBegin(extension->fetchThumbnailsForItemIdentifiers(
            identifiers, size, std::move(handler), std::move(completion)));
      });
  auto end = kj::defer([running] { runExtensionCode("cancel", [running] { running->drop(); }); });
  return reply.promise.attach(kj::mv(end));
}

}  // namespace yomber
