#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/ipc/call.h"
#include "platform/ipc/deadlines.h"
#include "platform/ipc/remote.h"

namespace yomber::ipc {

/// Waits with a call that may take as long as its work takes, and tells when the peer is stuck
/// rather than busy: whenever the limit has passed, the peer has to answer a question that is no
/// work.
///
/// Ownership: shared by the closures of the call that it waits with.
/// Thread-safety: `begin` and `end` on the loop thread; made and dropped on any, dropped after
/// `end` or before `begin`.
class Patience : public std::enable_shared_from_this<Patience> {
 public:
  using Answer = std::function<void(const NSErrorRef& error)>;
  /// Asks the peer. Calls `answer` once, on the loop thread: with nil, or with the transport's
  /// failure, which is NSXPCConnectionTimedOut after `options.timeout`.
  using Question = std::function<void(const CallOptions& options, Answer answer)>;

  /// `limit` is both the time between two questions and the time for an answer. `onStuck` is called
  /// at most once, on the loop thread, with NSXPCConnectionTimedOut.
  Patience(std::chrono::milliseconds limit, Question question,
           std::function<void(NSErrorRef)> onStuck)
      : limit_(limit), question_(std::move(question)), onStuck_(std::move(onStuck)) {}

  void begin();
  /// To be called when the call has ended, however it did. Lets go of the closures.
  void end();

 private:
  void ask();
  void didAsk(const NSErrorRef& error);

  const std::chrono::milliseconds limit_;

  // Loop thread only.
  Question question_;
  std::function<void(NSErrorRef)> onStuck_;
  bool hasEnded_ = false;
  Deadlines::Entry deadline_;
};

/// As `callAndWait`, for as long as the work takes; but it ends with NSXPCConnectionTimedOut, and
/// the call is given up, when the peer does not answer `question` within `limit`. The peer may go
/// on with the work of a call that has failed.
template <typename Interface, typename Client, typename Params, typename Results, typename Fill,
          typename Decode>
NSErrorRef callAndWaitPatiently(const Remote<Interface>& remote,
                                RequestMethod<Client, Params, Results> method, Fill&& fill,
                                Decode&& decode, std::chrono::milliseconds limit,
                                Patience::Question question) {
  struct Waiting {
    CallHandle call;  // loop thread
    NSErrorRef stuck;
  };
  const auto waiting = std::make_shared<Waiting>();
  const auto patience =
      std::make_shared<Patience>(limit, std::move(question), [waiting](NSErrorRef error) {
        waiting->stuck = std::move(error);
        waiting->call.cancel();
      });
  EventLoop::shared().assertElsewhere("callAndWaitPatiently");
  if (!remote) return detail::noConnectionError();
  Gate done;
  NSErrorRef failure;
  auto onReply = [&](NSErrorRef error, const typename Results::Reader* results) {
    patience->end();
    if (results != nullptr) {
      try {
        decode(*results);
      } catch (...) {
        error = detail::currentReplyError();
      }
    }
    failure = error && waiting->stuck ? waiting->stuck : std::move(error);
    done.open();
  };
  EventLoop::shared().post([&] {
    patience->begin();
    waiting->call = call(remote, method, [&fill](typename Params::Builder params) { fill(params); },
                         std::move(onReply), {.timeout = std::chrono::milliseconds::zero()});
  });
  done.wait();
  return failure;
}

}  // namespace yomber::ipc
