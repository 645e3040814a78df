// Sharing between the drives of two accounts, by the command line.
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/foundation/temporary_directory.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

using ::testing::AllOf;
using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::SizeIs;

constexpr int kNotPermitted = 13;
constexpr int kNoSuchItem = 66;
constexpr int kUsage = 64;

/// Two drives, each up with an account of its own, on one store.
class ShareCommands : public ::testing::Test {
 protected:
  void SetUp() override {
    ann_.setAccount("ann");
    bob_.setAccount("bob");
    for (TestDrive* const drive : {&ann_, &bob_}) drive->setStore(store_ / "store");
    ann_.write("report.txt", "first");
    ann_.makeFolder("Plans");
    ann_.write("Plans/one.txt", "one");
    ann_.up();
    bob_.up();
    ASSERT_TRUE(
        eventually([&] { return isUploaded("report.txt") && isUploaded("Plans/one.txt"); }));
  }

  [[nodiscard]] bool isUploaded(const std::string& item) const {
    const ProcessResult stat = ann_.yomber({"--json", "stat", item});
    return stat.exitCode == 0 && nlohmann::json::parse(stat.output).value("uploaded", false);
  }
  [[nodiscard]] nlohmann::json info(const TestDrive& drive, const std::string& item) const {
    const auto lines = drive.json({"share", "info", item});
    return lines.empty() ? nlohmann::json() : lines.front();
  }
  [[nodiscard]] std::string linkOf(const std::string& item) const {
    const auto lines = ann_.json({"share", "link", item});
    return lines.empty() ? std::string() : lines.front().value("url", "");
  }
  /// The item's identifier in Bob's drive.
  [[nodiscard]] std::string acceptedByBob(const std::string& link) const {
    const auto lines = bob_.json({"share", "accept", link});
    return lines.empty() ? std::string() : lines.front().value("id", "");
  }
  [[nodiscard]] std::string got(const TestDrive& drive, const std::string& item) const {
    const std::string path = store_ / "got";
    const ProcessResult result = drive.yomber({"get", item, path, "--replace"});
    return result.exitCode == 0 ? contentOf(path) : result.errors;
  }

  TemporaryDirectory store_;
  TestDrive ann_;
  TestDrive bob_;
};

TEST_F(ShareCommands, AnItemThatNobodySharedIsNotShared) {
  EXPECT_EQ(ann_.yomber({"share", "info", "report.txt"}).output, "not shared\n");
  EXPECT_FALSE(info(ann_, "report.txt")["shared"].get<bool>());
  EXPECT_THAT(bob_.json({"share", "list"}), SizeIs(0));
}

TEST_F(ShareCommands, ADocumentIsSharedReadWrittenAndSharedNoMore) {
  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "bob", "--role", "editor"}).exitCode, 0);
  const auto shared = info(ann_, "report.txt");
  EXPECT_EQ(shared["owner"], "ann");
  EXPECT_EQ(shared["type"], "document");
  EXPECT_EQ(shared["participants"][1]["name"], "bob");
  EXPECT_EQ(shared["participants"][1]["status"], "pending");
  ASSERT_NE(acceptedByBob(linkOf("report.txt")), "");
  EXPECT_EQ(info(ann_, "report.txt")["participants"][1]["status"], "accepted");
  EXPECT_EQ(got(bob_, "report.txt"), "first");
  EXPECT_TRUE(bob_.json({"stat", "report.txt"}).front()["shared"].get<bool>());
  ASSERT_THAT(bob_.json({"share", "list"}), SizeIs(1));

  bob_.write("report.txt", "second");
  EXPECT_TRUE(eventually([&] { return got(ann_, "report.txt") == "second"; }));

  ASSERT_EQ(ann_.yomber({"share", "stop", "report.txt"}).exitCode, 0);
  EXPECT_TRUE(eventually([&] { return bob_.names() == std::vector<std::string>(); }));
  EXPECT_EQ(got(ann_, "report.txt"), "second");
  EXPECT_FALSE(info(ann_, "report.txt")["shared"].get<bool>());
}

TEST_F(ShareCommands, AFolderIsSharedWithAllThatIsAndComesIntoIt) {
  ASSERT_EQ(ann_.yomber({"share", "add", "Plans", "bob"}).exitCode, 0);
  const std::string identifier = acceptedByBob(linkOf("Plans"));
  EXPECT_THAT(identifier, ::testing::StartsWith("i:"));
  EXPECT_TRUE(eventually([&] { return got(bob_, "Plans/one.txt") == "one"; }));
  ann_.write("Plans/two.txt", "two");
  EXPECT_TRUE(eventually([&] { return got(bob_, "Plans/two.txt") == "two"; }));
  const auto state = bob_.json({"collab", "state", "Plans/one.txt"});
  ASSERT_THAT(state, SizeIs(1));
  EXPECT_TRUE(state.front()["in_shared_folder"].get<bool>());
  EXPECT_EQ(state.front()["folder"], "Plans");
  const ProcessResult inner = ann_.yomber({"share", "add", "Plans/one.txt", "eve"});
  EXPECT_NE(inner.exitCode, 0);
  EXPECT_THAT(inner.errors, HasSubstr("name that folder"));
}

TEST_F(ShareCommands, ALinkIsForEverybodyOnlyWhenItsOwnerSaysSo) {
  const std::string link = linkOf("report.txt");
  const ProcessResult refused = bob_.yomber({"share", "accept", link});
  EXPECT_EQ(refused.exitCode, kNotPermitted) << refused.errors;
  ASSERT_EQ(ann_.yomber({"share", "permission", "report.txt", "viewer"}).exitCode, 0);
  EXPECT_NE(acceptedByBob(link), "");
  EXPECT_TRUE(info(ann_, "report.txt")["participants"][1]["link"].get<bool>());
}

TEST_F(ShareCommands, ASharedFolderHasItsServicesOnBothSides) {
  ASSERT_EQ(ann_.yomber({"share", "add", "Plans", "bob"}).exitCode, 0);
  ASSERT_NE(acceptedByBob(linkOf("Plans")), "");
  const auto seen = info(bob_, "Plans");
  EXPECT_EQ(seen["owner"], "ann");
  EXPECT_EQ(seen["type"], "folder");
  const auto people = bob_.json({"share", "participants", "Plans"});
  ASSERT_THAT(people, SizeIs(2));
  EXPECT_EQ(people[1]["name"], "bob");
  EXPECT_EQ(people[1]["status"], "accepted");

  ASSERT_EQ(bob_.yomber({"share", "stop", "Plans"}).exitCode, 0);
  EXPECT_TRUE(eventually([&] { return bob_.names().empty(); }));
  EXPECT_EQ(got(ann_, "Plans/one.txt"), "one");
  ASSERT_TRUE(info(ann_, "Plans")["shared"].get<bool>());
  ASSERT_EQ(ann_.yomber({"share", "stop", "Plans"}).exitCode, 0);
  EXPECT_FALSE(info(ann_, "Plans")["shared"].get<bool>());
}

TEST_F(ShareCommands, AViewerChangesNothingUntilTheOwnerLetsHim) {
  ASSERT_EQ(ann_.yomber({"share", "add", "Plans", "bob", "--role", "viewer"}).exitCode, 0);
  ASSERT_NE(acceptedByBob(linkOf("Plans")), "");
  ASSERT_TRUE(eventually([&] { return got(bob_, "Plans/one.txt") == "one"; }));
  const ProcessResult renamed = bob_.yomber({"rename", "Plans/one.txt", "mine.txt"});
  EXPECT_EQ(renamed.exitCode, kNotPermitted);
  EXPECT_THAT(renamed.errors, HasSubstr("one.txt"));
  EXPECT_EQ(bob_.yomber({"trash", "Plans/one.txt"}).exitCode, kNotPermitted);
  EXPECT_EQ(bob_.yomber({"mkdir", "Plans/inside"}).exitCode, kNotPermitted);
  EXPECT_EQ(bob_.names("Plans"), std::vector<std::string>{"one.txt"});

  ASSERT_EQ(ann_.yomber({"share", "add", "Plans", "bob", "--role", "editor"}).exitCode, 0);
  EXPECT_TRUE(eventually(
      [&] { return bob_.yomber({"rename", "Plans/one.txt", "ours.txt"}).exitCode == 0; }));
  EXPECT_TRUE(
      eventually([&] { return ann_.names("Plans") == std::vector<std::string>{"ours.txt"}; }));
}

TEST_F(ShareCommands, WhoCameByTheLinkGoesWhenItIsClosed) {
  const std::string link = linkOf("report.txt");
  ASSERT_EQ(ann_.yomber({"share", "permission", "report.txt", "editor"}).exitCode, 0);
  ASSERT_NE(acceptedByBob(link), "");
  ASSERT_EQ(got(bob_, "report.txt"), "first");
  bob_.write("report.txt", "second");
  EXPECT_TRUE(eventually([&] { return got(ann_, "report.txt") == "second"; }));

  ASSERT_EQ(ann_.yomber({"share", "permission", "report.txt", "none"}).exitCode, 0);
  EXPECT_TRUE(eventually([&] { return bob_.names().empty(); }));
  EXPECT_EQ(bob_.yomber({"share", "accept", link}).exitCode, kNotPermitted);
}

TEST_F(ShareCommands, WhoeverIsRemovedLosesTheItemAndWhoeverLeavesItToo) {
  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "bob"}).exitCode, 0);
  const std::string link = linkOf("report.txt");
  ASSERT_NE(acceptedByBob(link), "");
  ASSERT_EQ(bob_.yomber({"share", "stop", "report.txt"}).exitCode, 0);
  EXPECT_TRUE(eventually([&] { return bob_.names().empty(); }));
  EXPECT_EQ(info(ann_, "report.txt")["participants"][1]["status"], "removed");

  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "bob"}).exitCode, 0);
  ASSERT_NE(acceptedByBob(link), "");
  ASSERT_EQ(ann_.yomber({"share", "remove", "report.txt", "bob"}).exitCode, 0);
  EXPECT_TRUE(eventually([&] { return bob_.names().empty(); }));
  EXPECT_EQ(ann_.yomber({"share", "remove", "report.txt", "bob"}).exitCode, kNoSuchItem);
}

TEST_F(ShareCommands, ADriveKeepsTheStoreThatItJoinedAndJoinsNoOther) {
  bob_.down();
  const ProcessResult other = bob_.yomber({"up", "--store", store_ / "other"});
  EXPECT_NE(other.exitCode, 0);
  EXPECT_THAT(other.errors, HasSubstr(store_ / "store"));
  bob_.setStore({});
  bob_.up();
  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "bob"}).exitCode, 0);
  const std::string id = acceptedByBob(linkOf("report.txt"));
  ASSERT_NE(id, "");
  EXPECT_EQ(got(bob_, id), "first");
}

TEST_F(ShareCommands, WhatIsSaidWronglyIsToldSo) {
  EXPECT_EQ(ann_.yomber({"share", "add", "report.txt", "bob", "--role", "king"}).exitCode, kUsage);
  EXPECT_EQ(ann_.yomber({"share", "permission", "report.txt", "all"}).exitCode, kUsage);
  EXPECT_EQ(ann_.yomber({"share", "info", "nothing.txt"}).exitCode, kNoSuchItem);
  EXPECT_EQ(ann_.yomber({"share", "accept", "yomber-share:0000"}).exitCode, kNoSuchItem);
  EXPECT_NE(ann_.yomber({"share", "accept", "hello"}).exitCode, 0);
  EXPECT_NE(ann_.yomber({"share", "add", "/", "bob"}).exitCode, 0);
}

TEST_F(ShareCommands, TheLatestRevisionIsWhatTheStoreHasNow) {
  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "bob"}).exitCode, 0);
  ASSERT_NE(acceptedByBob(linkOf("report.txt")), "");
  EXPECT_EQ(got(bob_, "report.txt"), "first");
  ann_.write("report.txt", "the second");
  ASSERT_TRUE(eventually([&] {
    return ann_.json({"stat", "report.txt"}).front().value("size", 0) == 10 &&
           isUploaded("report.txt");
  }));
  EXPECT_EQ(bob_.yomber({"collab", "latest", "report.txt"}).exitCode, 0);
  EXPECT_EQ(got(bob_, "report.txt"), "the second");

  std::ofstream(store_ / "store/offline").put('x');
  const ProcessResult unknown = bob_.yomber({"collab", "latest", "report.txt"});
  EXPECT_NE(unknown.exitCode, 0) << "nobody can tell while the store is out of reach";
  std::filesystem::remove(store_ / "store/offline");
  EXPECT_TRUE(
      eventually([&] { return bob_.yomber({"collab", "latest", "report.txt"}).exitCode == 0; }));
}

TEST_F(ShareCommands, CollaborationAnswersForDocumentsAndNotForFolders) {
  const auto can = ann_.json({"collab", "capabilities", "report.txt"});
  ASSERT_THAT(can, SizeIs(1));
  EXPECT_EQ(can.front()["version"], 1);
  EXPECT_EQ(can.front()["capabilities"], 82);
  EXPECT_EQ(ann_.yomber({"collab", "latest", "report.txt"}).exitCode, 0);
  EXPECT_EQ(ann_.yomber({"collab", "token", "report.txt"}).exitCode, kNoSuchItem)
      << "it is not shared yet";
  ASSERT_NE(linkOf("report.txt"), "");
  const auto token = ann_.json({"collab", "token", "report.txt"});
  ASSERT_THAT(token, SizeIs(1));
  EXPECT_EQ(token.front()["provider"], "com.kelvo.Ostrell");
  EXPECT_NE(token.front()["share_token"], "");
  EXPECT_NE(token.front()["base_token"], token.front()["share_token"]);
  EXPECT_NE(ann_.yomber({"collab", "capabilities", "Plans"}).exitCode, 0);
}

}  // namespace
}  // namespace yomber::testing
