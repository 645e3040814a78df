#pragma once

#include <optional>
#include <string>

#include "platform/foundation/error.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"

namespace yomber {

/// Nobody is signed in: QSOstrellErrorDomain 2.
[[nodiscard]] NSErrorRef qsc_errorLoggedOut();
/// QSOstrellErrorDomain 3, naming the parameter and its value.
[[nodiscard]] NSErrorRef qsc_errorInvalidParameter(const std::string& parameter,
                                                   const std::optional<std::string>& value);

/// NSPOSIXErrorDomain with a description for a person.
[[nodiscard]] NSErrorRef qs_errorWithPOSIXCode(int code, const std::string& description);

/// The log of the client library and of the extension.
[[nodiscard]] Log& qsc_default_log();

}  // namespace yomber
