// What file managers do with the trash, through the mount, and what the drive makes of it.
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/foundation/stopped_process.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

class MountTrash : public MountFixture {
 protected:
  void SetUp() override {
    if (access("/usr/bin/gio", X_OK) != 0) GTEST_SKIP() << "there is no gio (libglib2.0-bin)";
    fs::create_directory(at("Plans"));
    std::ofstream(at("Plans/house plan.txt")) << "four walls";
    ASSERT_TRUE(isConfirmed("Plans/house plan.txt"));
    id_ = idOf("Plans/house plan.txt");
  }
  [[nodiscard]] std::string idOf(const std::string& name) {
    return mounted_.drive().json({"id", name}).at(0).at("id");
  }
  /// What `yomber trash --list` shows: name and id of each.
  [[nodiscard]] std::vector<std::pair<std::string, std::string>> trashed() {
    std::vector<std::pair<std::string, std::string>> result;
    for (const auto& item : mounted_.drive().json({"trash", "--list"})) {
      result.emplace_back(item.at("name"), item.at("id"));
    }
    return result;
  }
  /// The trash as file managers find it.
  [[nodiscard]] std::string inTrash(const std::string& name) const {
    return at(".Trash-" + std::to_string(getuid()) + "/" + name);
  }
  void trash(const std::string& name) {
    const ProcessResult result =
        runProcess({"/usr/bin/gio", "trash", at(name)}, mounted_.drive().environment());
    ASSERT_EQ(result.exitCode, 0) << result.errors;
    EXPECT_FALSE(fs::exists(at(name)));
  }
  /// As whoever restores finds out where to: from the line "Path=" of what was noted.
  [[nodiscard]] std::string putBackPath(const std::string& name) const {
    std::ifstream info(inTrash("info/" + name + ".trashinfo"));
    for (std::string line; std::getline(info, line);) {
      if (line.starts_with("Path=")) return line.substr(5);
    }
    return "";
  }

  /// The drive may have been quicker.
  void forget(const std::string& name) {
    const std::string info = inTrash("info/" + name + ".trashinfo");
    EXPECT_TRUE(unlink(info.c_str()) == 0 || errno == ENOENT) << name;
    EXPECT_FALSE(fs::exists(info)) << name;
  }
  /// As file managers restore.
  void restore(const std::string& name, const std::string& place) {
    ASSERT_EQ(rename(inTrash("files/" + name).c_str(), at(place).c_str()), 0) << name;
    forget(name);
  }

  std::string id_;
};

TEST_F(MountTrash, WhatAProgramTrashesIsInTheDrivesTrash) {
  trash("Plans/house plan.txt");
  EXPECT_TRUE(eventually([&] {
    return trashed() == std::vector<std::pair<std::string, std::string>>{{"house plan.txt", id_}};
  }));
  EXPECT_EQ(contentOf(inTrash("files/house plan.txt")), "four walls");
  EXPECT_EQ(putBackPath("house plan.txt"), "Plans/house%20plan.txt");
  EXPECT_TRUE(mounted_.drive().names("Plans").empty());
  // The drive brings it back where it was.
  ASSERT_EQ(mounted_.drive().json({"untrash", id_}).size(), 1U);
  EXPECT_TRUE(eventually([&] { return contentOf(at("Plans/house plan.txt")) == "four walls"; }));
  EXPECT_TRUE(eventually([&] { return !fs::exists(inTrash("info/house plan.txt.trashinfo")); }));
}

TEST_F(MountTrash, WhatIsRestoredIsTheDocumentThatItWas) {
  trash("Plans/house plan.txt");
  ASSERT_TRUE(eventually([&] { return trashed().size() == 1; }));
  restore("house plan.txt", "Plans/house plan.txt");
  EXPECT_TRUE(eventually([&] { return trashed().empty(); }));
  EXPECT_TRUE(eventually([&] {
    return mounted_.drive().names("Plans") == std::vector<std::string>{"house plan.txt"};
  }));
  EXPECT_EQ(idOf("Plans/house plan.txt"), id_);
  EXPECT_EQ(contentOf(at("Plans/house plan.txt")), "four walls");
  ASSERT_TRUE(isConfirmed("Plans/house plan.txt"));
}

TEST_F(MountTrash, WhatIsHereIsRestoredWithoutTheExtension) {
  trash("Plans/house plan.txt");
  ASSERT_TRUE(eventually([&] { return trashed().size() == 1; }));
  {
    const StoppedProcess extension(mounted_.drive().pidOf(TestDrive::Process::Extension));
    restore("house plan.txt", "Plans/house plan.txt");
  }
  EXPECT_EQ(contentOf(at("Plans/house plan.txt")), "four walls");
  EXPECT_TRUE(eventually([&] { return trashed().empty(); }));
}

TEST_F(MountTrash, WhatIsAwayIsTrashedAndRestoredWithoutBeingFetched) {
  const std::string content = someContent(100'000, 1);
  makeAway("film", content);
  goOffline();
  trash("film");
  EXPECT_TRUE(eventually([&] { return trashed().size() == 1; }));
  restore("film", "film");
  EXPECT_TRUE(eventually([&] { return trashed().empty(); }));
  EXPECT_TRUE(isAway("film"));
  goOnline();
  EXPECT_TRUE(eventually([&] { return contentOf(at("film")) == content; }));
}

TEST_F(MountTrash, WhenItIsEmptiedTheDriveHasItNoMore) {
  std::ofstream(at("Plans/second.txt")) << "no roof";
  ASSERT_TRUE(isConfirmed("Plans/second.txt"));
  trash("Plans");
  ASSERT_TRUE(eventually([&] { return trashed().size() == 1; }));
  // As a file manager empties it: file by file.
  fs::remove_all(inTrash("files/Plans"));
  forget("Plans");
  EXPECT_TRUE(eventually([&] { return trashed().empty(); }));
  EXPECT_TRUE(eventually([&] { return client_.locationOf(id_).empty(); }));
  EXPECT_TRUE(fs::is_empty(mounted_.drive().home() + "/tree/.Trash/files"));
  EXPECT_TRUE(fs::is_empty(mounted_.drive().home() + "/tree/.Trash/info"));
  EXPECT_TRUE(fs::is_directory(inTrash("files")));
}

TEST_F(MountTrash, TwoOfOneNameAreBothThereAndGoBackWhereEachWas) {
  fs::create_directory(at("Other"));
  std::ofstream(at("Other/house plan.txt")) << "a tent";
  ASSERT_TRUE(isConfirmed("Other/house plan.txt"));
  const std::string other = idOf("Other/house plan.txt");
  trash("Plans/house plan.txt");
  trash("Other/house plan.txt");
  ASSERT_TRUE(eventually([&] { return trashed().size() == 2; }));
  for (const std::string& id : {id_, other}) {
    ASSERT_EQ(mounted_.drive().json({"untrash", id}).size(), 1U);
  }
  EXPECT_TRUE(eventually([&] { return contentOf(at("Plans/house plan.txt")) == "four walls"; }));
  EXPECT_TRUE(eventually([&] { return contentOf(at("Other/house plan.txt")) == "a tent"; }));
}

}  // namespace
}  // namespace yomber::testing
