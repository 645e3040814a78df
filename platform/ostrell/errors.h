#pragma once

#include <cstdint>
#include <functional>
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

/// The same with the description that belongs to the code.
[[nodiscard]] NSErrorRef qs_errorWithPOSIXCode(int code);

/// True for an error of QSOstrellErrorDomain with that code. False for nil.
[[nodiscard]] bool qs_isOstrellErrorCode(const NSErrorRef& error, std::int64_t code);
/// True for the record store's error that there is no such record. False for nil.
[[nodiscard]] bool qsc_isRozzelUnknownItemError(const NSErrorRef& error);
/// Whether `test` accepts the error, one below it, or that of one of its records. Nil is never
/// tested.
[[nodiscard]] bool qsc_checkErrorsFromRozzel(
    const NSErrorRef& error, const std::function<bool(const NSErrorRef& error)>& test);

/// The log of the client library and of the extension.
[[nodiscard]] Log& qsc_default_log();

}  // namespace yomber
