#pragma once

#include <chrono>
#include <cstddef>
#include <optional>
#include <string>
#include <vector>

#include "tests/harness/child_process.h"

namespace yomber::testing {

/// A program that runs at a terminal of its own, of 24 lines of 100 columns: what it prints to
/// standard output and error is what the terminal gets. Killed when the object goes.
class TerminalProcess {
 public:
  explicit TerminalProcess(const std::vector<std::string>& arguments,
                           const Environment& extra = {});
  ~TerminalProcess();
  TerminalProcess(const TerminalProcess&) = delete;
  TerminalProcess& operator=(const TerminalProcess&) = delete;

  /// Whether the program prints the text, after what an earlier call was told of.
  bool shows(const std::string& text);
  /// Reads on to the end and waits for it; nothing when none comes.
  std::optional<int> waitForEnd();
  /// All that has been printed and read.
  [[nodiscard]] const std::string& printed() const { return printed_; }

 private:
  using Clock = std::chrono::steady_clock;
  /// False at the end, or at the deadline: a view may go on printing for ever.
  bool readMore(Clock::time_point deadline);

  int pid_ = -1;
  int terminal_ = -1;
  std::string printed_;
  std::size_t told_ = 0;  ///< so much of it has been told of
};

}  // namespace yomber::testing
