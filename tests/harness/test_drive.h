#pragma once

#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "tests/harness/child_process.h"

namespace yomber::testing {

/// A whole drive of its own: a temporary home, the real processes, the real command line. Taken
/// down and removed when the object goes.
class TestDrive {
 public:
  TestDrive();
  /// In a folder of its own below that one.
  explicit TestDrive(const std::string& parent);
  ~TestDrive();
  TestDrive(const TestDrive&) = delete;
  TestDrive& operator=(const TestDrive&) = delete;

  /// Starts the drive and signs in; ends the test when it does not come up.
  void up() { up({}); }
  /// The same, with `yomber up` as the last words of a command that starts it ("env NAME=VALUE").
  void up(const std::vector<std::string>& command);
  void down();
  /// kill -9 of all its processes at once, as when the machine stops. Returns when they are gone.
  void crash();
  void signIn();
  /// Who signs in; set before `up`.
  void setAccount(const std::string& name) { account_ = name; }
  /// A record store that it has together with other drives; set before `up`.
  void setStore(const std::string& directory) { store_ = directory; }

  [[nodiscard]] const std::string& home() const { return home_; }
  /// The root folder on disk. Exists from the start, so that a test can fill it before `up`.
  [[nodiscard]] const std::string& root() const { return root_; }
  /// Variables for the drive's processes; set before `up`.
  Environment& environment() { return environment_; }

  /// Runs `yomber` with these arguments.
  ProcessResult yomber(const std::vector<std::string>& arguments,
                       std::chrono::milliseconds limit = patience) const;
  /// The lines that `yomber --json …` printed; fails the test when it failed.
  std::vector<nlohmann::json> json(const std::vector<std::string>& arguments) const;
  [[nodiscard]] std::vector<std::string> commandLine(
      const std::vector<std::string>& arguments) const;

  /// The names that `yomber ls` shows of a folder, in its order.
  std::vector<std::string> names(const std::string& folder = "/",
                                 const std::string& sort = "name") const;
  [[nodiscard]] nlohmann::json status() const;

  enum class Process { Zarn, Host, Extension };
  /// Its pid, waiting until it has one.
  pid_t pidOf(Process process) const;
  /// kill -9.
  void kill(Process process) const;

  void write(const std::string& relativePath, const std::string& content = "") const;
  void makeFolder(const std::string& relativePath) const;

 private:
  std::string directory_;
  std::string home_;
  std::string root_;
  Environment environment_;
  std::string account_ = "ada";
  std::string store_;  ///< empty: its own
  bool up_ = false;
  pid_t supervisor_ = -1;
};

/// Where the build put its programs.
[[nodiscard]] std::string programPath(const std::string& name);

}  // namespace yomber::testing
