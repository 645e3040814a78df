#include "yomber/exit_codes.h"

#include <cerrno>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/file_operations.h"
#include "platform/ostrell/constants.h"
#include "platform/rozzel/errors.h"

namespace yomber {

namespace {

bool isConnectionError(const NSError& error) {
  if (error.domain() == QSOstrellErrorDomain) return error.code() == QSOstrellErrorConnectionLost;
  if (error.domain() != NSCocoaErrorDomain) return false;
  return error.code() == NSXPCConnectionInterrupted || error.code() == NSXPCConnectionInvalid ||
         error.code() == NSXPCConnectionReplyInvalid || error.code() == NSXPCConnectionTimedOut;
}

/// What a share does not allow this account, or is no share any more.
ExitCode exitCodeForShare(const NSError& error) {
  if (error.is(RZErrorDomain, RZErrorPermissionFailure)) return ExitCode::NotPermitted;
  if (error.is(RZErrorDomain, RZErrorUnknownItem) ||
      error.is(QSOstrellErrorDomain, QSOstrellErrorNotShared))
    return ExitCode::NoSuchItem;
  return ExitCode::Failure;
}

/// What a file or its content could not be had for; Failure when it is nothing of the kind.
ExitCode exitCodeForFile(const NSError& error) {
  if (error.is(NSFileProviderErrorDomain, NSFileProviderErrorFilenameCollision) ||
      error.is(NSCocoaErrorDomain, NSFileWriteFileExistsError)) {
    return ExitCode::NameTaken;
  }
  if (error.is(NSFileProviderErrorDomain, NSFileProviderErrorInsufficientQuota) ||
      error.is(NSCocoaErrorDomain, NSUbiquitousFileNotUploadedDueToQuotaError) ||
      error.is(NSCocoaErrorDomain, NSFileWriteOutOfSpaceError) ||
      error.is(NSPOSIXErrorDomain, ENOSPC) || error.is(NSPOSIXErrorDomain, EDQUOT)) {
    return ExitCode::NoRoom;
  }
  if (error.is(NSCocoaErrorDomain, NSFileReadCorruptFileError)) return ExitCode::Damaged;
  if (error.is(NSCocoaErrorDomain, NSFileWriteNoPermissionError)) return ExitCode::NotPermitted;
  if (error.is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError) ||
      error.is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict) ||
      error.is(NSPOSIXErrorDomain, EBUSY)) {
    return ExitCode::TryAgain;
  }
  return ExitCode::Failure;
}

/// The framework says "unreachable" of the store and of the drive's own processes alike.
ExitCode exitCodeForUnreachable(const NSError& error) {
  const NSErrorRef cause = error.underlyingError();
  const bool isStore = cause && cause->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError);
  return isStore ? ExitCode::TryAgain : ExitCode::Unavailable;
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
  if (error->is(NSFileProviderErrorDomain, NSFileProviderErrorServerUnreachable)) {
    return exitCodeForUnreachable(*error);
  }
  const ExitCode code = exitCodeForFile(*error);
  return code == ExitCode::Failure ? exitCodeForShare(*error) : code;
}

}  // namespace yomber
