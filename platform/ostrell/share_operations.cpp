#include "platform/ostrell/share_operations.h"

#include <chrono>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/thread_pool.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/cancellable_call.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/daemon_patience.h"
#include "platform/ostrell/daemon_wire.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/share_wire.h"

namespace yomber {
namespace {

using Wire = protocol::Sharing;

NSErrorRef wasCancelled(const std::string& subject) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSUserCancelledError,
      {{NSLocalizedDescriptionKey, "asking about " + subject + " was cancelled"}});
}

NSErrorRef lostWhileAsking(const NSErrorRef& reason, const std::string& subject) {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorConnectionLost,
      {{NSUnderlyingErrorKey, reason},
       {NSLocalizedDescriptionKey,
        "the connection to the daemon was lost while it was asked about " + subject +
            "; ask again"}});
}

NSErrorRef stuckWhileAsking(const NSErrorRef& reason, const std::string& subject) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSXPCConnectionTimedOut,
      {{NSUnderlyingErrorKey, reason},
       {NSLocalizedDescriptionKey, "the daemon has stopped answering while it was asked about " +
                                       subject + "; if it stays so, end it with \"yomber down\""}});
}

NSErrorRef refusalOfLocation(const NSURLRef& url) {
  return url ? nullptr : NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError);
}

NSErrorRef refusalOfShare(const RZShareRef& share) {
  return share ? nullptr : qsc_errorInvalidParameter("share", std::nullopt);
}

std::string subjectOf(const NSURLRef& url) {
  if (!url) return "nothing";
  return "the share of " + (url->isFileURL() ? url->path() : url->absoluteString());
}

std::string subjectOf(const RZShareRef& share) {
  return share ? "the share of \"" + share->title() + "\"" : "nothing";
}

}  // namespace

/// Makes the one call of an operation, over one session.
class QSSharingOperation::Sender {
 public:
  Sender(std::shared_ptr<QSSharingOperation> operation, std::shared_ptr<DaemonLink> link,
         DaemonSessionRef session)
      : operation_(std::move(operation)), link_(std::move(link)), session_(std::move(session)) {}

  /// `decode(results)` makes the outcome.
  template <typename Params, typename Results, typename Fill, typename Decode>
  void send(ipc::RequestMethod<Wire::Client, Params, Results> method, Fill fill, Decode decode) {
    const auto patience =
        daemonPatience(link_, session_, [operation = operation_](const NSErrorRef& error) {
          operation->settle({.error = stuckWhileAsking(error, operation->subject_)});
          operation->call_->cancel();
        });
    auto onReply = [operation = operation_, link = link_, session = session_, patience,
                    decode = std::move(decode)](NSErrorRef failure,
                                                const typename Results::Reader* results) {
      patience->end();
      Outcome outcome;
      if (results != nullptr) failure = whatIsWrongWith([&] { outcome = decode(*results); });
      if (failure) {
        link->noteFailure(session, failure);
        const bool isLost = failure->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted);
        outcome = {.error = isLost ? lostWhileAsking(failure, operation->subject_) : failure};
      }
      operation->settle(outcome);
    };
    operation_->call_->keep(ipc::call(
        session_->sharing(), method,
        [fill = std::move(fill), patience](typename Params::Builder params) {
          fill(params);
          patience->begin();
        },
        std::move(onReply), ipc::CallOptions{std::chrono::milliseconds(0)}));
  }

 private:
  const std::shared_ptr<QSSharingOperation> operation_;
  const std::shared_ptr<DaemonLink> link_;
  const DaemonSessionRef session_;
};

// ---- QSSharingOperation ------------------------------------------------------------------------

QSSharingOperation::QSSharingOperation(std::string subject, NSErrorRef refusal)
    : subject_(std::move(subject)),
      refusal_(std::move(refusal)),
      call_(std::make_unique<CancellableCall>()) {}

QSSharingOperation::~QSSharingOperation() = default;

std::shared_ptr<QSSharingOperation> QSSharingOperation::self() {
  return std::static_pointer_cast<QSSharingOperation>(shared_from_this());
}

void QSSharingOperation::setCompletion(std::function<void(const Outcome&)> completion) {
  LockGuard guard(mutex_);
  std::swap(completion_, completion);
}

void QSSharingOperation::cancel() {
  NSOperation::cancel();
  call_->cancel();
  settle({.error = wasCancelled(subject_)});
}

void QSSharingOperation::main() {
  if (refusal_) {
    settle({.error = refusal_});
    return;
  }
  const auto link = DaemonLink::current();
  link->withSession(
      [self = self(), link](const DaemonSessionRef& session, const NSErrorRef& noSession) {
        if (!session) {
          self->settle({.error = noSession});
        } else if (!self->call_->isCancelled()) {
          Sender sender(self, link, session);
          self->ask(sender);
        }
      });
}

void QSSharingOperation::settle(const Outcome& outcome) {
  std::function<void(const Outcome&)> completion;
  {
    LockGuard guard(mutex_);
    if (std::exchange(isSettled_, true)) return;
    completion = std::exchange(completion_, nullptr);
  }
  // Not on this thread: it may be the loop's, or hold whatever a canceller holds.
  ThreadPool::shared().async([self = self(), completion = std::move(completion), outcome] {
    if (completion) completion(outcome);
    self->finish();
  });
}

// ---- QSShareCopyOperation ----------------------------------------------------------------------

QSShareCopyOperation::QSShareCopyOperation(const NSURLRef& url)
    : QSSharingOperation(subjectOf(url), refusalOfLocation(url)), url_(url) {}

std::shared_ptr<QSShareCopyOperation> QSShareCopyOperation::initWithURL(const NSURLRef& url) {
  return std::shared_ptr<QSShareCopyOperation>(new QSShareCopyOperation(url));
}

void QSShareCopyOperation::setRootShareCopyCompletionBlock(
    std::function<void(RZShareRef, NSURLRef, NSErrorRef)> completion) {
  setCompletion([completion = std::move(completion)](const Outcome& outcome) {
    if (completion) completion(outcome.share, outcome.url, outcome.error);
  });
}

void QSShareCopyOperation::ask(Sender& sender) {
  sender.send(
      &Wire::Client::copyShareRequest,
      [path = url_->path()](Wire::CopyShareParams::Builder params) {
        params.setPath(wireData(path));
      },
      [](const Wire::CopyShareResults::Reader& results) {
        Outcome outcome;
        outcome.share = decodeShareResult(results.getResult(), &outcome.error);
        const auto root = results.getRootPath();
        if (outcome.share && root.isValue()) {
          outcome.url = NSURL::fileURLWithPath(stringFromWire(root.getValue()));
          if (!outcome.url) outcome = {.error = unintelligibleReply("a location")};
        }
        return outcome;
      });
}

// ---- QSShareCopyShareURLOperation --------------------------------------------------------------

QSShareCopyShareURLOperation::QSShareCopyShareURLOperation(
    const NSURLRef& url, const std::optional<std::string>& documentType)
    : QSSharingOperation(subjectOf(url), refusalOfLocation(url)),
      url_(url),
      documentType_(documentType.value_or("")) {}

std::shared_ptr<QSShareCopyShareURLOperation> QSShareCopyShareURLOperation::initWithFileURL(
    const NSURLRef& url, const std::optional<std::string>& documentType) {
  return std::shared_ptr<QSShareCopyShareURLOperation>(
      new QSShareCopyShareURLOperation(url, documentType));
}

void QSShareCopyShareURLOperation::setCopyShareURLCompletionBlock(
    std::function<void(NSURLRef, NSErrorRef)> completion) {
  setCompletion([completion = std::move(completion)](const Outcome& outcome) {
    if (completion) completion(outcome.url, outcome.error);
  });
}

void QSShareCopyShareURLOperation::ask(Sender& sender) {
  sender.send(
      &Wire::Client::copyShareURLRequest,
      [path = url_->path(), type = documentType_](Wire::CopyShareURLParams::Builder params) {
        params.setPath(wireData(path));
        params.setDocumentType(wireText(type));
      },
      [](const Wire::CopyShareURLResults::Reader& results) {
        Outcome outcome{.error = ipc::decodeOptional(results.getFailure())};
        if (outcome.error) return outcome;
        const auto url = results.getUrl();
        if (url.isValue()) outcome.url = NSURL::URLWithString(stringFromWire(url.getValue()));
        if (!outcome.url) outcome.error = unintelligibleReply("a link");
        return outcome;
      });
}

// ---- QSShareSaveOperation ----------------------------------------------------------------------

QSShareSaveOperation::QSShareSaveOperation(const RZShareRef& share)
    : QSSharingOperation(subjectOf(share), refusalOfShare(share)), share_(share) {}

std::shared_ptr<QSShareSaveOperation> QSShareSaveOperation::initWithShare(const RZShareRef& share) {
  return std::shared_ptr<QSShareSaveOperation>(new QSShareSaveOperation(share));
}

void QSShareSaveOperation::setShareSaveCompletionBlock(
    std::function<void(RZShareRef, NSErrorRef)> completion) {
  setCompletion([completion = std::move(completion)](const Outcome& outcome) {
    if (completion) completion(outcome.share, outcome.error);
  });
}

void QSShareSaveOperation::ask(Sender& sender) {
  sender.send(
      &Wire::Client::saveShareRequest,
      [share = share_](Wire::SaveShareParams::Builder params) {
        encodeShare(*share, params.initShare());
      },
      [](const Wire::SaveShareResults::Reader& results) {
        Outcome outcome;
        outcome.share = decodeShareResult(results.getResult(), &outcome.error);
        return outcome;
      });
}

// ---- QSShareDestroyOperation -------------------------------------------------------------------

QSShareDestroyOperation::QSShareDestroyOperation(const RZShareRef& share)
    : QSSharingOperation(subjectOf(share), refusalOfShare(share)), share_(share) {}

std::shared_ptr<QSShareDestroyOperation> QSShareDestroyOperation::initWithShare(
    const RZShareRef& share) {
  return std::shared_ptr<QSShareDestroyOperation>(new QSShareDestroyOperation(share));
}

void QSShareDestroyOperation::setShareDestroyCompletionBlock(
    std::function<void(NSErrorRef)> completion) {
  setCompletion([completion = std::move(completion)](const Outcome& outcome) {
    if (completion) completion(outcome.error);
  });
}

void QSShareDestroyOperation::ask(Sender& sender) {
  sender.send(
      &Wire::Client::destroyShareRequest,
      [share = share_](Wire::DestroyShareParams::Builder params) {
        encodeShare(*share, params.initShare());
      },
      [](const Wire::DestroyShareResults::Reader& results) {
        return Outcome{.error = ipc::decodeOptional(results.getFailure())};
      });
}

// ---- QSSharingCopyShareTokenOperation ----------------------------------------------------------

QSSharingCopyShareTokenOperation::QSSharingCopyShareTokenOperation(const NSURLRef& url)
    : QSSharingOperation(subjectOf(url), refusalOfLocation(url)), url_(url) {}

std::shared_ptr<QSSharingCopyShareTokenOperation> QSSharingCopyShareTokenOperation::initWithURL(
    const NSURLRef& url) {
  return std::shared_ptr<QSSharingCopyShareTokenOperation>(
      new QSSharingCopyShareTokenOperation(url));
}

void QSSharingCopyShareTokenOperation::setShareAndBaseTokenCompletionBlock(
    std::function<void(const std::optional<std::string>&, const std::optional<std::string>&,
                       NSErrorRef)>
        completion) {
  setCompletion([completion = std::move(completion)](const Outcome& outcome) {
    if (completion) completion(outcome.first, outcome.second, outcome.error);
  });
}

void QSSharingCopyShareTokenOperation::ask(Sender& sender) {
  sender.send(
      &Wire::Client::copyShareTokenRequest,
      [path = url_->path()](Wire::CopyShareTokenParams::Builder params) {
        params.setPath(wireData(path));
      },
      [](const Wire::CopyShareTokenResults::Reader& results) {
        Outcome outcome{.error = ipc::decodeOptional(results.getFailure())};
        if (outcome.error) return outcome;
        outcome.first = stringFromWire(results.getShareToken());
        outcome.second = stringFromWire(results.getBaseToken());
        return outcome;
      });
}

// ---- QSShareAcceptOperation --------------------------------------------------------------------

QSShareAcceptOperation::QSShareAcceptOperation(const NSURLRef& shareURL)
    : QSSharingOperation(subjectOf(shareURL), refusalOfLocation(shareURL)), url_(shareURL) {}

std::shared_ptr<QSShareAcceptOperation> QSShareAcceptOperation::initWithShareURL(
    const NSURLRef& shareURL) {
  return std::shared_ptr<QSShareAcceptOperation>(new QSShareAcceptOperation(shareURL));
}

void QSShareAcceptOperation::setShareAcceptCompletionBlock(
    std::function<void(const std::optional<std::string>&, NSErrorRef)> completion) {
  setCompletion([completion = std::move(completion)](const Outcome& outcome) {
    if (completion) completion(outcome.first, outcome.error);
  });
}

void QSShareAcceptOperation::ask(Sender& sender) {
  sender.send(
      &Wire::Client::acceptShareRequest,
      [url = url_->absoluteString()](Wire::AcceptShareParams::Builder params) {
        params.setUrl(wireText(url));
      },
      [](const Wire::AcceptShareResults::Reader& results) {
        Outcome outcome{.error = ipc::decodeOptional(results.getFailure())};
        if (outcome.error) return outcome;
        outcome.first = stringFromWire(results.getIdentifier());
        if (outcome.first->empty()) outcome = {.error = unintelligibleReply("an identifier")};
        return outcome;
      });
}

// ------------------------------------------------------------------------------------------------

RZShareRef QSSharingCreateShareForItemAtURL(const NSURLRef& url, NSErrorRef* error) {
  if (!url) {
    storeError(error, refusalOfLocation(url));
    return nullptr;
  }
  RZShareRef share;
  NSErrorRef refusal;
  const NSErrorRef failure = DaemonLink::current()->callAndWait(
      &Wire::Client::newShareRequest,
      [&](Wire::NewShareParams::Builder params) { params.setPath(wireData(url->path())); },
      [&](const Wire::NewShareResults::Reader& results) {
        share = decodeShareResult(results.getResult(), &refusal);
      });
  if (failure || refusal) {
    storeError(error, failure ? failure : refusal);
    return nullptr;
  }
  return share;
}

}  // namespace yomber
