#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/object.h"

namespace yomber {

class NSOperation;
using NSOperationRef = std::shared_ptr<NSOperation>;

/// A piece of work that is run once, usually by a queue.
///
/// A subclass overrides `main`. A synchronous operation is finished when `main` returns; an
/// asynchronous one (`isAsynchronous` answers true) when it calls `finish`, from any thread.
/// One that is cancelled before it starts finishes without `main`; one that runs looks at
/// `isCancelled` itself, or overrides `cancel` (and calls the inherited one first).
///
/// Ownership: made by `std::make_shared`; a queue keeps it until it is finished.
/// Thread-safety: every public operation may be called on any thread.
class NSOperation : public NSObject, public std::enable_shared_from_this<NSOperation> {
 public:
  NSOperation();
  ~NSOperation() override;
  NSOperation(const NSOperation&) = delete;
  NSOperation& operator=(const NSOperation&) = delete;

  /// Runs the operation on the calling thread, unless it was started before. A queue calls it;
  /// others only for an operation that is in no queue.
  void start();
  virtual void cancel();
  [[nodiscard]] virtual bool isAsynchronous() const { return false; }

  [[nodiscard]] bool isCancelled() const;
  [[nodiscard]] bool isExecuting() const;
  [[nodiscard]] bool isFinished() const;
  void waitUntilFinished() const;

  /// Called once, when the operation is finished, on the finishing thread. Set before the start.
  void setCompletionBlock(std::function<void()> block);
  /// A queue starts this operation only after `operation` is finished, also when that one was
  /// cancelled. Added before this one goes into a queue; cycles never start.
  void addDependency(const NSOperationRef& operation);
  [[nodiscard]] std::vector<NSOperationRef> dependencies() const;

  [[nodiscard]] std::string description() const override;

 protected:
  virtual void main() {}
  /// Marks an asynchronous operation finished. Further calls do nothing.
  void finish();

 private:
  friend class NSOperationQueue;
  struct State;

  /// Runs `observer` when the operation is finished, at once when it is already.
  void whenFinished(std::function<void()> observer);

  const std::unique_ptr<State> state_;
};

/// Runs operations on the threads of the shared pool, in the order in which they become ready.
///
/// Ownership: operations that were added are run even when the queue object goes.
/// Thread-safety: every operation may be called on any thread.
class NSOperationQueue {
 public:
  /// As many at a time as the pool has threads for.
  static constexpr std::size_t kDefaultMaxConcurrentOperationCount = static_cast<std::size_t>(-1);

  NSOperationQueue();
  ~NSOperationQueue();
  NSOperationQueue(const NSOperationQueue&) = delete;
  NSOperationQueue& operator=(const NSOperationQueue&) = delete;

  /// An operation is added to one queue, once.
  void addOperation(const NSOperationRef& operation);
  void addOperationWithBlock(std::function<void()> block);
  /// The operations that are not finished, in the order of their adding.
  [[nodiscard]] std::vector<NSOperationRef> operations() const;

  void setMaxConcurrentOperationCount(std::size_t count);
  /// A suspended queue starts nothing; what runs goes on.
  void setSuspended(bool suspended);
  [[nodiscard]] bool isSuspended() const;
  void cancelAllOperations();
  /// Not to be called by an operation of this queue.
  void waitUntilAllOperationsAreFinished() const;

 private:
  struct State;
  const std::shared_ptr<State> state_;
};

}  // namespace yomber
