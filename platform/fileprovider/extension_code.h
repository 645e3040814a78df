#pragma once

#include <exception>
#include <utility>

#include "platform/foundation/log.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {

/// Runs extension code on the pool; nothing that it throws leaves it.
template <typename Work>
void runExtensionCode(const char* operation, Work work) {
  ThreadPool::shared().async([operation, work = std::move(work)]() mutable {
    try {
      work();
    } catch (const std::exception& exception) {
      log_fault(defaultLog(), "[CRIT] %s of the extension threw: %s", operation, exception.what());
    }
  });
}

}  // namespace yomber
