#pragma once

#include <chrono>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include <sys/types.h>

namespace yomber::testing {

/// How long a test waits for something that must come before it says that it did not.
inline constexpr std::chrono::seconds patience{60};

struct ProcessResult {
  int exitCode = -1;      ///< negative: ended by that signal
  bool timedOut = false;  ///< it was killed, since it did not end in time
  std::string output;
  std::string errors;
};

using Environment = std::map<std::string, std::string>;

/// Runs a program to its end and collects what it prints. Killed at the deadline.
ProcessResult runProcess(const std::vector<std::string>& arguments, const Environment& extra = {},
                         std::chrono::milliseconds limit = patience);

/// A program that runs beside the test and prints lines. Killed when the object goes.
class LineProcess {
 public:
  explicit LineProcess(const std::vector<std::string>& arguments, const Environment& extra = {});
  ~LineProcess();
  LineProcess(const LineProcess&) = delete;
  LineProcess& operator=(const LineProcess&) = delete;

  [[nodiscard]] pid_t pid() const { return pid_; }
  /// The next line of standard output; nothing at the deadline or when the program has ended.
  std::optional<std::string> nextLine(std::chrono::steady_clock::time_point deadline);
  /// Reads lines until one for which `wanted` holds; false at the end, or when none has come for
  /// `limit`: however slow the machine, what goes on is waited for.
  bool readUntil(const std::function<bool(const std::string& line)>& wanted,
                 std::chrono::milliseconds limit = patience);
  /// Waits for the end; nothing at the deadline.
  std::optional<int> waitForEnd(std::chrono::milliseconds limit = patience);

 private:
  pid_t pid_ = -1;
  int output_ = -1;
  std::string buffered_;
  bool ended_ = false;
};

/// Calls `holds` again and again until it is true; false at the deadline. For states of other
/// processes, which cannot be waited for otherwise.
bool eventually(const std::function<bool()>& holds, std::chrono::milliseconds limit = patience);

}  // namespace yomber::testing
