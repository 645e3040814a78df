#include "yomber/failure_text.h"

#include <gtest/gtest.h>

#include <cerrno>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

NSErrorRef described(const std::string& text) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError,
                                  {{NSLocalizedDescriptionKey, text}});
}

NSErrorRef framework(std::int64_t code, NSErrorUserInfo userInfo = {}) {
  return NSError::errorWithDomain(NSFileProviderErrorDomain, code, std::move(userInfo));
}

TEST(FailureText, AnErrorsOwnDescriptionIsWhatItSays) {
  EXPECT_EQ(failureText(described("the cable is out")), "the cable is out");
}

TEST(FailureText, TheFrameworksCodesAreSaidInWords) {
  EXPECT_EQ(failureText(framework(NSFileProviderErrorNotAuthenticated)), "nobody is signed in");
  EXPECT_EQ(failureText(framework(NSFileProviderErrorNoSuchItem)), "there is no such item");
}

TEST(FailureText, NobodySignedInIsTheSameWhicheverLayerSaysIt) {
  EXPECT_EQ(failureText(NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorLoggedOut)),
            "nobody is signed in");
}

TEST(FailureText, ADescribedCauseSaysMoreThanItsTranslation) {
  EXPECT_EQ(failureText(framework(NSFileProviderErrorServerUnreachable,
                                  {{NSUnderlyingErrorKey, described("the cable is out")}})),
            "the cable is out");
  EXPECT_EQ(failureText(framework(NSFileProviderErrorServerUnreachable)),
            "the drive or its store does not answer");
}

TEST(FailureText, OtherErrorsAreDescribedAsTheyDescribeThemselves) {
  const auto error = NSError::errorWithErrno(ENOSPC);
  EXPECT_EQ(failureText(error), error->localizedDescription());
}

}  // namespace
}  // namespace yomber
