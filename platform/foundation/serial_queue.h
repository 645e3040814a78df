#pragma once

#include <functional>
#include <memory>
#include <string>
#include <utility>

namespace yomber {

/// A queue whose item a thread is running; the thread keeps a list of them, the innermost first.
struct SerialQueueFrame {
  const void* queue;
  const SerialQueueFrame* outer;
};

/// Runs work items one at a time, in the order they were submitted.
///
/// Small and fair: threads come from one process-wide pool that grows while items block; an idle
/// queue holds no thread. Items that were submitted are always run, also when the last reference to
/// the queue is dropped meanwhile.
///
/// Thread-safety: every operation may be called on any thread.
/// Ownership: `std::shared_ptr`; made with `create`.
class SerialQueue {
 public:
  static std::shared_ptr<SerialQueue> create(std::string label);
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  /// Runs `work` later, never before returning on the caller's own stack.
  void async(std::function<void()> work);
  /// Runs `work` after all that was submitted before and returns when it is done; runs it on the
  /// caller's thread when the queue is idle. REQUIRES: not called on this queue (it would never
  /// return; asserts).
  template <typename Work>
  void sync(Work&& work) {
    const Turn turn(*state_);
    std::forward<Work>(work)();
  }

  /// Whether the calling thread is running an item of this queue.
  [[nodiscard]] bool isCurrent() const;
  /// Aborts with a message when not on this queue.
  void assertOnQueue() const;
  [[nodiscard]] const std::string& label() const;

 private:
  struct State;
  /// The calling thread's turn, from when all that was submitted before is done.
  class Turn {
   public:
    explicit Turn(State& state);
    ~Turn();
    Turn(const Turn&) = delete;
    Turn& operator=(const Turn&) = delete;

   private:
    State& state_;
    const SerialQueueFrame frame_;
  };

  explicit SerialQueue(std::string label);
  std::shared_ptr<State> state_;
};

}  // namespace yomber
