#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/error.h"
#include "platform/foundation/log.h"

namespace yomber {

/// "debug", "info", "default", "error", "fault".
[[nodiscard]] std::string_view logLevelName(LogLevel level);
[[nodiscard]] std::optional<LogLevel> logLevelNamed(std::string_view name);

/// The level that all processes of a drive share: a small file that each of them maps.
///
/// The file is made when it is missing, and replaced when it is not one of these files or not only
/// this user's. It has to stay below a directory that nobody else may write.
/// Thread-safety: every operation may be called on any thread, and in any number of processes.
class LogLevelPage {
 public:
  /// Nil and an error when the file can be neither opened nor made.
  static std::unique_ptr<LogLevelPage> open(const std::string& path, NSErrorRef* error = nullptr);
  ~LogLevelPage();
  LogLevelPage(const LogLevelPage&) = delete;
  LogLevelPage& operator=(const LogLevelPage&) = delete;

  [[nodiscard]] LogLevel level() const;
  /// Takes effect in every process at once.
  void setLevel(LogLevel level);
  /// What `Log::attachLevel` takes; valid while the page is.
  [[nodiscard]] const std::atomic<std::uint8_t>* cell() const;

 private:
  struct Layout;
  explicit LogLevelPage(Layout* layout) : layout_(layout) {}
  Layout* const layout_;
};

/// Switches the level of every process of the drive, and of those that start later in this session
/// of the user. Fails when there is no drive at the home.
[[nodiscard]] NSErrorRef setSharedLogLevel(const DrivePaths& paths, LogLevel level);

}  // namespace yomber
