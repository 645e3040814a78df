#include "provider/extension/log_sections.h"

#include "platform/foundation/log.h"
#include "platform/ostrell/errors.h"

namespace yomber {
namespace {

constexpr std::uint64_t kLowBit = 1;

bool isDebugSection(std::uint64_t id) { return (id & kLowBit) != 0; }

}  // namespace

LogSectionAllocator::LogSectionAllocator() : _queue(SerialQueue::create("create-log-section")) {}

LogSectionAllocator& LogSectionAllocator::processAllocator() {
  static auto* const allocator = new LogSectionAllocator;
  return *allocator;
}

std::uint64_t LogSectionAllocator::allocate(LogSectionLevel level) {
  struct Request {
    LogSectionAllocator& allocator;
    const bool wantsDebug;
    std::uint64_t id = 0;
  } request{.allocator = *this, .wantsDebug = level == LogSectionLevel::Debug};

  // One captured reference, so that the work item needs no memory of its own.
  _queue->sync([&request] {
    std::uint64_t candidate = request.allocator._lastID + 1;
    if (isDebugSection(candidate) != request.wantsDebug) ++candidate;
    request.allocator._lastID = candidate;
    request.id = candidate;
  });
  return request.id;
}

std::uint64_t createLogSection(LogSectionLevel level) {
  return LogSectionAllocator::processAllocator().allocate(level);
}

void closeLogSection(const std::uint64_t* id) {
  if (*id == 0) return;
  Log& log = qsc_default_log();
  // The trailing blanks belong to the texts.
  if (isDebugSection(*id)) {
    log_debug(log, "[DEBUG] ┗%llx ", *id);
  } else {
    log_info(log, "[INFO] ┗%llx ", *id);
  }
}

void logErrorOutParameter(const char* methodName, const NSErrorRef* errorPointer,
                          const NSErrorRef& error) {
  const char* const fate = errorPointer != nullptr ? "(passed to caller)" : "(ignored by caller)";
  log_error(qsc_default_log(), "[ERROR] %s: %s error: %@", methodName, fate, error);
}

}  // namespace yomber
