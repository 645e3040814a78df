#include <algorithm>
#include <array>
#include <chrono>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <sys/stat.h>
#include <sys/xattr.h>

#include <gtest/gtest.h>

#include "tests/harness/child_process.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using Names = std::vector<std::string>;

/// To the second, as dates are printed.
std::string nowUtc() {
  const std::time_t now = std::time(nullptr);
  std::tm parts{};
  gmtime_r(&now, &parts);
  std::array<char, 32> text{};
  return {text.data(), std::strftime(text.data(), text.size(), "%Y-%m-%dT%H:%M:%S", &parts)};
}

/// A drive that is up, and a folder of this machine beside it.
class Commands : public ::testing::Test {
 protected:
  Commands() { fs::create_directory(outside()); }
  void SetUp() override { drive_.up(); }

  [[nodiscard]] std::string outside() const {
    return fs::path(drive_.home()).parent_path() / "outside";
  }
  [[nodiscard]] std::string outside(const std::string& name) const {
    return outside() + "/" + name;
  }
  [[nodiscard]] std::string inside(const std::string& name) const {
    return drive_.root() + "/" + name;
  }
  static void write(const std::string& path, const std::string& content) {
    std::ofstream(path, std::ios::binary) << content;
  }
  static std::string read(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  /// Makes a file behind the drive's back, and waits until the drive has seen it.
  void add(const std::string& name, const std::string& content = "") const {
    drive_.write(name, content);
    waitUntilSeen(name);
  }
  void waitUntilSeen(const std::string& name) const {
    const auto deadline = std::chrono::steady_clock::now() + patience;
    while (codeOf({"id", name}) != 0) {
      ASSERT_LT(std::chrono::steady_clock::now(), deadline) << name << " was never seen";
    }
  }
  int codeOf(const Names& arguments) const { return drive_.yomber(arguments).exitCode; }

  TestDrive drive_;
};

TEST_F(Commands, WhatIsPutIsThereAsItWas) {
  fs::create_directories(outside("folder/inner"));
  write(outside("folder/inner/file"), "deep");
  write(outside("file"), "content");
  fs::create_symlink("file", outside("link"));
  ASSERT_EQ(setxattr(outside("file").c_str(), "user.comment", "mine", 4, 0), 0);
  const auto put = drive_.json({"put", outside("file"), outside("folder"), outside("link"), "/"});
  EXPECT_EQ(put.size(), 3U);
  EXPECT_EQ(drive_.names(), (Names{"file", "folder", "link"}));
  EXPECT_EQ(read(inside("file")), "content");
  EXPECT_EQ(read(inside("folder/inner/file")), "deep");
  EXPECT_EQ(fs::read_symlink(inside("link")), "file");
  EXPECT_TRUE(fs::exists(outside("file"))) << "a copy leaves what it was made of";
  EXPECT_EQ(codeOf({"put", outside("nothing")}), 66);
}

TEST_F(Commands, WhatIsPutUnderAFreeNameIsCopiedOnceHoweverManyAreTaken) {
  write(outside("report.pdf"), "new");
  for (const char* name : {"report.pdf", "report 2.pdf", "report 3.pdf"}) add(name, "old");
  const std::string gate = outside("go");
  Environment environment = drive_.environment();
  environment["YOMBER_FAULTS"] = "yomber.put.copied=pause-until-file:" + gate;
  LineProcess put({programPath("yomber"), "put", outside("report.pdf"), "--keep-both"},
                  environment);
  EXPECT_TRUE(eventually([&] { return fs::exists(gate + ".reached"); }));
  write(outside("report.pdf"), "changed meanwhile");
  write(gate, "");
  EXPECT_EQ(put.waitForEnd(), 0);
  EXPECT_EQ(read(inside("report 4.pdf")), "new");
}

TEST_F(Commands, ATakenNameIsAClashUntilTheUserSaysWhatToDo) {
  write(outside("report.pdf"), "new");
  add("report.pdf", "old");
  EXPECT_EQ(codeOf({"put", outside("report.pdf")}), 17);
  EXPECT_EQ(read(inside("report.pdf")), "old");

  const auto both = drive_.json({"put", outside("report.pdf"), "--keep-both"});
  EXPECT_EQ(both.at(0)["name"], "report 2.pdf");
  EXPECT_EQ(read(inside("report 2.pdf")), "new");

  const auto replaced = drive_.json({"put", outside("report.pdf"), "--replace"});
  EXPECT_EQ(replaced.at(0)["name"], "report.pdf");
  EXPECT_EQ(read(inside("report.pdf")), "new");
  EXPECT_EQ(drive_.json({"trash", "--list"}).at(0)["name"], "report.pdf")
      << "what was replaced is not lost";
}

TEST_F(Commands, RenamesAndMovesKnowClashesToo) {
  ASSERT_EQ(codeOf({"mkdir", "a", "b"}), 0);
  add("a/x", "1");
  add("a/y", "2");
  add("b/x", "3");
  EXPECT_EQ(codeOf({"rename", "a/x", "y"}), 17);
  EXPECT_EQ(codeOf({"mv", "a/x", "b"}), 17);
  EXPECT_EQ(drive_.json({"rename", "a/x", "y", "--keep-both"}).at(0)["name"], "y 2");
  EXPECT_EQ(drive_.json({"mv", "a/y 2", "b", "--as", "x", "--keep-both"}).at(0)["name"], "x 2");
  EXPECT_EQ(drive_.json({"mv", "a/y", "b", "--as", "x", "--replace"}).at(0)["name"], "x");
  EXPECT_EQ(read(inside("b/x")), "2");
  EXPECT_EQ(read(inside("b/x 2")), "1");
  EXPECT_EQ(drive_.names("a"), Names{});
}

TEST_F(Commands, FoldersAreMadeOnceAndWithThoseAbove) {
  const auto made = drive_.json({"mkdir", "one/two/three", "--parents"});
  EXPECT_EQ(made.at(0)["name"], "three");
  EXPECT_EQ(drive_.json({"mkdir", "one/two/three"}).at(0)["id"], made.at(0)["id"])
      << "a folder that exists is the answer";
  EXPECT_EQ(codeOf({"mkdir", "no/such"}), 66);
  add("file");
  EXPECT_EQ(codeOf({"mkdir", "file"}), 17);
  EXPECT_EQ(codeOf({"mkdir", "one/" + std::string(256, 'n')}), 1);
}

TEST_F(Commands, WhatIsRemovedIsGoneAndTheRootNeverIs) {
  ASSERT_EQ(codeOf({"mkdir", "many/inner", "-p"}), 0);
  add("many/inner/file");
  EXPECT_EQ(codeOf({"rm", "many"}), 0);
  EXPECT_FALSE(fs::exists(inside("many")));
  EXPECT_EQ(codeOf({"rm", "many"}), 66);
  for (const char* const command : {"rm", "trash"})
    EXPECT_EQ(codeOf({command, "/"}), 13) << command;
  EXPECT_EQ(codeOf({"rename", "/", "name"}), 13);
  EXPECT_TRUE(fs::exists(drive_.root()));
}

TEST_F(Commands, WhatIsGotIsAWholeCopyOutsideOfTheDrive) {
  ASSERT_EQ(codeOf({"mkdir", "folder/inner", "-p"}), 0);
  add("folder/inner/file", "content");
  fs::create_symlink("inner/file", inside("folder/link"));
  waitUntilSeen("folder/link");
  const auto got = drive_.json({"get", "folder", outside()});
  EXPECT_EQ(got.at(0)["path"], outside("folder"));
  EXPECT_EQ(read(outside("folder/inner/file")), "content");
  EXPECT_EQ(fs::read_symlink(outside("folder/link")), "inner/file");
  EXPECT_EQ(getxattr(outside("folder/inner/file").c_str(), "user.yomber.id", nullptr, 0), -1)
      << "the copy is no item of the drive";

  EXPECT_EQ(codeOf({"get", "folder", outside()}), 17);
  EXPECT_EQ(drive_.json({"get", "folder", outside(), "--keep-both"}).at(0)["path"],
            outside("folder 2"));
  write(inside("folder/inner/file"), "newer");
  EXPECT_EQ(codeOf({"get", "folder", outside(), "--replace"}), 0);
  EXPECT_EQ(read(outside("folder/inner/file")), "newer");
  EXPECT_EQ(drive_.json({"get", "folder/inner/file", outside("copy")}).at(0)["path"],
            outside("copy"));
  EXPECT_EQ(fs::directory_iterator(outside()) == fs::directory_iterator(), false);
  for (const auto& entry : fs::directory_iterator(outside())) {
    EXPECT_NE(entry.path().filename().string().front(), '.') << entry.path();
  }
}

TEST_F(Commands, MarksAreSetShownAndTakenAway) {
  add("file");
  const auto tags = [&](Names arguments) {
    arguments.insert(arguments.begin(), {"tag", "file"});
    return drive_.json(arguments).at(0)["tags"];
  };
  EXPECT_EQ(tags({"red", "two words"}), nlohmann::json({"red", "two words"}));
  EXPECT_EQ(tags({"blue", "red", "--add"}), nlohmann::json({"red", "two words", "blue"}));
  EXPECT_EQ(tags({"red", "--remove"}), nlohmann::json({"two words", "blue"}));
  EXPECT_EQ(tags({}), nlohmann::json({"two words", "blue"}));
  EXPECT_EQ(tags({"--clear"}), nlohmann::json::array());
  EXPECT_EQ(drive_.json({"favorite", "file", "7"}).at(0)["favorite_rank"], 7);
  EXPECT_FALSE(drive_.json({"favorite", "file", "--clear"}).at(0).contains("favorite_rank"));
  EXPECT_EQ(drive_.json({"used", "file", "--at", "2026-03-01T12:00:00Z"}).at(0)["last_used"],
            "2026-03-01T12:00:00Z");
  EXPECT_EQ(codeOf({"used", "file", "--at", "yesterday"}), 64);
}

TEST_F(Commands, WithoutADateAnItemHasBeenUsedNowAndClearedItNeverWas) {
  add("file");
  const auto dateOf = [](const nlohmann::json& item) {
    return item.at("last_used").get<std::string>().substr(0, nowUtc().size());
  };
  const std::string before = nowUtc();
  const auto used = drive_.json({"used", "file"}).at(0);
  EXPECT_GE(dateOf(used), before);
  EXPECT_LE(dateOf(used), nowUtc());
  EXPECT_EQ(drive_.json({"stat", "file"}).at(0)["last_used"], used["last_used"]);
  EXPECT_FALSE(drive_.json({"used", "file", "--clear"}).at(0).contains("last_used"));
  EXPECT_FALSE(drive_.json({"stat", "file"}).at(0).contains("last_used"));
}

TEST_F(Commands, WithToEveryArgumentIsAnItem) {
  ASSERT_EQ(codeOf({"mkdir", "a", "b"}), 0);
  add("x");
  const auto moved = drive_.json({"mv", "x", "a", "--to", "b"});
  ASSERT_EQ(moved.size(), 2U);
  EXPECT_EQ(drive_.names(), Names{"b"});
  EXPECT_EQ(drive_.names("b"), (Names{"a", "x"}));
  EXPECT_EQ(codeOf({"mv", "b/x", "--to", "/"}), 0) << "one item is enough";
  EXPECT_EQ(drive_.names(), (Names{"b", "x"}));
  EXPECT_EQ(codeOf({"mv", "x", "--to", "nowhere"}), 66);
}

TEST_F(Commands, AScriptIsToldOfEachThatIsRemovedAndOfWhatIsNot) {
  add("x");
  add("y");
  const auto removed = drive_.yomber({"--json", "rm", "x", "nothing", "y"});
  EXPECT_EQ(removed.exitCode, 66);
  EXPECT_EQ(removed.output, "{\"done\":true}\n{\"done\":true}\n");
  EXPECT_TRUE(nlohmann::json::parse(removed.errors).at("error").contains("message"));
  EXPECT_FALSE(fs::exists(inside("x")));
  EXPECT_FALSE(fs::exists(inside("y")));
}

TEST_F(Commands, ChangesAreToldSinceTheLastTime) {
  add("file");
  ASSERT_EQ(codeOf({"favorite", "file"}), 0);
  // Its upload is a change as well.
  ASSERT_TRUE(eventually([&] { return drive_.json({"stat", "file"}).at(0)["uploaded"] == true; }));
  const auto first = drive_.json({"changes"});
  ASSERT_EQ(first.size(), 2U);
  EXPECT_EQ(first[0]["item"]["name"], "file");
  const std::string token = first[1]["token"];
  EXPECT_EQ(drive_.json({"changes", "--since", token}).size(), 1U);
  ASSERT_EQ(codeOf({"rm", "file"}), 0);
  std::vector<nlohmann::json> later;
  ASSERT_TRUE(eventually([&] {
    later = drive_.json({"changes", "--since", token});
    return later.size() == 2;
  }));
  EXPECT_EQ(later[0]["event"], "removed");
  EXPECT_EQ(later[0]["id"], first[0]["item"]["id"]);
  EXPECT_EQ(codeOf({"changes", "--since", "nonsense"}), 64);
}

TEST_F(Commands, AManyHandedPutLosesNothing) {
  Names arguments{"put"};
  for (int number = 0; number < 100; ++number) {
    const std::string name = "file " + std::to_string(number);
    write(outside(name), name);
    arguments.push_back(outside(name));
  }
  arguments.insert(arguments.end(), {"--to", "/"});
  EXPECT_EQ(drive_.json(arguments).size(), 100U);
  EXPECT_EQ(drive_.names().size(), 100U);
  for (const std::string& name : drive_.names()) EXPECT_EQ(read(inside(name)), name);
}

TEST_F(Commands, ADriveThatIsDownSaysSo) {
  drive_.down();
  write(outside("file"), "x");
  for (const Names& arguments :
       {Names{"put", outside("file")}, Names{"mkdir", "a"}, Names{"evict", "a"}, Names{"tag", "a"},
        Names{"changes"}, Names{"trash", "--empty"}, Names{"get", "a"}}) {
    EXPECT_EQ(codeOf(arguments), 69) << arguments.front();
  }
}

}  // namespace
}  // namespace yomber::testing
