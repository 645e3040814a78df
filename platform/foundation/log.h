#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <type_traits>

#include "platform/foundation/log_format.h"

namespace yomber {

/// Levels, the least important first. A log writes a line whose level is at or above its own.
enum class LogLevel : std::uint8_t { Debug = 0, Info = 1, Default = 2, Error = 3, Fault = 4 };

/// A named log of this process.
///
/// Its level is read with one relaxed atomic load, so a disabled line costs no more than that. The
/// level lives in a page that all processes of a drive share (see log_level.h), so that one of them
/// can switch it for all at run time.
/// Thread-safety: every operation may be called on any thread.
class Log {
 public:
  /// Where finished lines go. Called on the logging thread; must be thread-safe.
  class Sink {
   public:
    virtual ~Sink() = default;
    virtual void write(LogLevel level, std::string_view line) = 0;
  };

  Log();
  ~Log();
  Log(const Log&) = delete;
  Log& operator=(const Log&) = delete;

  [[nodiscard]] bool isEnabled(LogLevel level) const {
    const auto* const current = level_.load(std::memory_order_relaxed);
    return static_cast<std::uint8_t>(level) >= current->load(std::memory_order_relaxed);
  }
  /// Hands `line` to the sink, whatever the level is. Without a sink, errors and faults go to
  /// standard error.
  void write(LogLevel level, std::string_view line);

  /// Replaces the sink; tests use it to collect lines. Null takes it away.
  void setSink(std::shared_ptr<Sink> sink);
  /// Sets this process's own level, which counts while no shared level is attached.
  void setLevel(LogLevel level);
  /// From now on reads the level from `level`, which must outlive the log; null goes back to the
  /// process's own.
  void attachLevel(const std::atomic<std::uint8_t>* level);

 private:
  struct State;
  std::atomic<std::uint8_t> ownLevel_{static_cast<std::uint8_t>(LogLevel::Info)};
  std::atomic<const std::atomic<std::uint8_t>*> level_{&ownLevel_};
  std::unique_ptr<State> state_;
};

/// The process's default log; lives until the process ends.
Log& defaultLog();

// One function a level. `format` is a literal in the printf manner with `%@` for anything that has
// a `description`; it is checked against the arguments at compile time and formatted only when the
// level is on.
//
//   log_debug(qsc_default_log(), "[DEBUG] ┏%llx asked url for %@", section, identifier);

template <typename... Args>
void log_debug(Log& log, LogFormat<std::type_identity_t<Args>...> format, const Args&... args) {
  if (log.isEnabled(LogLevel::Debug)) log.write(LogLevel::Debug, format.render(args...));
}
template <typename... Args>
void log_info(Log& log, LogFormat<std::type_identity_t<Args>...> format, const Args&... args) {
  if (log.isEnabled(LogLevel::Info)) log.write(LogLevel::Info, format.render(args...));
}
template <typename... Args>
void log_default(Log& log, LogFormat<std::type_identity_t<Args>...> format, const Args&... args) {
  if (log.isEnabled(LogLevel::Default)) log.write(LogLevel::Default, format.render(args...));
}
template <typename... Args>
void log_error(Log& log, LogFormat<std::type_identity_t<Args>...> format, const Args&... args) {
  if (log.isEnabled(LogLevel::Error)) log.write(LogLevel::Error, format.render(args...));
}
template <typename... Args>
void log_fault(Log& log, LogFormat<std::type_identity_t<Args>...> format, const Args&... args) {
  if (log.isEnabled(LogLevel::Fault)) log.write(LogLevel::Fault, format.render(args...));
}

}  // namespace yomber
