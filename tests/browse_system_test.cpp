#include <algorithm>
#include <filesystem>
#include <set>

#include <sys/stat.h>
#include <sys/xattr.h>

#include <gtest/gtest.h>

#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

class Browse : public ::testing::Test {
 protected:
  TestDrive drive_;
};

TEST_F(Browse, AnEmptyDriveListsNothing) {
  drive_.up();
  EXPECT_TRUE(drive_.names().empty());
}

TEST_F(Browse, NamesComeInNaturalOrderWithNumbersAsNumbers) {
  for (const char* name : {"file 10", "file 9", "File 1", "apple", "Übung", "zebra"})
    drive_.write(name);
  drive_.up();
  const std::vector<std::string> expected{"apple", "File 1", "file 9", "file 10", "Übung", "zebra"};
  EXPECT_EQ(drive_.names(), expected);
}

TEST_F(Browse, ByDateTheNewestComesFirst) {
  int age = 0;
  for (const char* name : {"newest", "newer", "old"}) {
    drive_.write(name);
    fs::last_write_time(drive_.root() + "/" + name,
                        fs::file_time_type::clock::now() - std::chrono::hours(age++));
  }
  drive_.up();
  EXPECT_EQ(drive_.names("/", "date"), (std::vector<std::string>{"newest", "newer", "old"}));
}

TEST_F(Browse, AListingOfManyPagesHoldsEveryNameOnce) {
  std::set<std::string> expected;
  for (int number = 0; number < 1001; ++number) {
    expected.insert("n" + std::to_string(number));
    drive_.write("n" + std::to_string(number));
  }
  drive_.up();
  for (const char* order : {"name", "date"}) {
    const std::vector<std::string> names = drive_.names("/", order);
    EXPECT_EQ(names.size(), expected.size()) << order;
    EXPECT_EQ(std::set<std::string>(names.begin(), names.end()), expected) << order;
  }
}

TEST_F(Browse, AnItemIsFoundBothWays) {
  drive_.makeFolder("Plans");
  drive_.write("Plans/house.txt", "four walls");
  drive_.up();
  const nlohmann::json found = drive_.json({"id", "Plans/house.txt"}).at(0);
  const std::string identifier = found["id"];
  EXPECT_TRUE(identifier.starts_with("d:"));
  EXPECT_EQ(drive_.json({"url", identifier}).at(0)["location"], drive_.root() + "/Plans/house.txt");
  const nlohmann::json item = drive_.json({"stat", identifier}).at(0);
  EXPECT_EQ(item["name"], "house.txt");
  EXPECT_EQ(item["size"], 10);
  EXPECT_EQ(item["parent"], drive_.json({"id", "Plans"}).at(0)["id"]);
}

TEST_F(Browse, ABookmarkLeadsToItsTarget) {
  drive_.makeFolder("Plans");
  drive_.write("Plans/house.txt", "four walls");
  fs::create_symlink("Plans/house.txt", drive_.root() + "/bookmark");
  drive_.up();
  EXPECT_EQ(drive_.json({"url", "bookmark"}).at(0)["location"], drive_.root() + "/Plans/house.txt");
}

TEST_F(Browse, SymbolicLinkLoopsAreListedAndFollowedByNobody) {
  fs::create_symlink("b", drive_.root() + "/a");
  fs::create_symlink("a", drive_.root() + "/b");
  fs::create_directory_symlink(".", drive_.root() + "/self");
  drive_.up();
  EXPECT_EQ(drive_.names(), (std::vector<std::string>{"a", "b", "self"}));
  // Each is an item, but what it leads to is none.
  for (const char* name : {"a", "b"}) {
    const ProcessResult found = drive_.yomber({"id", name});
    EXPECT_EQ(found.exitCode, 0) << name << found.errors;
    const std::string identifier = found.output.substr(0, found.output.find('\n'));
    for (const std::string& item : {std::string(name), identifier}) {
      EXPECT_EQ(drive_.yomber({"url", item}).exitCode, 66) << item;
      EXPECT_EQ(drive_.yomber({"stat", item}).exitCode, 66) << item;
    }
  }
  // The other leads to the root, and below it by its own name there is nothing.
  const std::string self = drive_.json({"id", "self"}).at(0)["id"];
  EXPECT_TRUE(self.starts_with("d:")) << self;
  for (const std::string& item : {std::string("self"), self}) {
    EXPECT_EQ(drive_.json({"url", item}).at(0)["location"], drive_.root());
    EXPECT_EQ(drive_.json({"stat", item}).at(0)["id"], drive_.json({"id", "/"}).at(0)["id"]);
  }
  EXPECT_EQ(drive_.yomber({"id", "self/self/a"}).exitCode, 66);
}

TEST_F(Browse, EveryFolderOfTheDriveIsInTheListOfFolders) {
  drive_.makeFolder("one/two/three");
  drive_.up();
  std::set<std::string> names;
  for (const nlohmann::json& folder : drive_.json({"folders"})) names.insert(folder.at("name"));
  for (const char* name : {"one", "two", "three"}) EXPECT_TRUE(names.contains(name)) << name;
}

TEST_F(Browse, AnUnknownItemIsSaidToBeUnknown) {
  drive_.up();
  EXPECT_EQ(drive_.yomber({"stat", "d:424242"}).exitCode, 66);
  EXPECT_EQ(drive_.yomber({"stat", "no/such/file"}).exitCode, 66);
  EXPECT_EQ(drive_.yomber({"ls", "i:424242"}).exitCode, 66);
}

TEST_F(Browse, WhatIsNoFolderCannotBeWatched) {
  drive_.write("document");
  drive_.up();
  const std::string identifier = drive_.json({"id", "document"}).at(0)["id"];
  for (const std::string& item : {std::string("document"), identifier}) {
    const ProcessResult watch = drive_.yomber({"watch", item});
    EXPECT_EQ(watch.exitCode, 66) << item << watch.output << watch.errors;
  }
}

TEST_F(Browse, AWatchEndsWhenItsFolderIsRemoved) {
  drive_.makeFolder("folder");
  drive_.write("folder/document");
  drive_.up();
  LineProcess watch(drive_.commandLine({"--json", "watch", "--list", "folder"}),
                    drive_.environment());
  const auto tells = [&](const std::string& event) {
    return watch.readUntil(
        [&](const std::string& line) { return nlohmann::json::parse(line)["event"] == event; });
  };
  ASSERT_TRUE(tells("present"));
  fs::remove_all(drive_.root() + "/folder");
  EXPECT_TRUE(tells("removed"));
  EXPECT_EQ(watch.waitForEnd(), 66);
}

TEST_F(Browse, WhatIsNoUtf8InAnErrorOrATagIsPrintedAllTheSame) {
  drive_.write("tagged");
  ASSERT_EQ(setxattr((drive_.root() + "/tagged").c_str(), "user.xdg.tags", "\xff", 1, 0), 0);
  drive_.up();
  const ProcessResult missing = drive_.yomber({"--json", "stat", "bad\xff"});
  EXPECT_EQ(missing.exitCode, 66) << missing.errors;
  EXPECT_TRUE(nlohmann::json::parse(missing.errors)["error"].contains("message"));
  EXPECT_EQ(drive_.json({"stat", "tagged"}).at(0)["tags"].size(), 1U);
  const ProcessResult shown = drive_.yomber({"stat", "tagged"});
  EXPECT_EQ(shown.exitCode, 0) << shown.errors;
  EXPECT_NE(shown.output.find("tags"), std::string::npos) << shown.output;
}

TEST_F(Browse, ATerminalActsOnNothingThatAFailureCites) {
  drive_.up();
  const std::string odd = "\x1b[31mx";
  // No such item, and an argument too many.
  const std::vector<std::vector<std::string>> commands{{"stat", odd}, {"stat", "/", odd}};
  for (const auto& command : commands) {
    const ProcessResult refused = drive_.yomber(command);
    EXPECT_NE(refused.exitCode, 0);
    EXPECT_EQ(refused.errors.find('\x1b'), std::string::npos);
    EXPECT_NE(refused.errors.find("\\x1b[31mx"), std::string::npos) << refused.errors;
  }
}

TEST_F(Browse, WatchingAFolderThatIsNotThereEndsAndSaysSo) {
  drive_.up();
  const ProcessResult watch = drive_.yomber({"watch", "i:424242"});
  EXPECT_EQ(watch.exitCode, 66) << watch.output << watch.errors;
  EXPECT_NE(watch.errors.find("yomber: "), std::string::npos) << watch.errors;
}

TEST_F(Browse, LocationsOutsideTheDriveHaveNoItem) {
  drive_.up();
  EXPECT_NE(drive_.yomber({"id", "../../../../etc/passwd"}).exitCode, 0);
}

TEST_F(Browse, SignedOutNothingIsListedAndSigningInGoesOn) {
  drive_.write("kept");
  drive_.makeFolder("folder");
  drive_.up();
  const std::string folder = drive_.json({"id", "folder"}).at(0)["id"];
  ASSERT_EQ(drive_.yomber({"account", "sign-out"}).exitCode, 0);
  const std::vector<std::vector<std::string>> commands{
      {"ls"},           {"ls", "folder"}, {"ls", folder},           {"stat", "kept"},
      {"stat", folder}, {"id", "kept"},   {"ls", "no such folder"}, {"working-set"}};
  for (const auto& command : commands) {
    const ProcessResult refused = drive_.yomber(command);
    EXPECT_EQ(refused.exitCode, 77) << command.back() << refused.output << refused.errors;
  }
  EXPECT_TRUE(fs::exists(drive_.root() + "/kept"));
  drive_.signIn();
  EXPECT_EQ(drive_.names(), (std::vector<std::string>{"folder", "kept"}));
  EXPECT_EQ(drive_.yomber({"ls", "no such folder"}).exitCode, 66);
}

TEST_F(Browse, IdentifiersSurviveARestart) {
  drive_.write("kept");
  drive_.up();
  const std::string before = drive_.json({"id", "kept"}).at(0)["id"];
  drive_.down();
  fs::rename(drive_.root() + "/kept", drive_.root() + "/renamed while down");
  drive_.up();
  EXPECT_EQ(drive_.json({"id", "renamed while down"}).at(0)["id"], before);
}

TEST_F(Browse, ATaggedItemIsInTheWorkingSet) {
  drive_.write("plain");
  drive_.write("tagged");
  ASSERT_EQ(setxattr((drive_.root() + "/tagged").c_str(), "user.xdg.tags", "red", 3, 0), 0);
  drive_.up();
  const auto members = drive_.json({"working-set"});
  ASSERT_FALSE(members.empty());
  // One that changes while it is listed, as when its upload is confirmed, is told of once more.
  for (const auto& member : members) EXPECT_EQ(member["item"]["name"], "tagged");
}

TEST_F(Browse, TheDriveCanBeTakenDownTwiceAndUpTwice) {
  drive_.up();
  EXPECT_EQ(drive_.yomber({"up"}).exitCode, 0);
  EXPECT_EQ(drive_.yomber({"down"}).exitCode, 0);
  EXPECT_EQ(drive_.yomber({"down"}).exitCode, 0);
  EXPECT_EQ(drive_.yomber({"ls"}).exitCode, 69);
  drive_.up();
}

}  // namespace
}  // namespace yomber::testing
