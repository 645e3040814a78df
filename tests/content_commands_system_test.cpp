// What `provide`, `evict`, `pin`, `unpin` and `get` say, for a person and for a script.
#include <filesystem>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include <fcntl.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/harness/content_client.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::SizeIs;
using ::testing::UnorderedElementsAre;
using ::testing::UnorderedElementsAreArray;
using Json = nlohmann::json;
using Local = ContentClient::Local;
using Upload = ContentClient::Upload;

constexpr int kNoSuchItem = 66;
constexpr int kTryAgain = 75;
constexpr std::uint64_t kLargestFault = 8192;
constexpr std::size_t kSize = 50'000;
constexpr const char* kPinned = "it is pinned; 'yomber unpin' lets it go";

class ContentCommands : public ::testing::Test {
 protected:
  void SetUp() override {
    drive_.up();
    client_.emplace(drive_.home());
  }
  [[nodiscard]] std::string at(const std::string& path) const { return drive_.root() + "/" + path; }
  [[nodiscard]] std::string outside(const std::string& name) const {
    return fs::path(drive_.home()).parent_path() / name;
  }
  /// A document that is here and in the store.
  void addConfirmed(const std::string& path, std::uint32_t seed) {
    drive_.write(path, someContent(kSize, seed));
    ASSERT_TRUE(eventually([&] { return client_->state(at(path)).upload == Upload::CONFIRMED; }))
        << path;
  }
  void addAway(const std::string& path, std::uint32_t seed) {
    ASSERT_NO_FATAL_FAILURE(addConfirmed(path, seed));
    ASSERT_EQ(client_->evict(at(path)), nullptr);
    ASSERT_EQ(client_->state(at(path)).local, Local::FAULT);
  }
  /// The lines of a command that fails with that code.
  [[nodiscard]] std::vector<Json> jsonOfFailure(int code,
                                                std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), "--json");
    const auto result = drive_.yomber(arguments);
    EXPECT_EQ(result.exitCode, code) << result.errors;
    std::vector<Json> lines;
    std::istringstream output(result.output);
    for (std::string line; std::getline(output, line);) lines.push_back(Json::parse(line));
    return lines;
  }

  TestDrive drive_;
  std::optional<ContentClient> client_;
};

TEST_F(ContentCommands, WhatIsEvictedIsSaidOnceAndIsAbsentAfterwards) {
  ASSERT_NO_FATAL_FAILURE(addConfirmed("x", 1));
  const auto evicted = drive_.yomber({"evict", "x"});
  EXPECT_EQ(evicted.exitCode, 0) << evicted.errors;
  EXPECT_EQ(evicted.output, "evicted  " + at("x") + "\n");
  const auto again = drive_.yomber({"evict", "x"});
  EXPECT_EQ(again.exitCode, 0) << "what is wanted is so";
  EXPECT_EQ(again.output, "absent  " + at("x") + "\n");
}

TEST_F(ContentCommands, AScriptIsToldHowMuchIsLeftOfWhatWasEvicted) {
  ASSERT_NO_FATAL_FAILURE(addConfirmed("x", 1));
  for (const char* const outcome : {"evicted", "absent"}) {
    const auto lines = drive_.json({"evict", "x"});
    ASSERT_THAT(lines, SizeIs(1));
    EXPECT_EQ(lines[0].at("outcome"), outcome);
    EXPECT_EQ(lines[0].at("location"), at("x"));
    EXPECT_EQ(lines[0].at("local_bytes"), bytesOnDisk(at("x")));
    EXPECT_LE(lines[0].at("local_bytes"), kLargestFault);
    EXPECT_FALSE(lines[0].contains("reason"));
  }
}

TEST_F(ContentCommands, WhatIsPinnedIsKeptUntilItIsUnpinned) {
  ASSERT_NO_FATAL_FAILURE(addConfirmed("x", 2));
  EXPECT_EQ(drive_.json({"pin", "x"}),
            (std::vector<Json>{{{"location", at("x")}, {"outcome", "pinned"}}}));
  const auto kept = drive_.yomber({"evict", "x"});
  EXPECT_EQ(kept.exitCode, kTryAgain);
  EXPECT_EQ(kept.output, "kept  " + at("x") + ": " + kPinned + "\n");
  const auto lines = jsonOfFailure(kTryAgain, {"evict", "x"});
  ASSERT_THAT(lines, SizeIs(1));
  EXPECT_EQ(lines[0].at("outcome"), "kept");
  EXPECT_EQ(lines[0].value("reason", ""), kPinned);
  EXPECT_GE(lines[0].at("local_bytes"), kSize);

  EXPECT_EQ(drive_.json({"unpin", "x"}),
            (std::vector<Json>{{{"location", at("x")}, {"outcome", "unpinned"}}}));
  EXPECT_EQ(drive_.json({"evict", "x"}).at(0)["outcome"], "evicted");
}

TEST_F(ContentCommands, PinsAreSaidOfEachItemAndGoOnAfterAFailure) {
  ASSERT_NO_FATAL_FAILURE(addConfirmed("x", 2));
  const auto pinned = drive_.yomber({"pin", "nothing", "x"});
  EXPECT_EQ(pinned.exitCode, kNoSuchItem);
  EXPECT_EQ(pinned.output, "pinned  " + at("x") + "\n");
  EXPECT_TRUE(client_->state(at("x")).isPinned);
  EXPECT_EQ(drive_.yomber({"unpin", "x"}).output, "unpinned  " + at("x") + "\n");
  EXPECT_FALSE(client_->state(at("x")).isPinned);
}

TEST_F(ContentCommands, WhatIsOpenForWritingIsKept) {
  ASSERT_NO_FATAL_FAILURE(addConfirmed("x", 3));
  const int writer = open(at("x").c_str(), O_RDWR | O_CLOEXEC);
  ASSERT_GE(writer, 0);
  const auto kept = drive_.yomber({"evict", "x"});
  close(writer);
  EXPECT_EQ(kept.exitCode, kTryAgain);
  EXPECT_EQ(kept.output, "kept  " + at("x") + ": it is open somewhere\n");
  EXPECT_EQ(contentOf(at("x")), someContent(kSize, 3));
}

TEST_F(ContentCommands, AFolderStandsForTheDocumentsBelowIt) {
  drive_.makeFolder("folder/inner");
  ASSERT_NO_FATAL_FAILURE(addConfirmed("folder/inner/goes", 4));
  ASSERT_NO_FATAL_FAILURE(addConfirmed("folder/stays", 5));
  ASSERT_EQ(drive_.yomber({"pin", "folder/stays"}).exitCode, 0);
  ASSERT_NO_FATAL_FAILURE(addAway("folder/away", 6));
  std::map<std::string, std::string> outcomes;
  for (const auto& line : jsonOfFailure(kTryAgain, {"evict", "folder"})) {
    outcomes[line["location"]] = line["outcome"];
  }
  using Outcome = std::pair<const std::string, std::string>;
  EXPECT_THAT(outcomes, UnorderedElementsAre(Outcome{at("folder/inner/goes"), "evicted"},
                                             Outcome{at("folder/stays"), "kept"},
                                             Outcome{at("folder/away"), "absent"}));

  std::vector<Json> here;
  for (const char* const path : {"folder/inner/goes", "folder/stays", "folder/away"}) {
    here.push_back({{"location", at(path)}, {"outcome", "here"}});
  }
  EXPECT_THAT(drive_.json({"provide", "folder"}), UnorderedElementsAreArray(here));
  EXPECT_EQ(contentOf(at("folder/inner/goes")), someContent(kSize, 4));
  EXPECT_EQ(contentOf(at("folder/away")), someContent(kSize, 6));
}

TEST_F(ContentCommands, WhatIsProvidedIsHereAlsoWhenItWasBefore) {
  ASSERT_NO_FATAL_FAILURE(addAway("x", 7));
  for (int time = 0; time < 2; ++time) {
    const auto provided = drive_.yomber({"provide", "x"});
    EXPECT_EQ(provided.exitCode, 0) << provided.errors;
    EXPECT_EQ(provided.output, "here  " + at("x") + "\n");
    EXPECT_EQ(client_->state(at("x")).local, Local::HERE);
  }
  const auto missing = drive_.yomber({"provide", "nothing", "x"});
  EXPECT_EQ(missing.exitCode, kNoSuchItem);
  EXPECT_EQ(missing.output, "here  " + at("x") + "\n") << "the others are brought all the same";
}

TEST_F(ContentCommands, WhatIsAwayIsBroughtForACopy) {
  ASSERT_NO_FATAL_FAILURE(addAway("x", 8));
  const auto got = drive_.yomber({"get", "x", outside("copy")});
  EXPECT_EQ(got.exitCode, 0) << got.errors;
  EXPECT_EQ(got.output, outside("copy") + "\n");
  EXPECT_EQ(contentOf(outside("copy")), someContent(kSize, 8));
}

TEST_F(ContentCommands, AFolderOfWhichSomeIsAwayIsCopiedWhole) {
  drive_.makeFolder("folder/inner");
  ASSERT_NO_FATAL_FAILURE(addAway("folder/inner/away", 9));
  ASSERT_NO_FATAL_FAILURE(addAway("folder/other", 10));
  ASSERT_NO_FATAL_FAILURE(addConfirmed("folder/here", 11));
  const auto got = drive_.json({"get", "folder", outside("copy")});
  ASSERT_THAT(got, SizeIs(1));
  EXPECT_EQ(got[0]["path"], outside("copy"));
  EXPECT_EQ(contentOf(outside("copy/inner/away")), someContent(kSize, 9));
  EXPECT_EQ(contentOf(outside("copy/other")), someContent(kSize, 10));
  EXPECT_EQ(contentOf(outside("copy/here")), someContent(kSize, 11));
}

}  // namespace
}  // namespace yomber::testing
