// A drive whose record store is out of reach for a while.
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/harness/content_client.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;
using Local = ContentClient::Local;
using Upload = ContentClient::Upload;

constexpr int kTryAgain = 75;

class Offline : public ::testing::Test {
 protected:
  void SetUp() override {
    drive_.up();
    client_.emplace(drive_.home());
    drive_.write("away", someContent(50'000, 1));
    drive_.write("here", "old");
    drive_.write("trashed", "of the trash");
    for (const char* const name : {"away", "here", "trashed"}) ASSERT_TRUE(isConfirmed(name));
    ASSERT_EQ(codeOf({"evict", "away"}), 0);
    ASSERT_EQ(codeOf({"trash", "trashed"}), 0);
  }

  void takeOffline() const { std::ofstream(drive_.home() + "/store/offline").put('x'); }
  void comeBack() const { fs::remove(drive_.home() + "/store/offline"); }
  int codeOf(const std::vector<std::string>& arguments) const {
    const auto result = drive_.yomber(arguments);
    if (result.exitCode != 0) errors_ = result.errors;
    return result.exitCode;
  }
  [[nodiscard]] std::string at(const std::string& path) const { return drive_.root() + "/" + path; }
  [[nodiscard]] std::string outside(const std::string& name) const {
    return fs::path(drive_.home()).parent_path() / name;
  }
  [[nodiscard]] bool isConfirmed(const std::string& path) const {
    return eventually([&] { return client_->state(at(path)).upload == Upload::CONFIRMED; });
  }

  TestDrive drive_;
  std::optional<ContentClient> client_;
  mutable std::string errors_;  ///< of the last command that failed
};

TEST_F(Offline, EverythingOfThisMachineGoesOnAndIsInTheStoreOnceItIsBack) {
  takeOffline();
  std::ofstream(outside("new")) << "brought";
  EXPECT_EQ(codeOf({"mkdir", "folder"}), 0) << errors_;
  EXPECT_EQ(codeOf({"put", outside("new"), "/"}), 0) << errors_;
  EXPECT_EQ(codeOf({"rename", "new", "renamed"}), 0) << errors_;
  EXPECT_EQ(codeOf({"mv", "renamed", "folder"}), 0) << errors_;
  EXPECT_EQ(codeOf({"mv", "away", "folder"}), 0) << errors_;
  EXPECT_EQ(codeOf({"tag", "here", "work"}), 0) << errors_;
  EXPECT_EQ(codeOf({"trash", "here"}), 0) << errors_;
  EXPECT_EQ(codeOf({"untrash", "here"}), 0) << errors_;
  EXPECT_EQ(codeOf({"untrash", "trashed"}), 0) << errors_;
  EXPECT_EQ(codeOf({"rm", "trashed"}), 0) << errors_;
  EXPECT_EQ(drive_.names(), (std::vector<std::string>{"folder", "here"}));
  EXPECT_EQ(drive_.names("folder"), (std::vector<std::string>{"away", "renamed"}));
  EXPECT_EQ(drive_.json({"stat", "folder/renamed"}).at(0)["uploaded"], false);

  comeBack();
  for (const char* const path : {"here", "folder/renamed", "folder/away"}) {
    EXPECT_TRUE(isConfirmed(path)) << path;
  }
  // What was made offline can be given up and comes back out of the store.
  ASSERT_EQ(codeOf({"evict", "folder/renamed"}), 0) << errors_;
  EXPECT_EQ(client_->state(at("folder/renamed")).local, Local::FAULT);
  ASSERT_EQ(codeOf({"provide", "folder"}), 0) << errors_;
  EXPECT_EQ(contentOf(at("folder/renamed")), "brought");
  EXPECT_EQ(contentOf(at("folder/away")), someContent(50'000, 1));
  EXPECT_EQ(drive_.json({"stat", "here"}).at(0)["tags"], nlohmann::json({"work"}));
}

TEST_F(Offline, WhatIsAwayIsNotToBeHadForNow) {
  takeOffline();
  const auto provided = drive_.yomber({"provide", "away"});
  EXPECT_EQ(provided.exitCode, kTryAgain);
  EXPECT_EQ(provided.output, "");
  EXPECT_THAT(provided.errors, HasSubstr("out of reach"));
  const auto asJson = drive_.yomber({"--json", "provide", "away"});
  EXPECT_EQ(asJson.exitCode, kTryAgain);
  EXPECT_THAT(nlohmann::json::parse(asJson.errors)["error"]["message"].get<std::string>(),
              HasSubstr("out of reach"));

  EXPECT_EQ(codeOf({"get", "away", outside("copy")}), kTryAgain);
  EXPECT_FALSE(fs::exists(outside("copy"))) << "no half of a copy";
  EXPECT_EQ(codeOf({"provide", "here"}), 0) << "what is here needs no store";

  comeBack();
  EXPECT_TRUE(eventually([&] { return codeOf({"provide", "away"}) == 0; })) << errors_;
  EXPECT_EQ(contentOf(at("away")), someContent(50'000, 1));
}

TEST_F(Offline, WhatTheStoreHasNotGotIsKept) {
  takeOffline();
  drive_.write("fresh", someContent(50'000, 2));
  ASSERT_TRUE(eventually([&] { return codeOf({"id", "fresh"}) == 0; }));
  const auto kept = drive_.yomber({"evict", "fresh"});
  EXPECT_EQ(kept.exitCode, kTryAgain);
  EXPECT_EQ(kept.output, "kept  " + at("fresh") + ": it is not uploaded yet\n");
  EXPECT_EQ(contentOf(at("fresh")), someContent(50'000, 2));

  comeBack();
  ASSERT_TRUE(isConfirmed("fresh"));
  EXPECT_EQ(codeOf({"evict", "fresh"}), 0) << errors_;
}

TEST_F(Offline, WhatIsInAStoreOutOfReachIsKeptToo) {
  takeOffline();
  const auto kept = drive_.yomber({"evict", "here"});
  EXPECT_EQ(kept.exitCode, kTryAgain);
  EXPECT_THAT(kept.output, HasSubstr("kept  " + at("here") + ": "));
  EXPECT_THAT(kept.output, HasSubstr("out of reach"));
  EXPECT_EQ(client_->state(at("here")).local, Local::HERE);
}

}  // namespace
}  // namespace yomber::testing
