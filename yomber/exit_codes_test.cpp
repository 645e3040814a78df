#include "yomber/exit_codes.h"

#include <cerrno>

#include <gtest/gtest.h>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/constants.h"

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

TEST(ExitCodes, TheSameCodeOfAnotherDomainMeansNothing) {
  EXPECT_EQ(codeOf(NSPOSIXErrorDomain, NSXPCConnectionInvalid), ExitCode::Failure);
  EXPECT_EQ(codeOf(NSCocoaErrorDomain, QSOstrellErrorLoggedOut), ExitCode::Failure);
}

}  // namespace
}  // namespace yomber
