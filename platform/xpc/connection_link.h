#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <utility>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/progress.h"
#include "platform/foundation/serial_queue.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/remote.h"
#include "protocols/services.capnp.h"

namespace yomber {

class ServedProgress;

/// So many messages of one client may wait for the exported object.
inline constexpr std::size_t kMaximumWaitingMessages = 10'000;

/// The socket under an NSXPCConnection, and what is under way on it. Not for extensions: this
/// header shows Cap'n Proto types.
///
/// Thread-safety: any thread, unless it is said otherwise.
class ConnectionLink final : public std::enable_shared_from_this<ConnectionLink> {
 public:
  /// Makes what answers the other side's calls. Called on the loop thread, at most once.
  using Serve = std::function<kj::Own<capnp::Capability::Server>()>;
  enum class Socket : std::uint8_t { ToBeProved, Checked };

  ConnectionLink();

  /// Called once on the queue when it has ended; set before `open`.
  void setEndHandler(std::function<void(bool wasInterrupted)> handler);
  /// Begins to speak. At most once, and not after `invalidate`. Without a socket it is invalid.
  void open(ipc::UniqueFd socket, Socket kind, Serve serve);
  /// Says goodbye and ends.
  void invalidate();

  [[nodiscard]] const std::shared_ptr<SerialQueue>& queue() const { return queue_; }
  [[nodiscard]] bool isOver() const { return over_.load(std::memory_order_acquire); }
  [[nodiscard]] bool isOpened() const { return opened_.load(std::memory_order_acquire); }
  /// The other side's object, for calls after `open`.
  template <typename Interface>
  [[nodiscard]] ipc::Remote<Interface> remote() {
    return ipc::Remote<Interface>(
        [self = shared_from_this()] { return self->otherSide().template castAs<Interface>(); });
  }

  /// What a call gets that can no longer be made.
  [[nodiscard]] NSErrorRef endError() const;
  /// What a call gets that failed with the transport. Loop thread only.
  [[nodiscard]] NSErrorRef explain(const NSErrorRef& error) const;

  // The caller's side of progress.

  struct TrackedProgress {
    std::uint64_t call;
    NSProgressRef progress;
  };
  /// A number for a call, and a progress that follows what is told of it.
  [[nodiscard]] TrackedProgress trackProgress();

  // The callee's side.

  /// False when too many messages wait already.
  [[nodiscard]] bool admitMessage();
  /// One that was admitted waits no more.
  void messageLeftQueue() { waitingMessages_.fetch_sub(1); }
  /// Loop thread only.
  [[nodiscard]] std::shared_ptr<ServedProgress> serveProgress(std::uint64_t call);
  /// Loop thread only.
  void forgetServed(std::uint64_t call);
  /// Tells the counts; `done` is called when they were taken, or never will be. Loop thread only.
  void tellProgress(std::uint64_t call, std::int64_t total, std::int64_t completed,
                    std::function<void()> done);

 private:
  /// What is known of a call's counts; guarded by the link's mutex.
  struct Tracked {
    std::weak_ptr<NSProgress> progress;
    std::int64_t total = 0;
    std::int64_t completed = 0;
    bool isDue = false;  ///< on the way to the queue
  };
  enum class End : std::uint8_t { None, Goodbye, Invalidated, Lost };
  class Peer;

  [[nodiscard]] ipc::Connection::Ref connection() const;
  /// Loop thread only.
  [[nodiscard]] capnp::Capability::Client otherSide() const;
  void attach(ipc::Connection::Ref connection);
  /// Loop thread only: the first reason counts.
  bool beginEnd(End end, const NSErrorRef& reason);
  void endOnLoop();
  void didDisconnect(const NSErrorRef& reason);
  void didHearGoodbye();
  void finish();
  void askToCancel(std::uint64_t call);
  void cancelServed(std::uint64_t call);
  /// The counts are set on the queue, where handlers run; those that come meanwhile go along.
  void setProgress(std::uint64_t call, std::int64_t total, std::int64_t completed);
  void showProgress(const std::shared_ptr<Tracked>& tracked);

  const std::shared_ptr<SerialQueue> queue_;
  std::atomic<bool> opened_{false};
  std::atomic<bool> over_{false};
  std::atomic<std::uint64_t> nextCall_{1};
  std::atomic<std::size_t> waitingMessages_{0};

  mutable Mutex mutex_;
  ipc::Connection::Ref connection_ GUARDED_BY(mutex_);
  NSErrorRef endReason_ GUARDED_BY(mutex_);
  std::function<void(bool)> endHandler_ GUARDED_BY(mutex_);
  std::map<std::uint64_t, std::shared_ptr<Tracked>> tracked_ GUARDED_BY(mutex_);

  // Loop thread only.
  End end_ = End::None;
  bool finished_ = false;
  ipc::Remote<protocol::ServicePeer> peer_;
  std::map<std::uint64_t, std::weak_ptr<ServedProgress>> served_;
};

}  // namespace yomber
