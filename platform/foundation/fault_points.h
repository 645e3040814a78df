#pragma once

#include <atomic>
#include <string_view>

#include "platform/foundation/error.h"

namespace yomber {

/// A place in the program where a test can command a failure or an interleaving.
///
/// Defined with static storage where it is hit:
///
///   static FaultPoint beforeCommit("zarn.store.before-commit");
///   if (beforeCommit.hit()) return errorOfAFullDisk();
///
/// Points are armed by the environment when the process starts, or by a test in the process itself:
///
///   YOMBER_FAULTS="zarn.store.before-commit=abort,zarn.scan.folder=pause-until-file:/tmp/x/go"
///
/// Actions: `abort` ends the process as a crash would; `error` makes `hit` answer true; with
/// `pause-until-file:PATH` the thread makes PATH.reached and waits until PATH exists; with
/// `pause-first-until-file:PATH` only whoever makes that file waits, and all others pass; with
/// `pause-each-until-file:PATH` a thread takes both files away when it goes on, so that the next
/// time is waited for too (one thread at a time). Commas cannot be part of a path here.
///
/// Costs one relaxed load while nothing is armed.
/// Thread-safety: every operation may be called on any thread.
class FaultPoint {
 public:
  explicit FaultPoint(const char* name);
  ~FaultPoint();
  FaultPoint(const FaultPoint&) = delete;
  FaultPoint& operator=(const FaultPoint&) = delete;

  /// Does what the point was armed for. True: behave as if the operation here had failed.
  [[nodiscard]] bool hit() {
    if (!armed_.load(std::memory_order_relaxed)) [[likely]]
      return false;
    return act();
  }

  /// Arms the points that `faults` names (the form of YOMBER_FAULTS), also those not reached yet.
  /// Malformed text arms nothing and is answered with an error.
  static NSErrorRef arm(std::string_view faults);
  static void disarmAll();

 private:
  friend class FaultPointRegistry;
  bool act();

  const char* const name_;
  std::atomic<bool> armed_{false};
};

}  // namespace yomber
