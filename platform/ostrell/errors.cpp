#include "platform/ostrell/errors.h"

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

NSErrorRef qs_errorWithPOSIXCode(int code, const std::string& description) {
  return NSError::errorWithDomain(NSPOSIXErrorDomain, code,
                                  {{NSLocalizedDescriptionKey, description}});
}

Log& qsc_default_log() { return defaultLog(); }

}  // namespace yomber
