#include "platform/foundation/error.h"

#include <gtest/gtest.h>

#include <cerrno>

#include "platform/foundation/url.h"

namespace yomber {
namespace {

TEST(ErrorTest, IsNamedByDomainAndCodeTogether) {
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, 4));
  EXPECT_FALSE(error->is(NSPOSIXErrorDomain, 4));
  EXPECT_FALSE(error->is(NSCocoaErrorDomain, 5));
}

TEST(ErrorTest, GivesTheUnderlyingErrorItself) {
  const auto cause = NSError::errorWithErrno(EACCES, "/a");
  const auto error =
      NSError::errorWithDomain(NSCocoaErrorDomain, 512, {{NSUnderlyingErrorKey, cause}});
  EXPECT_EQ(error->underlyingError(), cause);
  EXPECT_EQ(cause->underlyingError(), nullptr);
}

TEST(ErrorTest, HasNoUnderlyingErrorWhenTheEntryIsSomethingElse) {
  const auto error = NSError::errorWithDomain("d", 1, {{NSUnderlyingErrorKey, std::string("x")}});
  EXPECT_EQ(error->underlyingError(), nullptr);
}

TEST(ErrorTest, DescribesItselfToAPerson) {
  EXPECT_EQ(NSError::errorWithErrno(ENOENT)->localizedDescription(), "No such file or directory");
  EXPECT_EQ(NSError::errorWithDomain("d", 7)->localizedDescription(),
            "The operation could not be completed. (d error 7.)");
  EXPECT_EQ(NSError::errorWithDomain("d", 7, {{NSLocalizedDescriptionKey, std::string("Mine.")}})
                ->localizedDescription(),
            "Mine.");
}

TEST(ErrorTest, DescribesItselfToALogWithAllThatItKnows) {
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, NSFileWriteFileExistsError,
                                              {{NSFilePathErrorKey, std::string("/a")},
                                               {"url", NSURL::fileURLWithPath("/b")},
                                               {"count", std::int64_t{3}},
                                               {"none", NSErrorRef()}});
  EXPECT_EQ(
      error->description(),
      "Error Domain=NSCocoaErrorDomain Code=516 \"An item with the same name already exists.\""
      " UserInfo={NSFilePath=/a, count=3, none=(null), url=file:///b}");
  EXPECT_EQ(NSError::errorWithDomain("d", 1)->description(),
            "Error Domain=d Code=1 \"The operation could not be completed. (d error 1.)\"");
}

TEST(ErrorTest, IsStoredOnlyWhereTheCallerWantsIt) {
  NSErrorRef out;
  storeError(&out, NSError::errorWithErrno(EIO));
  EXPECT_TRUE(out->is(NSPOSIXErrorDomain, EIO));
  storeError(nullptr, out);
}

}  // namespace
}  // namespace yomber
