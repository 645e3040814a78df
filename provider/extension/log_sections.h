#pragma once

#include <cstdint>
#include <memory>

#include "platform/foundation/error.h"
#include "platform/foundation/serial_queue.h"

namespace yomber {

/// The level of a log section. The id carries it in its parity: even is info, odd is debug.
enum class LogSectionLevel : std::uint8_t { Debug, Info };

/// Hands out the numbers of log sections: unique, increasing, never 0.
///
/// Thread-safety: `allocate` may be called on any thread, but not on the allocator's own queue.
class LogSectionAllocator {
 public:
  LogSectionAllocator();

  /// The process's allocator, made on first use and never freed.
  static LogSectionAllocator& processAllocator();

  [[nodiscard]] std::uint64_t allocate(LogSectionLevel level);
  [[nodiscard]] const SerialQueue& queue() const { return *_queue; }

 private:
  const std::shared_ptr<SerialQueue> _queue;
  std::uint64_t _lastID = 0;  // Touched on _queue only.
};

/// A fresh section id from the process's allocator.
[[nodiscard]] std::uint64_t createLogSection(LogSectionLevel level);
/// Writes the closing line of the section at `id`, at the level of its parity; 0 writes nothing.
void closeLogSection(const std::uint64_t* id);

/// A section that lasts as long as its scope.
class LogSection {
 public:
  explicit LogSection(LogSectionLevel level) : _id(createLogSection(level)) {}
  ~LogSection() { closeLogSection(&_id); }
  LogSection(const LogSection&) = delete;
  LogSection& operator=(const LogSection&) = delete;

  [[nodiscard]] std::uint64_t id() const { return _id; }

 private:
  const std::uint64_t _id;
};

/// Writes the line of a method that reports failure through an error out-parameter. `errorPointer`
/// is what the caller gave; it is only looked at for being there.
void logErrorOutParameter(const char* methodName, const NSErrorRef* errorPointer,
                          const NSErrorRef& error);

}  // namespace yomber
