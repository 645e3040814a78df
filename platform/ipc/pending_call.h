#pragma once

#include <capnp/capability.h>

#include <chrono>
#include <exception>
#include <memory>
#include <optional>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/ipc/deadlines.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/event_loop.h"
#include "platform/ipc/remote.h"

namespace yomber::ipc {

struct CallOptions {
  /// How long the peer may take; zero: for ever.
  std::chrono::milliseconds timeout{60'000};
};

namespace detail {
class PendingCall;
/// What the exception that is being handled says about a reply or a request.
NSErrorRef currentReplyError();
/// What a call on nil gets.
NSErrorRef noConnectionError();
}  // namespace detail

/// Names a call that was made, so that it can be given up. Copies name the same call; keeping one
/// keeps nothing else.
///
/// Thread-safety: distinct copies on any threads.
class CallHandle {
 public:
  CallHandle() = default;
  /// Gives the call up: unless it was answered before, the peer is told, and `onReply` gets
  /// NSUserCancelledError. Nothing happens for a call that is over.
  void cancel() const;

 private:
  friend class detail::PendingCall;
  explicit CallHandle(std::weak_ptr<detail::PendingCall> call) : call_(std::move(call)) {}
  std::weak_ptr<detail::PendingCall> call_;
};

namespace detail {

/// A call on its way. Loop thread only once started; it keeps itself alive until it is over.
class PendingCall : public std::enable_shared_from_this<PendingCall> {
 public:
  static CallHandle start(std::shared_ptr<PendingCall> call);
  /// Ends the call with `error` unless it is over.
  void giveUp(NSErrorRef error);

  PendingCall(const PendingCall&) = delete;
  PendingCall& operator=(const PendingCall&) = delete;
  virtual ~PendingCall() = default;

 protected:
  explicit PendingCall(CallOptions options) : options_(options) {}
  using AnyRequest = kj::Own<capnp::RequestHook>;
  using AnyResults = capnp::AnyPointer::Reader;
  /// The request, filled in. May throw.
  virtual AnyRequest makeRequest() = 0;
  /// Calls the reply handler with `error`, or with the results.
  virtual void reply(NSErrorRef error, const AnyResults* results) = 0;
  /// Lets go of the handlers and the remote.
  virtual void release() = 0;

  static void checkSize(capnp::MessageSize size);

 private:
  void run();
  kj::Promise<void> send(AnyRequest request);
  /// The reply or the failure came.
  void finish(NSErrorRef error);
  /// False when the call is over already.
  bool settle(NSErrorRef error);

  const CallOptions options_;
  bool settled_ = false;
  Deadlines::Entry deadline_;
  std::shared_ptr<PendingCall> self_;
  kj::Maybe<capnp::Response<capnp::AnyPointer>> response_;
  kj::Maybe<kj::Promise<void>> task_;
};

/// The typed half of a call: as little as can be, since every call in the program has its own.
template <typename Interface, typename Client, typename Params, typename Results, typename Fill,
          typename OnReply>
class MethodCall final : public PendingCall {
 public:
  using Method = capnp::Request<Params, Results> (Client::*)(kj::Maybe<capnp::MessageSize>);

  MethodCall(Remote<Interface> remote, Method method, Fill fill, OnReply onReply,
             CallOptions options)
      : PendingCall(options),
        remote_(std::move(remote)),
        method_(method),
        fill_(std::move(fill)),
        onReply_(std::move(onReply)) {}

 private:
  AnyRequest makeRequest() override {
    if (!remote_) throw noConnectionError();
    typename Interface::Client& client = remote_.client();
    auto request = (client.*method_)(nullptr);
    (*fill_)(static_cast<typename Params::Builder&>(request));
    checkSize(request.totalSize());
    return capnp::RequestHook::from(kj::mv(request));
  }

  void reply(NSErrorRef error, const AnyResults* results) override {
    typename Results::Reader typed;
    if (results != nullptr) typed = results->template getAs<Results>();
    const typename Results::Reader* const given = results != nullptr ? &typed : nullptr;
    (*onReply_)(std::move(error), given);
  }

  void release() override {
    fill_.reset();
    onReply_.reset();
    remote_ = nullptr;
  }

  Remote<Interface> remote_;
  Method method_;
  std::optional<Fill> fill_;
  std::optional<OnReply> onReply_;
};

}  // namespace detail
}  // namespace yomber::ipc
