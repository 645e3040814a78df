#include "yomber/exit_codes.h"

#include <cerrno>

#include <gtest/gtest.h>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/file_operations.h"
#include "platform/ostrell/constants.h"
#include "platform/rozzel/errors.h"

namespace yomber {
namespace {

ExitCode codeOf(const char* domain, std::int64_t code) {
  return exitCodeFor(NSError::errorWithDomain(domain, code));
}

TEST(ExitCodes, SuccessIsZero) { EXPECT_EQ(exitCodeFor(nullptr), ExitCode::Ok); }

TEST(ExitCodes, NobodySignedInIsSaidApartFromOtherFailuresInBothDomains) {
  EXPECT_EQ(codeOf(NSFileProviderErrorDomain, NSFileProviderErrorNotAuthenticated),
            ExitCode::NotSignedIn);
  EXPECT_EQ(codeOf(QSOstrellErrorDomain, QSOstrellErrorLoggedOut), ExitCode::NotSignedIn);
}

TEST(ExitCodes, WhatAShareDoesNotAllowIsSaidApartFromWhatADiskRefuses) {
  EXPECT_EQ(codeOf(RZErrorDomain, RZErrorPermissionFailure), ExitCode::NotPermitted);
  EXPECT_EQ(codeOf(NSCocoaErrorDomain, NSFileWriteNoPermissionError), ExitCode::NotPermitted);
  EXPECT_EQ(codeOf(RZErrorDomain, RZErrorUnknownItem), ExitCode::NoSuchItem);
  EXPECT_EQ(codeOf(QSOstrellErrorDomain, QSOstrellErrorNotShared), ExitCode::NoSuchItem);
}

TEST(ExitCodes, AMissingItemIsTheSameWhicheverLayerFoundItMissing) {
  EXPECT_EQ(codeOf(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem), ExitCode::NoSuchItem);
  EXPECT_EQ(codeOf(NSCocoaErrorDomain, NSFileNoSuchFileError), ExitCode::NoSuchItem);
  EXPECT_EQ(codeOf(NSPOSIXErrorDomain, ENOENT), ExitCode::NoSuchItem);
}

TEST(ExitCodes, APeerThatIsGoneOrStuckMakesTheDriveUnavailable) {
  EXPECT_EQ(codeOf(NSCocoaErrorDomain, NSXPCConnectionInterrupted), ExitCode::Unavailable);
  EXPECT_EQ(codeOf(NSCocoaErrorDomain, NSXPCConnectionTimedOut), ExitCode::Unavailable);
  EXPECT_EQ(codeOf(QSOstrellErrorDomain, QSOstrellErrorConnectionLost), ExitCode::Unavailable);
}

TEST(ExitCodes, ATakenNameIsTheSameWithAndWithoutTheItemInTheWay) {
  EXPECT_EQ(codeOf(NSFileProviderErrorDomain, NSFileProviderErrorFilenameCollision),
            ExitCode::NameTaken);
  EXPECT_EQ(codeOf(NSCocoaErrorDomain, NSFileWriteFileExistsError), ExitCode::NameTaken);
}

TEST(ExitCodes, NoRoomIsTheDisksOrTheAccounts) {
  EXPECT_EQ(codeOf(NSPOSIXErrorDomain, ENOSPC), ExitCode::NoRoom);
  EXPECT_EQ(codeOf(NSCocoaErrorDomain, NSFileWriteOutOfSpaceError), ExitCode::NoRoom);
  EXPECT_EQ(codeOf(NSFileProviderErrorDomain, NSFileProviderErrorInsufficientQuota),
            ExitCode::NoRoom);
}

TEST(ExitCodes, AStoreOutOfReachIsTriedAgainAndADriveThatIsDownIsNot) {
  const auto store = NSError::errorWithDomain(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError);
  EXPECT_EQ(exitCodeFor(store), ExitCode::TryAgain);
  EXPECT_EQ(exitCodeFor(NSError::errorWithDomain(NSFileProviderErrorDomain,
                                                 NSFileProviderErrorServerUnreachable,
                                                 {{NSUnderlyingErrorKey, store}})),
            ExitCode::TryAgain);
  EXPECT_EQ(codeOf(NSFileProviderErrorDomain, NSFileProviderErrorServerUnreachable),
            ExitCode::Unavailable);
}

TEST(ExitCodes, DamagedContentIsSaidApart) {
  EXPECT_EQ(codeOf(NSCocoaErrorDomain, NSFileReadCorruptFileError), ExitCode::Damaged);
  EXPECT_EQ(codeOf(QSOstrellErrorDomain, QSOstrellErrorCannotEvict), ExitCode::TryAgain);
}

TEST(ExitCodes, TheSameCodeOfAnotherDomainMeansNothing) {
  EXPECT_EQ(codeOf(NSPOSIXErrorDomain, NSXPCConnectionInvalid), ExitCode::Failure);
  EXPECT_EQ(codeOf(NSCocoaErrorDomain, QSOstrellErrorLoggedOut), ExitCode::Failure);
}

}  // namespace
}  // namespace yomber
