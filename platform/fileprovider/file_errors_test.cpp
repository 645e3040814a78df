#include "platform/fileprovider/file_errors.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <string>

#include "platform/fileprovider/file_operations.h"

namespace yomber {
namespace {

TEST(FileErrors, TellConditionsApartByTheirCode) {
  const auto code = [](int number, FileAccess access = FileAccess::Write) {
    return fileError(number, "/x", access)->code();
  };
  EXPECT_EQ(code(ENOENT), NSFileNoSuchFileError);
  EXPECT_EQ(code(EACCES), NSFileWriteNoPermissionError);
  EXPECT_EQ(code(EROFS), NSFileWriteNoPermissionError);
  EXPECT_EQ(code(EACCES, FileAccess::Read), NSFileReadNoPermissionError);
  EXPECT_EQ(code(ENOSPC), NSFileWriteOutOfSpaceError);
  EXPECT_EQ(code(EDQUOT), NSFileWriteOutOfSpaceError);
  EXPECT_EQ(code(ENAMETOOLONG), NSFileWriteInvalidFileNameError);
  EXPECT_EQ(code(EIO), NSFileWriteUnknownError);
  EXPECT_EQ(code(EIO, FileAccess::Read), NSFileReadUnknownError);
}

TEST(FileErrors, CarryTheSystemsErrorAndThePath) {
  const auto error = fileErrorFrom(NSError::errorWithErrno(ENOSPC, "/x"), FileAccess::Write);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileWriteOutOfSpaceError));
  EXPECT_TRUE(error->underlyingError()->is(NSPOSIXErrorDomain, ENOSPC));
  EXPECT_EQ(std::get<std::string>(error->userInfo().at(NSFilePathErrorKey)), "/x");
  EXPECT_NE(error->localizedDescription().find("make room"), std::string::npos);
}

TEST(FileErrors, PassWhatIsOfAnotherDomain) {
  const auto unavailable =
      NSError::errorWithDomain(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError);
  EXPECT_EQ(fileErrorFrom(unavailable, FileAccess::Write), unavailable);
  EXPECT_EQ(fileErrorFrom(nullptr, FileAccess::Write), nullptr);
}

TEST(FileErrors, SayWhatIsWrongWithAName) {
  EXPECT_EQ(checkFileName(std::string(255, 'n')), nullptr);
  const auto error = checkFileName(std::string(256, 'n'));
  EXPECT_TRUE(error->underlyingError()->is(NSPOSIXErrorDomain, ENAMETOOLONG));
  EXPECT_EQ(error->localizedDescription(),
            "a name cannot be longer than 255 bytes; this one has 256");
  EXPECT_TRUE(checkFileName("a/b")->underlyingError()->is(NSPOSIXErrorDomain, EINVAL));
}

}  // namespace
}  // namespace yomber
