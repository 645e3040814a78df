#include "yomber/exit_codes.h"

#include <cerrno>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/constants.h"

namespace yomber {

namespace {

bool isConnectionError(const NSError& error) {
  if (error.domain() == QSOstrellErrorDomain) return error.code() == QSOstrellErrorConnectionLost;
  if (error.domain() != NSCocoaErrorDomain) return false;
  return error.code() == NSXPCConnectionInterrupted || error.code() == NSXPCConnectionInvalid ||
         error.code() == NSXPCConnectionReplyInvalid || error.code() == NSXPCConnectionTimedOut;
}

}  // namespace

ExitCode exitCodeFor(const NSErrorRef& error) {
  if (!error) return ExitCode::Ok;
  if (error->is(NSFileProviderErrorDomain, NSFileProviderErrorNotAuthenticated) ||
      error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut)) {
    return ExitCode::NotSignedIn;
  }
  if (error->is(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem) ||
      error->is(NSCocoaErrorDomain, NSFileNoSuchFileError) ||
      error->is(NSPOSIXErrorDomain, ENOENT)) {
    return ExitCode::NoSuchItem;
  }
  if (error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter)) return ExitCode::Usage;
  if (isConnectionError(*error)) return ExitCode::Unavailable;
  return ExitCode::Failure;
}

}  // namespace yomber
