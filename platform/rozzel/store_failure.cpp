#include "platform/rozzel/store_failure.h"

#include <cerrno>
#include <utility>

namespace yomber {

void throwFailure(RZErrorCode code, std::string description) {
  throw StoreFailure{rz_error(code, std::move(description))};
}

void throwErrno(const std::string& description) { throwErrno(description, errno); }

void throwErrno(const std::string& description, int number) {
  const bool full = number == ENOSPC || number == EDQUOT || number == EFBIG;
  const NSErrorRef cause = NSError::errorWithErrno(number);
  throw StoreFailure{rz_error(full ? RZErrorStoreFull : RZErrorStoreFailure,
                              description + ": " + cause->localizedDescription() +
                                  (full ? " (make room on the disk, then try again)" : ""),
                              {{NSUnderlyingErrorKey, cause}})};
}

void throwCancelled() {
  throw StoreFailure{NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError)};
}

NSErrorRef unexpectedError(const std::exception& exception) {
  return rz_error(RZErrorStoreFailure, std::string("unexpected: ") + exception.what());
}

}  // namespace yomber
