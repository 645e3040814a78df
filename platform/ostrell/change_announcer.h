#pragma once

#include <atomic>
#include <memory>

#include "platform/foundation/serial_queue.h"

namespace yomber {

/// Posts the library's notifications, on a queue that nobody else waits for: their handlers wait
/// for queues of their own, and may ask the daemon.
///
/// Announcements that come while one of the same kind has not begun are one.
/// Thread-safety: every operation may be called on any thread; none blocks.
class ChangeAnnouncer : public std::enable_shared_from_this<ChangeAnnouncer> {
 public:
  ChangeAnnouncer();

  void accountDidChange();
  void containersDidChange();
  /// Posts nothing that has not begun yet.
  void stop() { isStopped_ = true; }

 private:
  const std::shared_ptr<SerialQueue> queue_;
  std::atomic<bool> isStopped_ = false;
  std::atomic<bool> isAccountPending_ = false;
  std::atomic<bool> areContainersPending_ = false;
};

}  // namespace yomber
