// The folders of applications, by the command line.
#include <filesystem>
#include <fstream>
#include <string>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;
using ::testing::SizeIs;

constexpr const char* kNotes = "org.example.Notes";
constexpr const char* kPlain = "org.example.Plain";
constexpr int kFailure = 1;
constexpr int kUsage = 64;

/// A drive that is up beside two applications, of which one has folders in it.
class AppFolder : public ::testing::Test {
 protected:
  void SetUp() override {
    install(kNotes, "X-Yomber-Containers=org.example.Notes;org.example.Other\n");
    install(kPlain, "");
    drive_.up();
  }

  void install(const std::string& application, const std::string& keys) const {
    const auto data = fs::path(drive_.home()).parent_path() / "data" / "applications";
    std::ofstream(data / (application + ".desktop"))
        << "[Desktop Entry]\nType=Application\nName=Notes\nExec=true\n"
        << keys;
  }
  [[nodiscard]] std::string documentsOf(const std::string& container) const {
    return drive_.home() + "/tree/" + container + "/Documents";
  }
  /// Why the command fails, as --json has it.
  [[nodiscard]] nlohmann::json failureOf(const std::string& application) const {
    const auto asked = drive_.yomber({"--json", "app-folder", application});
    return nlohmann::json::parse(asked.errors, nullptr, false)["error"];
  }

  TestDrive drive_;
};

TEST_F(AppFolder, AnApplicationsFirstContainerIsAnsweredAndMadeWhereItIsMissing) {
  const auto answered = drive_.json({"app-folder", kNotes});
  ASSERT_THAT(answered, SizeIs(1));
  EXPECT_EQ(answered[0]["kind"], "folder");
  EXPECT_EQ(answered[0].value("container", ""), kNotes);
  EXPECT_TRUE(fs::is_directory(documentsOf(kNotes)));
  EXPECT_EQ(drive_.json({"id", documentsOf(kNotes)}).at(0)["id"], answered[0]["id"]);

  fs::remove(documentsOf(kNotes));
  const auto again = drive_.json({"app-folder", kNotes});
  ASSERT_THAT(again, SizeIs(1));
  EXPECT_EQ(again[0].value("container", ""), kNotes);
  EXPECT_TRUE(fs::is_directory(documentsOf(kNotes)));
}

TEST_F(AppFolder, WhatIsPutIntoItIsTheApplications) {
  const std::string folder = drive_.json({"app-folder", kNotes}).at(0)["id"];
  const std::string file = fs::path(drive_.home()).parent_path() / "note";
  std::ofstream(file) << "text";
  ASSERT_EQ(drive_.yomber({"put", file, folder}).exitCode, 0);
  EXPECT_TRUE(fs::exists(documentsOf(kNotes) + "/note"));
}

TEST_F(AppFolder, ForAPersonItIsALineLikeThatOfAListing) {
  const std::string id = drive_.json({"app-folder", kNotes}).at(0)["id"];
  const auto shown = drive_.yomber({"app-folder", kNotes});
  EXPECT_EQ(shown.exitCode, 0) << shown.errors;
  EXPECT_THAT(shown.output, HasSubstr("folder"));
  EXPECT_THAT(shown.output, HasSubstr(id));
}

TEST_F(AppFolder, WithoutAnApplicationItIsTheDrivesOwn) {
  ASSERT_FALSE(fs::exists(drive_.root() + "/Documents"));
  const auto answered = drive_.json({"app-folder"});
  ASSERT_THAT(answered, SizeIs(1));
  EXPECT_EQ(answered[0]["name"], "Documents");
  EXPECT_TRUE(fs::is_directory(drive_.root() + "/Documents"));
  EXPECT_EQ(drive_.json({"app-folder"}).at(0)["id"], answered[0]["id"])
      << "the one that is there is the answer";
}

TEST_F(AppFolder, AnApplicationThatIsNotInstalledIsNamed) {
  const auto asked = drive_.yomber({"app-folder", "org.example.Nobody"});
  EXPECT_EQ(asked.exitCode, kUsage);
  EXPECT_EQ(asked.output, "");
  EXPECT_THAT(asked.errors, HasSubstr("no application org.example.Nobody is installed"));
  EXPECT_EQ(failureOf("org.example.Nobody")["message"],
            "no application org.example.Nobody is installed");
}

TEST_F(AppFolder, AnApplicationWithoutAFolderIsToldWhereItWouldSaySo) {
  const auto asked = drive_.yomber({"app-folder", kPlain});
  EXPECT_EQ(asked.exitCode, kFailure);
  EXPECT_EQ(asked.output, "");
  EXPECT_THAT(asked.errors, HasSubstr("org.example.Plain has no folder in the drive"));
  EXPECT_EQ(failureOf(kPlain)["domain"], "QSOstrellErrorDomain");
  EXPECT_FALSE(fs::exists(documentsOf(kPlain)));
}

}  // namespace
}  // namespace yomber::testing
