#pragma once

#include <exception>
#include <utility>

#include "platform/foundation/log.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {

/// Runs extension code on `executor`, the pool or a serial queue; nothing that it throws leaves it.
template <typename Executor, typename Work>
void runExtensionCodeOn(Executor& executor, const char* operation, Work work) {
  executor.async([operation, work = std::move(work)]() mutable {
    try {
      work();
    } catch (const std::exception& exception) {
      log_fault(defaultLog(), "[CRIT] %s of the extension threw: %s", operation, exception.what());
    }
  });
}

/// The same on the pool.
template <typename Work>
void runExtensionCode(const char* operation, Work work) {
  runExtensionCodeOn(ThreadPool::shared(), operation, std::move(work));
}

}  // namespace yomber
