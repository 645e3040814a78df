#include "provider/extension/error_mapping.h"

#include <gtest/gtest.h>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/errors.h"

namespace yomber {
namespace {

constexpr std::int64_t kCocoaItemIsGone = 14;
constexpr std::int64_t kUntouched = 4711;

void expectMapped(const NSErrorRef& error, std::int64_t code) {
  const NSErrorRef mapped = qs_fileProviderError(error);
  EXPECT_EQ(mapped->domain(), NSFileProviderErrorDomain);
  EXPECT_EQ(mapped->code(), code);
  EXPECT_EQ(mapped->userInfo().size(), 1U);
  EXPECT_EQ(mapped->underlyingError(), error);
}

void expectUnchanged(const NSErrorRef& error) {
  std::int64_t code = kUntouched;
  EXPECT_FALSE(_qs_getFileProviderDomainErrorCode(error, &code));
  EXPECT_EQ(code, kUntouched);
  EXPECT_FALSE(_qs_getFileProviderDomainErrorCode(error, nullptr));
  EXPECT_EQ(qs_fileProviderError(error), error);
}

TEST(ErrorMapping, ACocoaQuotaErrorBecomesInsufficientQuotaWithTheCocoaErrorUnderneath) {
  expectMapped(NSError::errorWithDomain(NSCocoaErrorDomain, 4355), -1004);
}

TEST(ErrorMapping, ACocoaUnavailableErrorBecomesServerUnreachable) {
  expectMapped(NSError::errorWithDomain(NSCocoaErrorDomain, 4354), -1003);
}

TEST(ErrorMapping, CocoaFourteenBecomesNoSuchItem) {
  expectMapped(NSError::errorWithDomain(NSCocoaErrorDomain, kCocoaItemIsGone), -1005);
}

TEST(ErrorMapping, TheDaemonsLoggedOutErrorBecomesNotAuthenticated) {
  expectMapped(NSError::errorWithDomain(QSOstrellErrorDomain, 2), -1000);
  expectMapped(qsc_errorLoggedOut(), -1000);
}

TEST(ErrorMapping, OtherDaemonErrorsAreTheVerySameObject) {
  for (const std::int64_t code : {0, 1, 3, 4, 5, -2}) {
    expectUnchanged(NSError::errorWithDomain(QSOstrellErrorDomain, code));
  }
}

TEST(ErrorMapping, APosixErrorIsUnchanged) {
  expectUnchanged(NSError::errorWithErrno(ENOENT));
  expectUnchanged(NSError::errorWithDomain(NSPOSIXErrorDomain, 2));
}

TEST(ErrorMapping, ACocoaFileExistsErrorIsUnchanged) {
  expectUnchanged(NSError::errorWithDomain(NSCocoaErrorDomain, NSFileWriteFileExistsError));
}

TEST(ErrorMapping, TheCodesCountInTheirOwnDomainOnly) {
  expectUnchanged(NSError::errorWithDomain(NSCocoaErrorDomain, 2));
  expectUnchanged(NSError::errorWithDomain(QSOstrellErrorDomain, 4355));
  expectUnchanged(NSError::errorWithDomain(QSOstrellErrorDomain, kCocoaItemIsGone));
  expectUnchanged(NSError::errorWithDomain(NSFileProviderErrorDomain, -1000));
}

TEST(ErrorMapping, ANullPointerStillAnswersYesForAMappedError) {
  EXPECT_TRUE(_qs_getFileProviderDomainErrorCode(NSError::errorWithDomain(NSCocoaErrorDomain, 4355),
                                                 nullptr));
}

TEST(ErrorMapping, TheCodeIsStoredThroughThePointer) {
  std::int64_t code = kUntouched;
  EXPECT_TRUE(_qs_getFileProviderDomainErrorCode(NSError::errorWithDomain(NSCocoaErrorDomain, 4354),
                                                 &code));
  EXPECT_EQ(code, -1003);
}

TEST(ErrorMapping, OnlyTheUnderlyingErrorIsCarriedNotTheReceiversOwnInformation) {
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, 4355,
                                              {{NSLocalizedDescriptionKey, std::string("full")}});
  expectMapped(error, -1004);
}

TEST(ErrorMapping, NoErrorStaysNoError) {
  EXPECT_EQ(qs_fileProviderError(nullptr), nullptr);
  EXPECT_FALSE(_qs_getFileProviderDomainErrorCode(nullptr, nullptr));
}

}  // namespace
}  // namespace yomber
