#pragma once

#include <string>
#include <utility>

#include "platform/ipc/call.h"
#include "platform/ipc/patience.h"
#include "platform/ipc/remote.h"
#include "platform/ostrell/daemon_question.h"
#include "protocols/control.capnp.h"

namespace yomber {

/// What a host that is not stuck answers at once.
inline ipc::Patience::Question questionForHost(ipc::Remote<protocol::Control> control) {
  return [control = std::move(control)](const ipc::CallOptions& options,
                                        ipc::Patience::Answer answer) {
    using Results = protocol::Control::StatusResults;
    (void)ipc::call(
        control, &protocol::Control::Client::statusRequest, [](auto) {},
        [answer = std::move(answer)](const NSErrorRef& error, const Results::Reader*) {
          answer(error);
        },
        options);
  };
}

inline NSErrorRef stuckDriveError(const NSErrorRef& cause) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSXPCConnectionTimedOut,
      {{NSLocalizedDescriptionKey,
        std::string("The drive does not answer. What was asked for may still be carried out; "
                    "\"yomber down\" and \"yomber up\" start the drive anew.")},
       {NSUnderlyingErrorKey, cause}});
}

/// Makes a call that takes as long as its work takes, and fails with NSXPCConnectionTimedOut when
/// the process that `question` is for answers nothing at all. Not on the loop thread.
template <typename Remote, typename Method, typename Fill, typename Decode>
NSErrorRef callPatiently(const Remote& remote, Method method, Fill&& fill, Decode&& decode,
                         ipc::Patience::Question question) {
  NSErrorRef error = ipc::callAndWaitPatiently(remote, method, std::forward<Fill>(fill),
                                               std::forward<Decode>(decode), daemonTimeLimit(),
                                               std::move(question));
  const bool isStuck = error && error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut);
  return isStuck ? stuckDriveError(error) : error;
}

}  // namespace yomber
