#include "platform/ostrell/file_providing_operation.h"

#include <chrono>
#include <string>
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
#include "platform/ostrell/reading_options.h"

namespace yomber {
namespace {

using Wire = protocol::Content;

NSErrorRef wasCancelled(const std::string& path) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSUserCancelledError,
      {{NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey, "providing the content of " + path + " was cancelled"}});
}

NSErrorRef lostWhileProviding(const NSErrorRef& reason, const std::string& path) {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorConnectionLost,
      {{NSUnderlyingErrorKey, reason},
       {NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey, "the connection to the daemon was lost while the content of " +
                                       path + " was being provided; ask for it again"}});
}

NSErrorRef stuckWhileProviding(const NSErrorRef& reason, const std::string& path) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSXPCConnectionTimedOut,
      {{NSUnderlyingErrorKey, reason},
       {NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey,
        "the daemon has stopped answering while the content of " + path +
            " was being provided; if it stays so, end it with \"yomber down\""}});
}

}  // namespace

QSFileProvidingOperation::QSFileProvidingOperation(const NSURLRef& url,
                                                   NSFileCoordinatorReadingOptions readingOptions)
    : url_(url), readingOptions_(readingOptions), call_(std::make_unique<CancellableCall>()) {}

QSFileProvidingOperation::~QSFileProvidingOperation() = default;

std::shared_ptr<QSFileProvidingOperation> QSFileProvidingOperation::initWithURL(
    const NSURLRef& url, NSFileCoordinatorReadingOptions readingOptions) {
  return std::shared_ptr<QSFileProvidingOperation>(
      new QSFileProvidingOperation(url, readingOptions));
}

std::shared_ptr<QSFileProvidingOperation> QSFileProvidingOperation::self() {
  return std::static_pointer_cast<QSFileProvidingOperation>(shared_from_this());
}

void QSFileProvidingOperation::setFileProvidingCompletion(
    std::function<void(NSErrorRef)> completion) {
  LockGuard guard(mutex_);
  std::swap(completion_, completion);
}

void QSFileProvidingOperation::setWantsCurrentVersion(bool wantsCurrentVersion) {
  LockGuard guard(mutex_);
  wantsCurrentVersion_ = wantsCurrentVersion;
}

NSFileCoordinatorReadingOptions QSFileProvidingOperation::options() {
  LockGuard guard(mutex_);
  return readingOptions_ | (wantsCurrentVersion_ ? QSFileCoordinatorReadingForcesProviding : 0);
}

void QSFileProvidingOperation::cancel() {
  NSOperation::cancel();
  call_->cancel();
  settle(wasCancelled(url_ ? url_->path() : std::string()));
}

void QSFileProvidingOperation::main() {
  if (!url_) {
    settle(NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError));
    return;
  }
  const auto link = DaemonLink::current();
  link->withSession(
      [self = self(), link](const DaemonSessionRef& session, const NSErrorRef& noSession) {
        if (!session) {
          self->settle(noSession);
        } else if (!self->call_->isCancelled()) {
          self->ask(link, session);
        }
      });
}

void QSFileProvidingOperation::ask(const std::shared_ptr<DaemonLink>& link,
                                   const std::shared_ptr<DaemonSession>& session) {
  const auto patience = daemonPatience(link, session, [self = self()](const NSErrorRef& error) {
    self->settle(stuckWhileProviding(error, self->url_->path()));
    self->call_->cancel();
  });
  using Results = Wire::StartProvidingResults;
  auto onReply = [self = self(), link, session, patience](NSErrorRef failure,
                                                          const Results::Reader* results) {
    patience->end();
    NSErrorRef outcome;
    if (results != nullptr) {
      failure = whatIsWrongWith([&] { outcome = ipc::decodeOptional(results->getFailure()); });
    }
    if (failure) {
      link->noteFailure(session, failure);
      const bool isLost = failure->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted);
      outcome = isLost ? lostWhileProviding(failure, self->url_->path()) : failure;
    }
    self->settle(outcome);
  };
  call_->keep(ipc::call(
      session->content(), &Wire::Client::startProvidingRequest,
      [self = self(), patience](Wire::StartProvidingParams::Builder params) {
        params.setPath(wireData(self->url_->path()));
        params.setOptions(self->options());
        patience->begin();
      },
      std::move(onReply), ipc::CallOptions{std::chrono::milliseconds(0)}));
}

void QSFileProvidingOperation::settle(const NSErrorRef& outcome) {
  std::function<void(NSErrorRef)> completion;
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

}  // namespace yomber
