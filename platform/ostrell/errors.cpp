#include "platform/ostrell/errors.h"

#include <algorithm>

#include "platform/rozzel/errors.h"

namespace yomber {

NSErrorRef qsc_errorLoggedOut() {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorLoggedOut,
      {{NSLocalizedDescriptionKey, std::string("nobody is signed in to the drive")}});
}

NSErrorRef qsc_errorInvalidParameter(const std::string& parameter,
                                     const std::optional<std::string>& value) {
  NSErrorUserInfo userInfo;
  userInfo[QSOstrellErrorParameterKey] = parameter;
  if (value) userInfo[QSOstrellErrorValueKey] = *value;
  userInfo[NSLocalizedDescriptionKey] =
      "invalid value of " + parameter + ": " + value.value_or("(null)");
  return NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter,
                                  std::move(userInfo));
}

NSErrorRef qs_errorWithPOSIXCode(int code) {
  if (code == QSPOSIXErrorNotSupported) {
    return qs_errorWithPOSIXCode(code, "that is not supported for shared folders");
  }
  return NSError::errorWithErrno(code);
}

bool qs_isOstrellErrorCode(const NSErrorRef& error, std::int64_t code) {
  return error && error->is(QSOstrellErrorDomain, code);
}

bool qsc_isRozzelUnknownItemError(const NSErrorRef& error) {
  return rz_isError(error, RZErrorUnknownItem);
}

bool qsc_checkErrorsFromRozzel(const NSErrorRef& error,
                               const std::function<bool(const NSErrorRef&)>& test) {
  if (!error) return false;
  if (test(error) || qsc_checkErrorsFromRozzel(error->underlyingError(), test)) return true;
  return std::ranges::any_of(rz_failedRecords(error), [&](const auto& failed) {
    // A batch's error is that of its first record: the very same one ends this.
    return failed.second != error && qsc_checkErrorsFromRozzel(failed.second, test);
  });
}

NSErrorRef qs_errorWithPOSIXCode(int code, const std::string& description) {
  return NSError::errorWithDomain(NSPOSIXErrorDomain, code,
                                  {{NSLocalizedDescriptionKey, description}});
}

Log& qsc_default_log() { return defaultLog(); }

}  // namespace yomber
