#pragma once

#include <functional>
#include <memory>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/ipc/deadlines.h"
#include "platform/ostrell/daemon_link.h"

namespace yomber {

/// Waits with a call that may take as long as its work takes, and tells when the daemon is stuck
/// rather than busy: whenever the link's time limit has passed, the daemon has to answer a question
/// that is no work. For this room's sources only.
///
/// Ownership: shared by the closures of the call that it waits with.
/// Thread-safety: `begin` and `end` on the loop thread; made and dropped on any, dropped after
/// `end` or before `begin`.
class DaemonPatience : public std::enable_shared_from_this<DaemonPatience> {
 public:
  /// `onStuck` is called at most once, on the loop thread, with NSXPCConnectionTimedOut.
  DaemonPatience(std::shared_ptr<DaemonLink> link, DaemonSessionRef session,
                 std::function<void(NSErrorRef)> onStuck)
      : link_(std::move(link)), session_(std::move(session)), onStuck_(std::move(onStuck)) {}

  void begin();
  /// To be called when the call has ended, however it did. Lets go of `onStuck`.
  void end();

 private:
  void ask();
  void didAsk(const NSErrorRef& error);

  const std::shared_ptr<DaemonLink> link_;
  const DaemonSessionRef session_;

  // Loop thread only.
  std::function<void(NSErrorRef)> onStuck_;
  bool hasEnded_ = false;
  ipc::Deadlines::Entry deadline_;
};

}  // namespace yomber
