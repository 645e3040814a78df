#include "platform/ostrell/trash_info.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <ctime>
#include <fstream>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

TEST(TrashInfoTest, IsWrittenAsOtherProgramsReadIt) {
  TrashInfo info;
  info.path = "Reports/two words %, \xc3\xa9.txt";
  info.deletionDate = "2026-03-31T18:05:09";
  EXPECT_EQ(trashInfoText(info),
            "[Trash Info]\n"
            "Path=Reports/two%20words%20%25%2C%20%C3%A9.txt\n"
            "DeletionDate=2026-03-31T18:05:09\n");
}

TEST(TrashInfoTest, ComesBackAsItWasWrittenWhateverItsBytes) {
  TrashInfo info;
  for (int byte = 1; byte < 256; ++byte) {
    if (byte != '/') info.path += static_cast<char>(byte);
  }
  info.pathInContainer = info.path + "/below";
  info.deletionDate = "2026-03-31T18:05:09";
  info.containerID = "org.example.Notes";
  info.kind = "folder";
  const auto parsed = parseTrashInfo(trashInfoText(info));
  ASSERT_TRUE(parsed.has_value());
  EXPECT_EQ(*parsed, info);
}

TEST(TrashInfoTest, ReadsWhatOtherProgramsWrite) {
  const auto parsed = parseTrashInfo(
      "[Trash Info]\r\n Path = /home/ada/a%20b \nUnknown=1\nPath=second\n\n[Other]\nPath=third\n");
  ASSERT_TRUE(parsed.has_value());
  EXPECT_EQ(parsed->path, "/home/ada/a b");
  EXPECT_EQ(parsed->containerID, "");
}

TEST(TrashInfoTest, RefusesWhatMakesNoSense) {
  for (const char* text :
       {"", "Path=a", "[Trash Info]", "[Trash Info]\nPath=", "[Trash Info]\nPath=/",
        "[Trash Info]\nPath=..", "[Trash Info]\nPath=a/../../b", "[Trash Info]\nPath=a//b",
        "[Trash Info]\nPath=./a", "[Trash Info]\nPath=a%00b", "[Trash Info]\nPath=a%2",
        "[Trash Info]\nPath=a%zz", "[Trash Info]\nPath=a/", "[Trash Info]\nPath=a/%2E%2E/b"}) {
    EXPECT_FALSE(parseTrashInfo(text).has_value()) << text;
  }
}

TEST(TrashInfoTest, DropsAPlaceInAContainerThatMakesNoSense) {
  for (const char* path : {"../x", "/x", ""}) {
    const auto parsed = parseTrashInfo(
        std::string("[Trash Info]\nPath=a\nX-Yomber-Container=c\nX-Yomber-Path=") + path + "\n");
    ASSERT_TRUE(parsed.has_value()) << path;
    EXPECT_EQ(parsed->containerID, "") << path;
    EXPECT_EQ(parsed->pathInContainer, "") << path;
  }
}

TEST(TrashInfoTest, TellsTheNameThatAFileInTheTrashHad) {
  const TemporaryDirectory directory;
  const std::string trash = directory.path() + "/.Trash";
  for (const char* folder : {"", "/files", "/info"}) {
    ASSERT_EQ(mkdir((trash + folder).c_str(), 0700), 0);
  }
  TrashInfo info;
  info.path = "Reports/" + std::string(255, 'x');
  std::ofstream(trash + "/info/x 2.trashinfo") << trashInfoText(info);
  EXPECT_EQ(trashedName(trash + "/files/x 2"), std::string(255, 'x'));
  EXPECT_FALSE(trashedName(trash + "/files/x"));
  EXPECT_FALSE(trashedName(trash + "/files/x 2/below"));
  EXPECT_FALSE(trashedName(directory.path() + "/files/x 2"));
  EXPECT_FALSE(trashedName("x 2"));
}

TEST(TrashInfoTest, DatesAreLocalTime) {
  setenv("TZ", "XYZ-2", 1);
  tzset();
  EXPECT_EQ(trashDeletionDate(NSDate::fromNanoseconds(0)), "1970-01-01T02:00:00");
  unsetenv("TZ");
  tzset();
}

}  // namespace
}  // namespace yomber
