#include "platform/foundation/log.h"

#include <cstdio>

#include "platform/foundation/atomic_cell.h"

namespace yomber {

struct Log::State {
  AtomicCell<std::shared_ptr<Sink>> sink;
};

Log::Log() : state_(std::make_unique<State>()) {}

Log::~Log() = default;

void Log::write(LogLevel level, std::string_view line) {
  if (const auto sink = state_->sink.load()) {
    sink->write(level, line);
  } else if (level >= LogLevel::Error) {
    std::fprintf(stderr, "%.*s\n", static_cast<int>(line.size()), line.data());
  }
}

void Log::setSink(std::shared_ptr<Sink> sink) { state_->sink.store(std::move(sink)); }

void Log::setLevel(LogLevel level) {
  ownLevel_.store(static_cast<std::uint8_t>(level), std::memory_order_relaxed);
}

void Log::attachLevel(const std::atomic<std::uint8_t>* level) {
  level_.store(level != nullptr ? level : &ownLevel_, std::memory_order_relaxed);
}

Log& defaultLog() {
  static Log& log = *new Log;  // never destroyed: other threads may log until the very end
  return log;
}

}  // namespace yomber
