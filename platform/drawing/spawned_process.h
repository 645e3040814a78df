#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

namespace yomber {

/// A program that is run for its work alone: with no signal blocked, apart from the terminal, its
/// streams closed to /dev/null, and nothing of this process's environment but what is given. Killed
/// and reaped when the object goes.
///
/// Thread-safety: one thread at a time.
class SpawnedProcess {
 public:
  SpawnedProcess() = default;
  ~SpawnedProcess();
  SpawnedProcess(const SpawnedProcess&) = delete;
  SpawnedProcess& operator=(const SpawnedProcess&) = delete;

  /// Starts `arguments.front()`, a path. `socket`, when there is one, becomes its descriptor
  /// `asDescriptor`; it gets no other. An errno value, 0 for success. Once.
  [[nodiscard]] int start(std::vector<std::string> arguments, std::vector<std::string> environment,
                          int socket = -1, int asDescriptor = -1);

  /// False once it has ended.
  [[nodiscard]] bool isAlive();
  /// Waits for its end; false when it has not ended by then.
  [[nodiscard]] bool waitFor(std::chrono::milliseconds patience);
  void kill() const;
  /// Waits for its end.
  void reap();
  /// What it ended with; nothing while it has not, or when a signal ended it.
  [[nodiscard]] std::optional<int> exitCode() const { return exitCode_; }

 private:
  void reap(int options);

  pid_t pid_ = 0;  ///< 0: none, or reaped
  std::optional<int> exitCode_;
};

}  // namespace yomber
