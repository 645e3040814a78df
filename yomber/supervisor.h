#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include <sys/types.h>

#include "platform/foundation/error.h"

namespace yomber {

/// One program that a drive needs running.
struct SupervisedProgram {
  std::string name;
  std::vector<std::string> arguments;  ///< the first is the executable's path
  bool mayEnd = false;  ///< when it ends with success, all are ended rather than it started again
};

/// Keeps a drive's programs running: starts them, starts again whichever ends, and ends them all
/// when it is told to end. The programs are tied to it: should it be killed, they end too, so that
/// nothing of a drive is ever left without a keeper.
///
/// A process of its own, whose signals it takes over: threads may be started only after `takeLock`,
/// which blocks them, so that no thread takes a signal from `run`.
class Supervisor {
 public:
  /// `lockPath` names the file whose record lock says that a drive is up, and whose pid it is.
  Supervisor(std::string lockPath, std::vector<SupervisedProgram> programs);

  /// Takes the lock; fails with EWOULDBLOCK when another supervisor holds it.
  [[nodiscard]] NSErrorRef takeLock();
  /// Returns after SIGTERM or SIGINT, or the end of one that may end, when every program has ended.
  /// REQUIRES: `takeLock` succeeded in this very process (record locks are not inherited).
  void run();

  /// The pid of the supervisor that holds the lock.
  [[nodiscard]] static std::optional<pid_t> runningPid(const std::string& lockPath);

 private:
  struct Child {
    SupervisedProgram program;
    pid_t pid = 0;
    std::chrono::steady_clock::time_point startedAt;
    std::chrono::steady_clock::time_point startAgainAt;
    std::chrono::milliseconds backOff{0};
  };

  void startDue();
  void reap();
  void endAll();
  [[nodiscard]] int millisecondsUntilNextStart() const;
  static void start(Child& child);
  static void scheduleRestart(Child& child, int status);

  const std::string lockPath_;
  std::vector<Child> children_;
  int lockDescriptor_ = -1;
  bool isEnding_ = false;
};

}  // namespace yomber
