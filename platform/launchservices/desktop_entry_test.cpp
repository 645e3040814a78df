#include "platform/launchservices/desktop_entry.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace yomber {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

TEST(DesktopEntryTest, ReadsTheKeysOfItsOwnGroupOnly) {
  const auto entry = parseDesktopEntry(
      "# a comment\n[Other]\nName=Wrong\n[Desktop Entry]\nName = Notes\r\nName[de]=Notizen\n"
      "Icon=org.notes\nX-Yomber-Container=org.notes.app\n"
      "X-Yomber-Container-Name=My\\sNotes\n[Desktop Action new]\nName=New\n");
  ASSERT_TRUE(entry);
  EXPECT_EQ(entry->name, "Notes");
  EXPECT_EQ(entry->iconName, "org.notes");
  EXPECT_EQ(entry->containerName, "My Notes");
  EXPECT_THAT(entry->containerIDs, ElementsAre("org.notes.app"));
  EXPECT_FALSE(entry->isHidden);
}

TEST(DesktopEntryTest, ReadsListsAndReportsWhatIsNotValid) {
  std::vector<std::string> invalid;
  const auto entry = parseDesktopEntry(
      "[Desktop Entry]\nX-Yomber-Containers=org.a.b; org.c.d ;org.a.b;;../etc;\nHidden=true\n",
      &invalid);
  ASSERT_TRUE(entry);
  EXPECT_THAT(entry->containerIDs, ElementsAre("org.a.b", "org.c.d"));
  EXPECT_THAT(invalid, ElementsAre("../etc"));
  EXPECT_TRUE(entry->isHidden);
}

TEST(DesktopEntryTest, SharedContainersAndServicesAreListsOfTheirOwn) {
  std::vector<std::string> invalid;
  const auto entry = parseDesktopEntry(
      "[Desktop Entry]\nX-Yomber-Shared-Containers=org.a.b;x\n"
      "X-Yomber-Services=Documents;Sharing;Documents;\n",
      &invalid);
  ASSERT_TRUE(entry);
  EXPECT_THAT(entry->sharedContainerIDs, ElementsAre("org.a.b"));
  EXPECT_THAT(entry->services, ElementsAre("Documents", "Sharing"));
  EXPECT_THAT(entry->containerIDs, IsEmpty());
  EXPECT_THAT(invalid, ElementsAre("x"));
}

TEST(DesktopEntryTest, AFileWithoutTheGroupIsNone) {
  EXPECT_FALSE(parseDesktopEntry(""));
  EXPECT_FALSE(parseDesktopEntry("Name=a\n[Desktop Entry\n"));
  const auto entry = parseDesktopEntry("[Desktop Entry]\nX-Yomber-Container");
  ASSERT_TRUE(entry);
  EXPECT_THAT(entry->containerIDs, IsEmpty());
}

TEST(DesktopEntryTest, ContainerIDsAreSafeAsFolderNames) {
  EXPECT_TRUE(isValidContainerID("org.example.App-1_b"));
  EXPECT_TRUE(isValidContainerID("a." + std::string(253, 'b')));
  for (const std::string bad :
       {"", "a", ".", "..", ".a.b", "a.b.", "a..b", "a/b.c", "a.b c", "a.\xff", "a.b;c"}) {
    EXPECT_FALSE(isValidContainerID(bad)) << bad;
  }
  EXPECT_FALSE(isValidContainerID(std::string("a.\0b", 4)));
  EXPECT_FALSE(isValidContainerID("a." + std::string(254, 'b')));
}

}  // namespace
}  // namespace yomber
