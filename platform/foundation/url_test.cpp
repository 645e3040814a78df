#include "platform/foundation/url.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

TEST(UrlTest, NormalisesItsPath) {
  EXPECT_EQ(NSURL("/a//b/./c/").path(), "/a/b/c");
  EXPECT_EQ(NSURL("/").path(), "/");
  EXPECT_EQ(NSURL("/./").path(), "/");
  EXPECT_EQ(NSURL("/a/..b/.c").path(), "/a/..b/.c");
}

TEST(UrlTest, RefusesWhatIsNoAbsolutePath) {
  EXPECT_EQ(NSURL::fileURLWithPath(""), nullptr);
  EXPECT_EQ(NSURL::fileURLWithPath("a/b"), nullptr);
  EXPECT_EQ(NSURL::fileURLWithPath(std::string_view("/a\0b", 4)), nullptr);
  EXPECT_NE(NSURL::fileURLWithPath("/\xff\n"), nullptr);
}

TEST(UrlTest, KeepsAnAddressThatIsNoFile) {
  const NSURLRef url = NSURL::URLWithString("some-scheme:0a/b?c");
  ASSERT_NE(url, nullptr);
  EXPECT_FALSE(url->isFileURL());
  EXPECT_EQ(url->absoluteString(), "some-scheme:0a/b?c");
  EXPECT_EQ(url->path(), "");
  EXPECT_FALSE(url->checkResourceIsReachableAndReturnError());
  EXPECT_TRUE(NSURL("/a").isFileURL());
}

TEST(UrlTest, RefusesWhatIsNoAddress) {
  for (const std::string& text :
       {std::string(), std::string("a"), std::string("a:"), std::string(":a"), std::string("/a:b"),
        std::string("a b:c"), std::string("a:b c"), std::string("a:\xff"), std::string("a:\0", 3),
        std::string("file:///a"), "a:" + std::string(4095, 'b')}) {
    EXPECT_EQ(NSURL::URLWithString(text), nullptr) << text;
  }
}

TEST(UrlTest, TakesPathsApartAndTogether) {
  const NSURL url("/a/b c");
  EXPECT_EQ(url.lastPathComponent(), "b c");
  EXPECT_EQ(url.URLByAppendingPathComponent("d")->path(), "/a/b c/d");
  EXPECT_EQ(url.URLByDeletingLastPathComponent()->path(), "/a");
  const NSURL root("/");
  EXPECT_EQ(root.lastPathComponent(), "/");
  EXPECT_EQ(root.URLByAppendingPathComponent("d")->path(), "/d");
  EXPECT_EQ(root.URLByDeletingLastPathComponent()->path(), "/");
}

TEST(UrlTest, EncodesWhatIsNotPlain) {
  EXPECT_EQ(NSURL("/a b/%/ü?#\n").absoluteString(), "file:///a%20b/%25/%C3%BC%3F%23%0A");
  EXPECT_EQ(NSURL("/A-z_0.9~(1)").description(), "file:///A-z_0.9~(1)");
}

TEST(UrlTest, CarriesAMarkOnTheObjectAndOnNothingMadeFromIt) {
  NSURL url("/a/b");
  EXPECT_FALSE(url.hasMark(NSURL::Mark::Physical));
  url.setMark(NSURL::Mark::Physical);
  EXPECT_TRUE(url.hasMark(NSURL::Mark::Physical));
  EXPECT_FALSE(url.URLByAppendingPathComponent("c")->hasMark(NSURL::Mark::Physical));
  EXPECT_FALSE(url.URLByDeletingLastPathComponent()->hasMark(NSURL::Mark::Physical));
}

TEST(UrlTest, KnowsWhatLiesBelowAPath) {
  EXPECT_TRUE(isPathBelow("/a/b", "/a"));
  EXPECT_TRUE(isPathBelow("/a", "/"));
  EXPECT_FALSE(isPathBelow("/ab", "/a"));
  EXPECT_FALSE(isPathBelow("/a", "/a"));
  EXPECT_FALSE(isPathBelow("/", "/"));
  EXPECT_FALSE(isPathBelow("/a", "/a/b"));
}

class UrlOnDiskTest : public testing::Test {
 protected:
  UrlOnDiskTest() { std::ofstream(file_) << "12345"; }

  void setAttribute(const char* name, const std::string& value) {
    ASSERT_EQ(setxattr(file_.c_str(), name, value.data(), value.size(), 0), 0)
        << "the temporary directory's file system must keep user attributes";
  }

  TemporaryDirectory directory_;
  const std::string file_ = directory_ / "file";
};

TEST_F(UrlOnDiskTest, ReadsTheValuesOfFilesAndDirectories) {
  struct stat status{};
  ASSERT_EQ(lstat(file_.c_str(), &status), 0);
  const auto values = NSURL(file_).resourceValues();
  ASSERT_TRUE(values);
  EXPECT_TRUE(values->isRegularFile);
  EXPECT_FALSE(values->isDirectory);
  EXPECT_EQ(values->fileSize, 5U);
  EXPECT_EQ(values->fileResourceIdentifier, status.st_ino);
  EXPECT_EQ(values->volumeIdentifier, status.st_dev);
  EXPECT_EQ(values->contentModificationDate, NSDate::fromTimespec(status.st_mtim));
  EXPECT_TRUE(NSURL(directory_.path()).resourceValues()->isDirectory);
}

TEST_F(UrlOnDiskTest, DoesNotFollowAFinalSymbolicLink) {
  ASSERT_EQ(symlink("nowhere", (directory_ / "link").c_str()), 0);
  const NSURL link(directory_ / "link");
  const auto values = link.resourceValues();
  ASSERT_TRUE(values);
  EXPECT_TRUE(values->isSymbolicLink);
  EXPECT_TRUE(link.checkResourceIsReachableAndReturnError());
}

TEST_F(UrlOnDiskTest, AnswersAPosixErrorForWhatIsNotThere) {
  NSErrorRef error;
  const NSURL missing(directory_ / "missing");
  EXPECT_FALSE(missing.resourceValues(&error));
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, ENOENT));
  EXPECT_EQ(std::get<std::string>(error->userInfo().at(NSFilePathErrorKey)), missing.path());
  EXPECT_FALSE(missing.checkResourceIsReachableAndReturnError());
}

TEST_F(UrlOnDiskTest, IsNotReachableWhileItIsAFault) {
  const NSURL url(file_);
  EXPECT_TRUE(url.checkResourceIsReachableAndReturnError());
  setAttribute(kFaultAttribute, "x");
  NSErrorRef error;
  EXPECT_FALSE(url.checkResourceIsReachableAndReturnError(&error));
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError));
  EXPECT_TRUE(url.resourceValues()) << "a fault has all its values";
}

TEST_F(UrlOnDiskTest, IsReachableWhenTheFaultWasFilledInThisBootOnly) {
  ASSERT_FALSE(bootIdentifier().empty());
  const NSURL url(file_);
  setAttribute(kFaultAttribute, "x");
  setAttribute(kFilledAttribute, "another boot");
  EXPECT_FALSE(url.checkResourceIsReachableAndReturnError());
  setAttribute(kFilledAttribute, std::string(100, 'x'));
  EXPECT_FALSE(url.checkResourceIsReachableAndReturnError());
  setAttribute(kFilledAttribute, bootIdentifier());
  EXPECT_TRUE(url.checkResourceIsReachableAndReturnError());
}

}  // namespace
}  // namespace yomber
