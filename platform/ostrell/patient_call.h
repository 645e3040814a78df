#pragma once

#include <memory>
#include <optional>
#include <utility>

#include "platform/ipc/call.h"
#include "platform/ipc/event_loop.h"
#include "platform/ipc/gate.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/daemon_patience.h"
#include "platform/ostrell/daemon_wire.h"

namespace yomber {

// Calls that take as long as their work takes, however long, but end with NSXPCConnectionTimedOut
// when the daemon is stuck (see ipc::Patience). For this room's sources only.

/// Calls `method` with parameters from `fill`. Then calls, once and on the loop thread, either
/// `take(results)` or, where that fails too, `fail(error)`. The daemon may go on with the work of a
/// call that has failed.
template <typename Client, typename Params, typename Results, typename Fill, typename Take,
          typename Fail>
void callPatiently(const std::shared_ptr<DaemonLink>& link, const DaemonSessionRef& session,
                   ipc::RequestMethod<Client, Params, Results> method, Fill fill, Take take,
                   Fail fail) {
  const auto isOver = std::make_shared<bool>(false);  // loop thread
  const auto end = [link, session, isOver, fail](NSErrorRef failure) {
    if (std::exchange(*isOver, true)) return;
    link->noteFailure(session, failure);
    fail(failure);
  };
  const auto patience = daemonPatience(link, session, end);
  using Reader = typename Results::Reader;
  auto onReply = [patience, isOver, take, end](NSErrorRef failure, const Reader* results) {
    patience->end();
    if (results != nullptr && !*isOver) failure = whatIsWrongWith([&] { take(*results); });
    if (failure) return end(failure);
    *isOver = true;
  };
  ipc::EventLoop::shared().post([patience] { patience->begin(); });
  (void)ipc::call(session->remote<Client>(), method, std::move(fill), std::move(onReply),
                  {.timeout = std::chrono::milliseconds::zero()});
}

/// The same for a caller who waits, not on the loop thread: `value` is what `decode(results)` made.
/// `fill` and `decode` must not refer to the caller's stack.
template <typename Value, typename Client, typename Params, typename Results, typename Fill,
          typename Decode>
NSErrorRef waitPatiently(const std::shared_ptr<DaemonLink>& link, const DaemonSessionRef& session,
                         ipc::RequestMethod<Client, Params, Results> method, Fill fill,
                         Decode decode, std::optional<Value>& value) {
  ipc::EventLoop::shared().assertElsewhere("waitPatiently");
  struct Outcome {
    ipc::Gate gate;
    NSErrorRef failure;
    std::optional<Value> value;
  };
  const auto outcome = std::make_shared<Outcome>();
  callPatiently(
      link, session, method, std::move(fill),
      [outcome, decode](const typename Results::Reader& results) {
        outcome->value.emplace(decode(results));
        outcome->gate.open();
      },
      [outcome](NSErrorRef failure) {
        outcome->failure = std::move(failure);
        outcome->gate.open();
      });
  outcome->gate.wait();
  value = std::move(outcome->value);
  return outcome->failure;
}

}  // namespace yomber
