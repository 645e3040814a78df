#include "platform/ipc/pending_call.h"

#include <string>

#include "platform/foundation/log.h"
#include "platform/ipc/message_stream.h"

namespace yomber::ipc {

void CallHandle::cancel() const {
  EventLoop::shared().post([call = call_] {
    if (const auto pending = call.lock()) {
      pending->giveUp(NSError::errorWithDomain(
          NSCocoaErrorDomain, NSUserCancelledError,
          {{NSLocalizedDescriptionKey, std::string("The operation was cancelled.")}}));
    }
  });
}

namespace detail {

NSErrorRef currentReplyError() {
  try {
    throw;
  } catch (const NSErrorRef& error) {
    return error;
  } catch (const kj::Exception& exception) {
    return connectionError(exception);
  } catch (const std::exception& exception) {
    return connectionError(NSXPCConnectionReplyInvalid, exception.what());
  } catch (...) {
    return connectionError(NSXPCConnectionReplyInvalid, "An unknown exception was thrown.");
  }
}

NSErrorRef noConnectionError() {
  return connectionError(NSXPCConnectionInvalid, "There is no connection to the peer.");
}

CallHandle PendingCall::start(std::shared_ptr<PendingCall> call) {
  EventLoop& loop = EventLoop::shared();
  CallHandle handle{std::weak_ptr<PendingCall>(call)};
  if (loop.isCurrent()) {
    call->run();
  } else {
    // The only reference goes along, so that the call ends its life over there.
    loop.post([call = std::move(call)] { call->run(); });
  }
  return handle;
}

void PendingCall::run() {
  if (settled_) return;
  self_ = shared_from_this();
  try {
    task_ = send(makeRequest()).eagerlyEvaluate(nullptr);
  } catch (...) {
    // A cancellation that is posted already may come first, and end the call.
    EventLoop::shared().post([self = self_, error = currentReplyError()] { self->giveUp(error); });
    return;
  }
  if (options_.timeout.count() > 0) {
    EventLoop::shared().deadlines().set(deadline_, options_.timeout, [this] {
      giveUp(connectionError(
          NSXPCConnectionTimedOut,
          "The peer did not answer within " + std::to_string(options_.timeout.count()) + " ms."));
    });
  }
}

kj::Promise<void> PendingCall::send(AnyRequest request) {
  return request->send().then(
      [this](capnp::Response<capnp::AnyPointer>&& response) {
        response_ = kj::mv(response);
        finish(nullptr);
      },
      [this](kj::Exception&& exception) { finish(connectionError(exception)); });
}

void PendingCall::finish(NSErrorRef error) {
  if (!settle(std::move(error))) return;
  // The task is what runs now, so it must not go yet; and the results' goodbye can wait for
  // company.
  EventLoop::shared().retire(std::exchange(self_, nullptr));
}

void PendingCall::giveUp(NSErrorRef error) {
  const auto keptUntilReturn = std::move(self_);
  task_ = nullptr;
  settle(std::move(error));
}

bool PendingCall::settle(NSErrorRef error) {
  if (std::exchange(settled_, true)) return false;
  deadline_.clear();
  const AnyResults* results = nullptr;
  KJ_IF_MAYBE (response, response_) {
    if (!error) results = response;
  }
  KJ_IF_MAYBE (exception, kj::runCatchingExceptions([&] { reply(std::move(error), results); })) {
    log_error(defaultLog(), "A reply handler failed: %s", exception->getDescription().cStr());
  }
  release();
  return true;
}

void PendingCall::checkSize(capnp::MessageSize size) {
  if (size.wordCount <= kMaximumPayloadWords) return;
  throw connectionError(NSXPCConnectionReplyInvalid,
                        "The request of " + std::to_string(size.wordCount * 8) +
                            " bytes is larger than the limit of " +
                            std::to_string(kMaximumPayloadWords * 8) + " bytes; send it in parts.");
}

}  // namespace detail
}  // namespace yomber::ipc
