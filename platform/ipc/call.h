#pragma once

#include <capnp/capability.h>

#include <chrono>
#include <memory>
#include <type_traits>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/ipc/event_loop.h"
#include "platform/ipc/pending_call.h"
#include "platform/ipc/remote.h"

namespace yomber::ipc {

// Calls on remote objects, from any thread.
//
//   call(listing, &Listing::Client::pageRequest,
//        [=](Listing::PageParams::Builder params) { params.setLimit(200); },
//        [=](NSErrorRef error, const Listing::PageResults::Reader* results) { … });
//
// The closures run on the loop thread and must not block: `onReply` decodes and hands over. Errors
// that it is given are transport failures (error_codec.h); domain failures are part of the results.

/// How a method of a generated client begins a request; written `&Interface::Client::nameRequest`.
template <typename Client, typename Params, typename Results>
using RequestMethod =
    capnp::Request<Params, Results> (Client::*)(kj::Maybe<capnp::MessageSize> sizeHint);

/// Calls `method` of `remote`.
///
/// `fill` writes the parameters. `onReply(transportError, results)` is called exactly once: with
/// nil and the results, which are valid during the call only, or with an error and null. When
/// `call` runs on the loop thread, that is after it has returned. Calls that one thread makes on
/// one remote arrive in order.
template <typename Interface, typename Client, typename Params, typename Results, typename Fill,
          typename OnReply>
CallHandle call(const Remote<Interface>& remote, RequestMethod<Client, Params, Results> method,
                Fill fill, OnReply onReply, CallOptions options = {}) {
  using Call = detail::MethodCall<Interface, Client, Params, Results, Fill, OnReply>;
  return detail::PendingCall::start(
      std::make_shared<Call>(remote, method, std::move(fill), std::move(onReply), options));
}

/// Calls `method` of `remote` and waits for the reply on the calling thread, which must not be the
/// loop thread. `decode(results)` runs on the loop thread while the caller waits, and not at all
/// when an error is answered; both closures may refer to the caller's stack.
template <typename Interface, typename Client, typename Params, typename Results, typename Fill,
          typename Decode>
NSErrorRef callAndWait(const Remote<Interface>& remote,
                       RequestMethod<Client, Params, Results> method, Fill&& fill, Decode&& decode,
                       CallOptions options = {}) {
  EventLoop::shared().assertElsewhere("callAndWait");
  if (!remote) return detail::noConnectionError();
  Gate done;
  NSErrorRef failure;
  using Reader = typename Results::Reader;
  auto onReply = [&](NSErrorRef error, const Reader* results) {
    if (results != nullptr) {
      try {
        decode(*results);
      } catch (...) {
        error = detail::currentReplyError();
      }
    }
    failure = std::move(error);
    done.open();
  };
  (void)call(
      remote, method, [&fill](typename Params::Builder params) { fill(params); },
      std::move(onReply), options);
  done.wait();
  return failure;
}

}  // namespace yomber::ipc
