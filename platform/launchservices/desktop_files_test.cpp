#include "platform/launchservices/desktop_files.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

using testing::ElementsAre;
using testing::FieldsAre;
using testing::IsEmpty;

TEST(DesktopFiles, ApplicationsAreLookedForInTheUsersDirectoryFirst) {
  setenv("XDG_DATA_HOME", "/home/someone/data", 1);
  setenv("XDG_DATA_DIRS", "/opt/share:relative:/usr/share", 1);
  EXPECT_THAT(applicationDirectories(),
              ElementsAre("/home/someone/data/applications", "/opt/share/applications",
                          "/usr/share/applications"));
  unsetenv("XDG_DATA_HOME");
  unsetenv("XDG_DATA_DIRS");
}

TEST(DesktopFiles, SubdirectoriesArePartOfTheIDAndEarlierDirectoriesCountFirst) {
  const TemporaryDirectory base;
  for (const std::string file : {"a/one.desktop", "a/sub/two.desktop", "b/one.desktop",
                                 "b/readme.txt", "b/1/2/3/4/5/deep.desktop"}) {
    std::filesystem::create_directories(std::filesystem::path(base / file).parent_path());
    std::ofstream(base / file) << "text";
  }
  EXPECT_THAT(desktopFiles({base / "b", base / "a", base / "missing"}),
              ElementsAre(FieldsAre("one", base / "b/one.desktop"),
                          FieldsAre("sub-two", base / "a/sub/two.desktop")));
}

TEST(DesktopFiles, OnlyRegularFilesHaveText) {
  const TemporaryDirectory base;
  ASSERT_EQ(mkfifo((base / "pipe.desktop").c_str(), 0600), 0);
  EXPECT_THAT(desktopFileText(base / "pipe.desktop"), IsEmpty());
  EXPECT_THAT(desktopFileText(base.path()), IsEmpty());
  EXPECT_THAT(desktopFileText(base / "missing"), IsEmpty());
  std::ofstream(base / "file.desktop") << "text";
  EXPECT_EQ(desktopFileText(base / "file.desktop"), "text");
  std::ofstream(base / "long.desktop") << std::string(1'000'000, 'x');
  EXPECT_LT(desktopFileText(base / "long.desktop").size(), 300'000U);
}

}  // namespace
}  // namespace yomber
