#pragma once

#include <exception>
#include <string>

#include "platform/foundation/error.h"
#include "platform/rozzel/errors.h"

namespace yomber {

/// How failures travel inside the room; `catchingFailures` ends their way.
struct StoreFailure {
  NSErrorRef error;
};

[[noreturn]] void throwFailure(RZErrorCode code, std::string description);
/// A failure of the file system, from errno: a full disk is RZErrorStoreFull, everything else
/// RZErrorStoreFailure.
[[noreturn]] void throwErrno(const std::string& description);
[[noreturn]] void throwErrno(const std::string& description, int number);
[[noreturn]] void throwCancelled();

/// The error of an exception that is not ours, such as one of memory.
[[nodiscard]] NSErrorRef unexpectedError(const std::exception& exception);

/// Nil when `work` ran to its end.
template <typename Work>
[[nodiscard]] NSErrorRef catchingFailures(Work&& work) {
  try {
    work();
    return nullptr;
  } catch (const StoreFailure& failure) {
    return failure.error;
  } catch (const std::exception& exception) {
    return unexpectedError(exception);
  }
}

}  // namespace yomber
