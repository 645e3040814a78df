#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/log.h"

namespace yomber {

struct CollectedLine {
  LogLevel level = LogLevel::Debug;
  std::string text;

  friend bool operator==(const CollectedLine&, const CollectedLine&) = default;
};

/// Collects the lines of the default log while it lives, from debug on.
///
/// Thread-safety: every operation may be called on any thread.
class CollectedLog {
 public:
  CollectedLog();
  ~CollectedLog();
  CollectedLog(const CollectedLog&) = delete;
  CollectedLog& operator=(const CollectedLog&) = delete;

  void setLevel(LogLevel level);
  void forget();

  [[nodiscard]] std::vector<CollectedLine> lines() const;
  /// The texts, with the number after a section's glyph replaced by '#'.
  [[nodiscard]] std::vector<std::string> texts() const;
  /// How many lines there are of this level and `texts` form.
  [[nodiscard]] std::size_t count(LogLevel level, std::string_view text) const;
  /// How many lines' texts hold `part`.
  [[nodiscard]] std::size_t countContaining(std::string_view part) const;
  /// The number of the first section that the line of this `texts` form names; 0 without one.
  [[nodiscard]] std::uint64_t sectionOf(std::string_view text) const;
  /// Waits up to ten seconds for `count` lines of that form.
  [[nodiscard]] bool waitFor(LogLevel level, std::string_view text, std::size_t count = 1) const;

 private:
  class Collector;
  std::shared_ptr<Collector> _collector;
};

/// The lines of `texts` that are among `wanted`, in their order.
[[nodiscard]] std::vector<std::string> among(const std::vector<std::string>& texts,
                                             const std::vector<std::string>& wanted);

}  // namespace yomber
