#pragma once

#include <algorithm>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/foundation/log.h"

namespace yomber::ipc::test {

/// Keeps the error lines of the default log while it lives.
///
/// Thread-safety: every operation may be called on any thread.
class ErrorLines {
 public:
  ErrorLines() { defaultLog().setSink(sink_); }
  ~ErrorLines() { defaultLog().setSink(nullptr); }
  ErrorLines(const ErrorLines&) = delete;
  ErrorLines& operator=(const ErrorLines&) = delete;

  /// Whether one of them contains `part`.
  [[nodiscard]] bool has(const std::string& part) const {
    LockGuard guard(sink_->mutex);
    return std::ranges::any_of(sink_->lines, [&](const auto& line) { return line.contains(part); });
  }

 private:
  struct Sink final : Log::Sink {
    void write(LogLevel level, std::string_view line) override {
      if (level != LogLevel::Error) return;
      LockGuard guard(mutex);
      lines.emplace_back(line);
    }
    Mutex mutex;
    std::vector<std::string> lines GUARDED_BY(mutex);
  };
  const std::shared_ptr<Sink> sink_ = std::make_shared<Sink>();
};

}  // namespace yomber::ipc::test
