#include "platform/glimmet/content_types.h"

#include <gtest/gtest.h>

#include <fstream>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

class ContentTypesTest : public testing::Test {
 protected:
  ContentTypesTest() {
    const std::string path = directory_.path() + "/globs2";
    std::ofstream(path) << "# comment\n"
                           "50:application/gzip:*.gz\n"
                           "50:application/x-compressed-tar:*.tar.gz\n"
                           "50:text/x-csrc:*.c:cs\n"
                           "50:text/x-c++src:*.C:cs\n"
                           "50:text/x-makefile:makefile\n"
                           "10:text/x-readme:readme*\n"
                           "60:image/x-special:*.gz.img\n"
                           "50:text/x-page:*.[1-9]\n"
                           "50:text/x-part:*.p?rt[0-9]\n"
                           "50:text/x-star:*\\*\n"
                           "50:text/x-number:[0-9][0-9].vdr\n"
                           "50:text/x-unlike:*.[!0-9a-y]\n"
                           "50:text/x-bracket:[]]x*\n"
                           "50:text/x-open:a[*\n"
                           "50:text/x-any:?.any*\n"
                           "malformed\nx:y:z\n50:\n";
    types_ = std::make_unique<ContentTypes>(path);
  }
  TemporaryDirectory directory_;
  std::unique_ptr<ContentTypes> types_;
};

TEST_F(ContentTypesTest, TakesTheLongestMatch) {
  EXPECT_EQ(types_->typeForName("a.gz"), "application/gzip");
  EXPECT_EQ(types_->typeForName("a.tar.gz"), "application/x-compressed-tar");
  EXPECT_EQ(types_->typeForName("v1.2.TAR.GZ"), "application/x-compressed-tar");
}

TEST_F(ContentTypesTest, MindsCaseWhereItCounts) {
  EXPECT_EQ(types_->typeForName("a.c"), "text/x-csrc");
  EXPECT_EQ(types_->typeForName("a.C"), "text/x-c++src");
}

TEST_F(ContentTypesTest, KnowsWholeNamesAndGlobs) {
  EXPECT_EQ(types_->typeForName("Makefile"), "text/x-makefile");
  EXPECT_EQ(types_->typeForName("README.first"), "text/x-readme");
  EXPECT_EQ(types_->typeForName("readme.gz"), "application/gzip");
}

TEST_F(ContentTypesTest, KnowsGlobsOfEveryForm) {
  EXPECT_EQ(types_->typeForName("ls.1"), "text/x-page");
  EXPECT_EQ(types_->typeForName("ls.0"), ContentTypes::kUnknown);
  EXPECT_EQ(types_->typeForName("a.PART7"), "text/x-part");
  EXPECT_EQ(types_->typeForName("a.part"), ContentTypes::kUnknown);
  EXPECT_EQ(types_->typeForName("all*"), "text/x-star");
  EXPECT_EQ(types_->typeForName("07.vdr"), "text/x-number");
  EXPECT_EQ(types_->typeForName("x7.vdr"), ContentTypes::kUnknown);
  EXPECT_EQ(types_->typeForName("page.z"), "text/x-unlike");
  EXPECT_EQ(types_->typeForName("page.\xc3"), "text/x-unlike");
  EXPECT_EQ(types_->typeForName("]x-rays"), "text/x-bracket");
  EXPECT_EQ(types_->typeForName("a[bc"), "text/x-open");
  EXPECT_EQ(types_->typeForName("\xff.anything"), "text/x-any");
}

TEST_F(ContentTypesTest, FallsBackForTheRest) {
  for (const std::string name : {"", ".", "noext", "a.", "\xff\xfe", "a.unheardof"}) {
    EXPECT_EQ(types_->typeForName(name), ContentTypes::kUnknown) << name;
  }
  EXPECT_EQ(types_->typeForName(std::string("a.gz\0", 5)), ContentTypes::kUnknown);
  EXPECT_EQ(ContentTypes("/no/such/file").typeForName("a.gz"), ContentTypes::kUnknown);
}

}  // namespace
}  // namespace yomber
