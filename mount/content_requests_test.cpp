#include "mount/content_requests.h"

#include <cerrno>

#include <gtest/gtest.h>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/file_operations.h"

namespace yomber {
namespace {

int answerTo(const std::string& domain, std::int64_t code) {
  return errnoOf(NSError::errorWithDomain(domain, code));
}

TEST(ErrnoOfContent, NoErrorIsNone) { EXPECT_EQ(errnoOf(nullptr), 0); }

TEST(ErrnoOfContent, WhatTheSystemSaidIsSaidAgain) {
  for (const int number : {ENOSPC, EBUSY, ENOENT, EDQUOT, EROFS, EIO}) {
    EXPECT_EQ(answerTo(NSPOSIXErrorDomain, number), number);
  }
}

TEST(ErrnoOfContent, WhatTheProviderSaidIsSaidAsADiskWouldSayIt) {
  const auto answer = [](std::int64_t code) { return answerTo(NSFileProviderErrorDomain, code); };
  EXPECT_EQ(answer(NSFileProviderErrorNotAuthenticated), EACCES);
  EXPECT_EQ(answer(NSFileProviderErrorServerUnreachable), ENETUNREACH);
  EXPECT_EQ(answer(NSFileProviderErrorInsufficientQuota), EDQUOT);
  EXPECT_EQ(answer(NSFileProviderErrorNoSuchItem), ENOENT);
  EXPECT_EQ(answer(NSFileProviderErrorFilenameCollision), EIO);
  EXPECT_EQ(answer(NSFileProviderErrorSyncAnchorExpired), EIO);
}

TEST(ErrnoOfContent, WhatTheDriveSaidIsSaidAsADiskWouldSayIt) {
  const auto answer = [](std::int64_t code) { return answerTo(NSCocoaErrorDomain, code); };
  EXPECT_EQ(answer(NSFileNoSuchFileError), ENOENT);
  EXPECT_EQ(answer(NSUserCancelledError), EINTR);
  EXPECT_EQ(answer(NSUbiquitousFileUnavailableError), ENETUNREACH);
  EXPECT_EQ(answer(NSUbiquitousFileNotUploadedDueToQuotaError), EDQUOT);
  EXPECT_EQ(answer(NSFileWriteOutOfSpaceError), ENOSPC);
  EXPECT_EQ(answer(NSFileReadCorruptFileError), EIO);
}

TEST(ErrnoOfContent, WhatNobodyKnowsIsAnErrorAllTheSame) {
  EXPECT_EQ(answerTo("org.example.Unheard", 2), EIO);
  EXPECT_EQ(answerTo(NSCocoaErrorDomain, 0), EIO);
  EXPECT_EQ(answerTo(NSFileProviderErrorDomain, 0), EIO);
  // Numbers that are none: nobody must take the one for success, nor hand the others on.
  for (const std::int64_t code : {0L, -5L, 70'000L}) {
    EXPECT_EQ(answerTo(NSPOSIXErrorDomain, code), EIO) << code;
  }
}

}  // namespace
}  // namespace yomber
