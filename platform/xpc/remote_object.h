#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/foundation/progress.h"
#include "platform/ipc/call.h"
#include "platform/xpc/connection.h"
#include "platform/xpc/connection_link.h"

namespace yomber {

/// The other side's object as the proxies of its protocol use it. Not for extensions: this header
/// shows Cap'n Proto types.
///
/// For each call, `decode(results)` runs on the loop thread and answers what then runs on the
/// connection's queue; or the error handler runs there.
/// Thread-safety: every operation may be called on any thread. Keeps the connection, and so does
/// each call until it has ended.
template <typename Interface>
class RemoteObject {
 public:
  using ErrorHandler = std::function<void(NSErrorRef error)>;

  RemoteObject(NSXPCConnectionRef connection, ErrorHandler errorHandler)
      : connection_(std::move(connection)),
        errorHandler_(std::move(errorHandler)),
        remote_(connection_->link()->template remote<Interface>()) {}

  template <typename Params, typename Results, typename Fill, typename Decode>
  void call(ipc::RequestMethod<typename Interface::Client, Params, Results> method, Fill fill,
            Decode decode) const {
    const auto& link = connection_->link();
    if (link->isOver()) return end(connection_, errorHandler_, link->endError());
    (void)ipc::call(link->isOpened() ? remote_ : nullptr, method, std::move(fill),
                    [connection = connection_, handler = errorHandler_, decode = std::move(decode)](
                        NSErrorRef error, const typename Results::Reader* results) {
                      if (results == nullptr) {
                        return end(connection, handler, connection->link()->explain(error));
                      }
                      std::function<void()> deliver;
                      try {
                        deliver = decode(*results);
                      } catch (...) {
                        return end(connection, handler, ipc::detail::currentReplyError());
                      }
                      connection->link()->queue()->async(
                          [deliver = std::move(deliver), connection] { deliver(); });
                    },
                    {.timeout = std::chrono::milliseconds::zero()});
  }

  /// The same for a method that answers a progress: `fill(params)` leaves out the call's number.
  template <typename Params, typename Results, typename Fill, typename Decode>
  NSProgressRef callWithProgress(
      ipc::RequestMethod<typename Interface::Client, Params, Results> method, Fill fill,
      Decode decode) const {
    auto tracked = connection_->link()->trackProgress();
    call(
        method,
        [number = tracked.call, fill = std::move(fill)](typename Params::Builder params) {
          params.setCall(number);
          fill(params);
        },
        std::move(decode));
    return std::move(tracked.progress);
  }

 private:
  static void end(const NSXPCConnectionRef& connection, const ErrorHandler& handler,
                  NSErrorRef error) {
    if (!handler) return;
    connection->link()->queue()->async(
        [handler, error = std::move(error), connection] { handler(error); });
  }

  const NSXPCConnectionRef connection_;
  const ErrorHandler errorHandler_;
  const ipc::Remote<Interface> remote_;
};

}  // namespace yomber
