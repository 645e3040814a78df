// The trash of a whole drive: by the command line, by zarn's socket, and by other programs.
#include <algorithm>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <memory>
#include <set>
#include <thread>

#include <sys/stat.h>

#include <gtest/gtest.h>

#include "platform/ostrell/constants.h"
#include "tests/harness/content_client.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

class TrashSystem : public ::testing::Test {
 protected:
  [[nodiscard]] std::string at(const std::string& path) const { return drive_.root() + "/" + path; }
  [[nodiscard]] std::string inTrash(const std::string& name) const {
    return drive_.home() + "/tree/.Trash/files/" + name;
  }
  [[nodiscard]] std::string infoOf(const std::string& name) const {
    return drive_.home() + "/tree/.Trash/info/" + name + ".trashinfo";
  }
  [[nodiscard]] std::string idOf(const std::string& argument) const {
    const auto lines = drive_.json({"id", argument});
    return lines.empty() ? std::string() : lines.at(0).at("id").get<std::string>();
  }
  [[nodiscard]] std::size_t filesIn(const std::string& folder) const {
    const fs::directory_iterator entries(drive_.home() + "/" + folder);
    return static_cast<std::size_t>(std::distance(begin(entries), end(entries)));
  }
  /// The drive's daemon, also just after it was killed.
  [[nodiscard]] std::unique_ptr<ContentClient> client() const {
    std::unique_ptr<ContentClient> found;
    const bool isThere = eventually([&] {
      try {
        found = std::make_unique<ContentClient>(drive_.home());
      } catch (const std::exception&) {
      }
      return found != nullptr;
    });
    EXPECT_TRUE(isThere);
    return found;
  }
  void install(const std::string& application, const std::string& keys) {
    std::ofstream(fs::path(drive_.home()).parent_path() / "data/applications" /
                  (application + ".desktop"))
        << "[Desktop Entry]\nType=Application\nExec=true\n"
        << keys;
  }

  TestDrive drive_;
};

TEST_F(TrashSystem, WhatIsTrashedComesBackWhereItWas) {
  drive_.makeFolder("Plans");
  drive_.write("Plans/house.txt", "four walls");
  drive_.up();
  const std::string id = idOf("Plans/house.txt");
  const auto trashed = drive_.json({"trash", "Plans/house.txt"});
  ASSERT_EQ(trashed.size(), 1U);
  EXPECT_EQ(trashed[0]["id"], id);
  EXPECT_EQ(trashed[0]["trashed"], true);
  EXPECT_FALSE(fs::exists(at("Plans/house.txt")));
  EXPECT_EQ(drive_.json({"trash", "--list"}).at(0)["name"], "house.txt");

  const auto back = drive_.json({"untrash", "house.txt"});
  ASSERT_EQ(back.size(), 1U);
  EXPECT_EQ(back[0]["id"], id);
  EXPECT_EQ(back[0]["trashed"], false);
  EXPECT_TRUE(fs::exists(at("Plans/house.txt")));
  EXPECT_TRUE(eventually([&] { return !fs::exists(infoOf("house.txt")); }));
  EXPECT_TRUE(drive_.json({"trash", "--list"}).empty());
}

TEST_F(TrashSystem, WhatCannotGoBackGoesToItsContainersFolder) {
  install("org.example.Notes", "Name=Notes\nX-Yomber-Container=org.example.Notes\n");
  drive_.makeFolder("Plans");
  drive_.write("Plans/house.txt", "four walls");
  drive_.up();
  const std::string notes = drive_.home() + "/tree/org.example.Notes/Documents";
  ASSERT_TRUE(eventually([&] { return fs::exists(notes); }));
  fs::create_directory(notes + "/sub");
  std::ofstream(notes + "/sub/note.txt") << "a note";

  ASSERT_EQ(drive_.json({"trash", "Plans/house.txt"}).size(), 1U);
  ASSERT_EQ(drive_.json({"trash", notes + "/sub/note.txt"}).size(), 1U);
  ASSERT_EQ(drive_.yomber({"rm", "Plans"}).exitCode, 0);
  fs::remove(notes + "/sub");
  ASSERT_EQ(drive_.json({"untrash", "house.txt"}).size(), 1U);
  ASSERT_EQ(drive_.json({"untrash", "note.txt"}).size(), 1U);
  EXPECT_TRUE(fs::exists(at("house.txt")));
  EXPECT_TRUE(fs::exists(notes + "/note.txt"));
}

TEST_F(TrashSystem, ItemsComeBackWhereTheyAreWanted) {
  drive_.makeFolder("a");
  drive_.makeFolder("b");
  drive_.write("a/x");
  drive_.write("b/x", "in the way");
  drive_.up();
  ASSERT_EQ(drive_.json({"trash", "a/x"}).size(), 1U);
  ASSERT_EQ(drive_.json({"untrash", "x", "--to", "b"}).size(), 1U);
  EXPECT_TRUE(fs::exists(at("b/x 2")));
  EXPECT_FALSE(fs::exists(at("a/x")));
}

TEST_F(TrashSystem, WhatComesBackHasTheNameThatItHad) {
  const std::string longest = std::string(251, 'n') + ".txt";
  for (const char* folder : {"a", "b"}) {
    drive_.makeFolder(folder);
    drive_.write(std::string(folder) + "/x.txt", folder);
    drive_.write(std::string(folder) + "/" + longest, folder);
  }
  drive_.up();
  for (const std::string& name : {std::string("x.txt"), longest}) {
    std::vector<std::string> ids;
    for (const char* folder : {"a/", "b/"}) {
      ids.push_back(idOf(folder + name));
      ASSERT_EQ(drive_.json({"trash", folder + name}).size(), 1U) << name;
    }
    for (const std::string& id : ids) ASSERT_EQ(drive_.json({"untrash", id}).size(), 1U) << name;
    EXPECT_EQ(idOf("a/" + name), ids[0]);
    EXPECT_EQ(idOf("b/" + name), ids[1]);
  }
  EXPECT_TRUE(eventually([&] { return filesIn("tree/.Trash/info") == 0; }));
}

TEST_F(TrashSystem, EmptyingRemovesEverything) {
  drive_.makeFolder("folder/below");
  drive_.write("folder/below/x");
  drive_.write("y");
  drive_.up();
  ASSERT_EQ(drive_.json({"trash", "folder"}).size(), 1U);
  ASSERT_EQ(drive_.json({"trash", "y"}).size(), 1U);
  EXPECT_EQ(drive_.json({"trash", "--empty"}).at(0)["removed"], 4);
  EXPECT_TRUE(drive_.json({"trash", "--list"}).empty());
  EXPECT_EQ(filesIn("tree/.Trash/files"), 0U);
  EXPECT_EQ(filesIn("tree/.Trash/info"), 0U);
  EXPECT_TRUE(drive_.names().empty());
}

TEST_F(TrashSystem, WhatAFileManagerTrashesIsListedAndComesBack) {
  drive_.makeFolder("folder");
  drive_.write("folder/x", "text");
  drive_.up();
  const std::string id = idOf("folder/x");
  std::ofstream(infoOf("x")) << "[Trash Info]\nPath=folder/x\nDeletionDate=2026-01-01T10:00:00\n";
  fs::rename(at("folder/x"), inTrash("x"));
  ASSERT_TRUE(eventually([&] {
    const auto listed = drive_.json({"trash", "--list"});
    return listed.size() == 1 && listed[0]["id"] == id;
  }));
  ASSERT_EQ(drive_.json({"untrash", id}).size(), 1U);
  EXPECT_TRUE(fs::exists(at("folder/x")));
}

TEST_F(TrashSystem, MakingAFolderTwiceAnswersTheSameFolder) {
  drive_.write("file");
  drive_.up();
  const auto first = drive_.json({"mkdir", "folder"});
  const auto second = drive_.json({"mkdir", "folder"});
  ASSERT_EQ(first.size(), 1U);
  ASSERT_EQ(second.size(), 1U);
  EXPECT_EQ(first[0]["id"], second[0]["id"]);
  EXPECT_NE(drive_.yomber({"mkdir", "file"}).exitCode, 0);
  EXPECT_TRUE(fs::is_regular_file(at("file")));
}

TEST_F(TrashSystem, ThePlacesOfTheDriveStayWhereTheyAre) {
  drive_.up();
  for (const std::string& place : {drive_.root(), inTrash("."), drive_.home() + "/tree/.Promises"})
    EXPECT_NE(drive_.yomber({"trash", place}).exitCode, 0) << place;
  EXPECT_TRUE(fs::exists(drive_.root()));
}

TEST_F(TrashSystem, OfManyWhoTrashAnItemOneDoes) {
  drive_.write("x", "text");
  drive_.up();
  constexpr int kClients = 10;
  std::atomic<int> done{0};
  std::atomic<int> refused{0};
  std::vector<std::thread> threads;
  for (int i = 0; i < kClients; ++i) {
    threads.emplace_back([&] {
      const ContentClient client(drive_.home());
      const auto location = client.trash(at("x"));
      if (location.error) {
        EXPECT_TRUE(location.error->is(NSCocoaErrorDomain, NSFileNoSuchFileError))
            << location.error->description();
        ++refused;
      } else {
        EXPECT_TRUE(location.path.starts_with(inTrash("x"))) << location.path;
        ++done;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(done, 1);
  EXPECT_EQ(refused, kClients - 1);
  EXPECT_EQ(filesIn("tree/.Trash/files"), 1U);
  EXPECT_EQ(filesIn("tree/.Trash/info"), 1U);
}

// --- zarn killed half way. The fault stays armed in the one that is started again.

TEST_F(TrashSystem, KilledBeforeTheMoveLeavesTheItemWhereItIs) {
  drive_.write("x", "text");
  drive_.environment()["YOMBER_FAULTS"] = "zarn.trash.after-info=abort";
  drive_.up();
  const std::string id = client()->identifierAt(at("x"));
  ASSERT_NE(client()->trash(at("x")).error, nullptr);
  const auto again = client();
  EXPECT_EQ(again->identifierAt(at("x")), id);
  EXPECT_EQ(filesIn("tree/.Trash/files"), 0U);
  EXPECT_EQ(filesIn("tree/.Trash/info"), 0U);
}

TEST_F(TrashSystem, KilledAfterTheMoveKnowsTheWayBack) {
  drive_.write("x", "text");
  drive_.environment()["YOMBER_FAULTS"] = "zarn.trash.after-move=abort";
  drive_.up();
  const std::string id = client()->identifierAt(at("x"));
  ASSERT_NE(client()->trash(at("x")).error, nullptr);
  const auto again = client();
  EXPECT_EQ(again->identifierAt(inTrash("x")), id);
  EXPECT_EQ(again->putBackLocation(inTrash("x")).path, at("x"));
}

TEST_F(TrashSystem, KilledWhileEmptyingFinishesLater) {
  drive_.makeFolder("folder");
  drive_.write("folder/x", "text");
  drive_.environment()["YOMBER_FAULTS"] = "zarn.trash.after-emptying=abort";
  drive_.up();
  const std::string id = client()->identifierAt(at("folder/x"));
  ASSERT_EQ(client()->trash(at("folder")).error, nullptr);
  ASSERT_NE(client()->emptyTrash().error, nullptr);
  const auto again = client();
  EXPECT_TRUE(eventually([&] { return again->locationOf(id).empty(); }));
  EXPECT_TRUE(eventually([&] {
    const fs::directory_iterator entries(drive_.home() + "/private");
    return std::none_of(begin(entries), end(entries), [](const auto& entry) {
      return entry.path().filename().string().starts_with("emptied-");
    });
  }));
  EXPECT_EQ(filesIn("tree/.Trash/files"), 0U);
  EXPECT_EQ(filesIn("tree/.Trash/info"), 0U);
}

}  // namespace
}  // namespace yomber::testing
