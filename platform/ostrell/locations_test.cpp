#include "platform/ostrell/locations.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

const DriveLocations kDrive("/home/someone/drive");
const std::string kTree = "/home/someone/drive/tree";

TEST(Locations, LieUnderTheHome) {
  EXPECT_EQ(kDrive.tree(), kTree);
  EXPECT_EQ(kDrive.root(), kTree + "/com.kelvo.YomberDrive/Documents");
  EXPECT_EQ(kDrive.trashFiles(), kTree + "/.Trash/files");
  EXPECT_EQ(kDrive.trashInfo(), kTree + "/.Trash/info");
  EXPECT_EQ(kDrive.promises(), kTree + "/.Promises");
  EXPECT_EQ(kDrive.privateStorage(), "/home/someone/drive/private");
}

TEST(Locations, InTree) {
  EXPECT_TRUE(kDrive.isInTree(kDrive.root()));
  EXPECT_TRUE(kDrive.isInTree(kDrive.root() + "/a/b"));
  EXPECT_TRUE(kDrive.isInTree(kDrive.promises() + "/d:5"));
  EXPECT_TRUE(kDrive.isInTree(kDrive.root() + "/..a"));
  EXPECT_FALSE(kDrive.isInTree(kTree));
  EXPECT_FALSE(kDrive.isInTree(kTree + "x/a"));
  EXPECT_FALSE(kDrive.isInTree("/home/someone/drive/private/a"));
  EXPECT_FALSE(kDrive.isInTree("/"));
  EXPECT_FALSE(kDrive.isInTree(kTree + "/../../../etc/passwd"));
  EXPECT_FALSE(kDrive.isInTree(kTree + "/a/.."));
}

TEST(Locations, Private) {
  EXPECT_TRUE(kDrive.isPrivate(kDrive.promises()));
  EXPECT_TRUE(kDrive.isPrivate(kDrive.promises() + "/d:5"));
  EXPECT_TRUE(kDrive.isPrivate(kDrive.privateStorage() + "/staging/x"));
  EXPECT_TRUE(kDrive.isPrivate(kDrive.trashInfo() + "/a.trashinfo"));
  EXPECT_TRUE(kDrive.isPrivate(kTree + "/org.example.App/Library/x"));
  EXPECT_TRUE(kDrive.isPrivate(kTree + "/.Other/Documents/x"));
  EXPECT_FALSE(kDrive.isPrivate(kDrive.root()));
  EXPECT_FALSE(kDrive.isPrivate(kDrive.root() + "/.Promises/x"));
  EXPECT_FALSE(kDrive.isPrivate(kTree + "/org.example.App/Documents/x"));
  EXPECT_FALSE(kDrive.isPrivate(kDrive.trashFiles() + "/a"));
  EXPECT_FALSE(kDrive.isPrivate("/etc/passwd"));
}

TEST(Locations, InTrash) {
  EXPECT_TRUE(kDrive.isInTrash(kDrive.trashFiles() + "/a"));
  EXPECT_FALSE(kDrive.isInTrash(kDrive.root() + "/.Trash/files/a"));
  EXPECT_FALSE(kDrive.isInTrash(kDrive.trash() + "/../x"));
}

TEST(Locations, ExcludedByAnyNameBelowTheDocuments) {
  EXPECT_TRUE(kDrive.isExcluded(kDrive.root() + "/a/b.part"));
  EXPECT_TRUE(kDrive.isExcluded(kDrive.root() + "/build.nosync/a/b.txt"));
  EXPECT_TRUE(kDrive.isExcluded(kDrive.trashFiles() + "/a.crdownload"));
  EXPECT_FALSE(kDrive.isExcluded(kDrive.root()));
  EXPECT_FALSE(kDrive.isExcluded(kDrive.root() + "/a/b.txt"));
  EXPECT_FALSE(kDrive.isExcluded(kTree + "/org.nosync/Documents/a"));
  EXPECT_FALSE(kDrive.isExcluded("/tmp/a.part"));
  EXPECT_FALSE(DriveLocations("/srv/x.nosync").isExcluded("/srv/x.nosync/tree/a/Documents/b"));
}

TEST(Locations, ContainersAndTheirDocuments) {
  for (const std::string containerID :
       {QSUbiquitousDefaultContainerID, QSUbiquitousDocumentsContainerID,
        QSUbiquitousDesktopContainerID, "org.example.App"}) {
    EXPECT_EQ(kDrive.containerOfDocuments(kDrive.containerDocuments(containerID)), containerID);
  }
  EXPECT_EQ(kDrive.containerDocuments(QSUbiquitousDesktopContainerID), kDrive.root() + "/Desktop");
  EXPECT_EQ(kDrive.containerDocuments("org.example.App"), kTree + "/org.example.App/Documents");
  for (const std::string& path :
       {kTree, kTree + "/Documents", kTree + "/org.example.App", kTree + "/.Trash/Documents",
        kTree + "/a/b/Documents", kDrive.root() + "/a", kDrive.root() + "/Documents/Documents",
        std::string("/Documents"), std::string("/")}) {
    EXPECT_FALSE(kDrive.containerOfDocuments(path)) << path;
  }
}

}  // namespace
}  // namespace yomber
