#include "zarn/tree_layout.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "platform/foundation/temporary_directory.h"
#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

const TreeLayout kLayout("/h");

TEST(TreeLayout, FindsThePlaceOfALocation) {
  const auto root = kLayout.placeOf(kLayout.root());
  ASSERT_TRUE(root);
  EXPECT_EQ(root->containerID, QSUbiquitousDefaultContainerID);
  EXPECT_EQ(root->relative, "");
  const auto file = kLayout.placeOf("/h/tree/org.example.Notes/Documents/a/b");
  ASSERT_TRUE(file);
  EXPECT_EQ(file->containerID, "org.example.Notes");
  EXPECT_EQ(file->path, "/h/tree/org.example.Notes/Documents");
  EXPECT_EQ(file->relative, "a/b");
  const auto trashed = kLayout.placeOf("/h/tree/.Trash/files/x");
  ASSERT_TRUE(trashed);
  EXPECT_EQ(trashed->kind, TreeLayout::Place::Kind::Trash);
  EXPECT_EQ(trashed->relative, "x");
}

TEST(TreeLayout, KeepsOutOfWhatIsNoPlace) {
  for (const char* path : {"/h/tree", "/h/tree/", "/h/treetop/x", "/h/private/x",
                           "/h/tree/.Promises/5", "/h/tree/.Trash/info/x", "/h/tree/.Trash",
                           "/h/tree/c", "/h/tree/c/Other/x", "/h/tree/c/Documents/../x",
                           "/h/tree/c/Documents//x", "/h/tree/c/Documents/.", "", "h/tree"}) {
    EXPECT_FALSE(kLayout.placeOf(path)) << path;
  }
}

TEST(TreeLayout, TellsPrivateAndExcludedLocations) {
  EXPECT_TRUE(kLayout.isPrivate("/h/private/staging"));
  EXPECT_TRUE(kLayout.isPrivate("/h/tree/.Promises/5"));
  EXPECT_FALSE(kLayout.isPrivate(kLayout.root() + "/a"));
  EXPECT_FALSE(kLayout.isPrivate("/elsewhere"));
  EXPECT_TRUE(kLayout.isExcluded(kLayout.root() + "/build.nosync/a"));
  EXPECT_TRUE(kLayout.isExcluded(kLayout.root() + "/.~lock.a.odt#"));
  EXPECT_FALSE(kLayout.isExcluded(kLayout.root() + "/a.odt"));
}

TEST(TreeLayout, MakesItsFoldersPrivate) {
  TemporaryDirectory directory;
  const TreeLayout layout(directory.path() + "/home");
  ASSERT_EQ(layout.createFolders(), 0);
  ASSERT_EQ(layout.createFolders(), 0);
  for (const std::string& path : {layout.root(), layout.trashFiles(), layout.privateArea()}) {
    struct stat status{};
    ASSERT_EQ(stat(path.c_str(), &status), 0) << path;
    EXPECT_EQ(status.st_mode & 0777U, 0700U) << path;
  }
  EXPECT_EQ(TreeLayout("/proc/no/such").createFolders(), ENOENT);
}

}  // namespace
}  // namespace yomber
