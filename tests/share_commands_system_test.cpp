// Sharing between the drives of two accounts, by the command line.
#include <chrono>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/foundation/log_sinks.h"
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
  using Statuses = std::map<std::string, std::string>;
  /// Of everybody who takes part in what Ann shares, by name.
  [[nodiscard]] Statuses statusesOf(const std::string& item) const {
    Statuses statuses;
    const auto shared = info(ann_, item);
    for (const auto& person : shared.at("participants"))
      EXPECT_TRUE(statuses.emplace(person.at("name"), person.at("status")).second);
    return statuses;
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
  const ProcessResult linked = ann_.yomber({"share", "link", "Plans/one.txt"});
  EXPECT_NE(linked.exitCode, 0) << linked.output;
  EXPECT_THAT(linked.errors, HasSubstr("name that folder"));
  const ProcessResult passedOn = bob_.yomber({"share", "link", "Plans"});
  EXPECT_EQ(passedOn.exitCode, 0) << passedOn.errors;
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

/// A command about a share, stopped each time between its reading of the share and what it does
/// with it.
class HeldCommand {
 public:
  HeldCommand(TestDrive& drive, const std::vector<std::string>& words, std::string gate)
      : gate_(std::move(gate)), process_(drive.commandLine(words), heldAt(gate_, drive)) {}

  bool hasRead() {
    return eventually([this] { return std::filesystem::exists(gate_ + ".reached"); });
  }
  /// Lets it do what it has read the share for.
  bool letGo() {
    std::ofstream(gate_).put('x');
    return eventually([this] { return !std::filesystem::exists(gate_); });
  }
  std::optional<int> waitForEnd() { return process_.waitForEnd(); }
  /// The same for one that may read the share again before.
  std::optional<int> letGoToTheEnd() {
    std::optional<int> end;
    (void)eventually([&] {
      if (!std::filesystem::exists(gate_)) std::ofstream(gate_).put('x');
      end = process_.waitForEnd(std::chrono::milliseconds(20));
      return end.has_value();
    });
    return end;
  }

 private:
  static Environment heldAt(const std::string& gate, TestDrive& drive) {
    Environment environment = drive.environment();
    environment["YOMBER_FAULTS"] = "yomber.share.fetched=pause-each-until-file:" + gate;
    return environment;
  }

  const std::string gate_;
  LineProcess process_;
};

TEST_F(ShareCommands, WhoeverWasOvertakenWhileChangingAShareLosesNobody) {
  for (const std::string item : {"report.txt", "Plans"}) {
    SCOPED_TRACE(item);
    ASSERT_EQ(ann_.yomber({"share", "add", item, "bob"}).exitCode, 0);
    HeldCommand overtaken(ann_, {"share", "add", item, "eve"}, store_ / ("gate of " + item));
    ASSERT_TRUE(overtaken.hasRead());
    // Another process of its owner's saves the share, and another account does.
    ASSERT_EQ(ann_.yomber({"share", "add", item, "carl", "--role", "editor"}).exitCode, 0);
    ASSERT_NE(acceptedByBob(linkOf(item)), "");
    EXPECT_EQ(overtaken.letGoToTheEnd(), 0);
    EXPECT_EQ(
        statusesOf(item),
        (Statuses{
            {"ann", "accepted"}, {"bob", "accepted"}, {"carl", "pending"}, {"eve", "pending"}}));
  }
}

TEST_F(ShareCommands, WhoeverIsOvertakenAgainAndAgainIsSavedInTheEnd) {
  constexpr int kTimes = 12;
  Statuses expected{{"ann", "accepted"}, {"eve", "pending"}};
  HeldCommand overtaken(ann_, {"share", "add", "report.txt", "eve"}, store_ / "gate");
  for (int time = 0; time < kTimes; ++time) {
    ASSERT_TRUE(overtaken.hasRead());
    const std::string name = "person " + std::to_string(time);
    ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", name}).exitCode, 0);
    expected[name] = "pending";
    ASSERT_TRUE(overtaken.letGo());
  }
  EXPECT_EQ(overtaken.letGoToTheEnd(), 0);
  EXPECT_EQ(statusesOf("report.txt"), expected);
}

TEST_F(ShareCommands, ManyWhoChangeAShareAtOnceAllSucceed) {
  for (const std::string item : {"report.txt", "Plans"}) {
    SCOPED_TRACE(item);
    ASSERT_EQ(ann_.yomber({"share", "add", item, "bob"}).exitCode, 0);
    std::vector<std::unique_ptr<HeldCommand>> all;
    const auto begin = [&](const std::vector<std::string>& words) {
      const std::string gate = store_ / ("gate of " + item + std::to_string(all.size()));
      all.push_back(std::make_unique<HeldCommand>(ann_, words, gate));
    };
    Statuses expected{{"ann", "accepted"}};
    for (int number = 0; number < 12; ++number) {
      const std::string name = "person " + std::to_string(number);
      begin({"share", "add", item, name});
      expected[name] = "pending";
    }
    begin({"share", "remove", item, "bob"});
    for (const auto& each : all) ASSERT_TRUE(each->hasRead());
    for (const auto& each : all) ASSERT_TRUE(each->letGo());
    for (const auto& each : all) EXPECT_EQ(each->letGoToTheEnd(), 0);
    EXPECT_EQ(statusesOf(item), expected);
  }
}

TEST_F(ShareCommands, WhoeverStopsSharingIsNotHinderedByWhoeverChangesTheShare) {
  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "bob"}).exitCode, 0);
  HeldCommand overtaken(ann_, {"share", "stop", "report.txt"}, store_ / "gate");
  ASSERT_TRUE(overtaken.hasRead());
  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "eve"}).exitCode, 0);
  ASSERT_NE(acceptedByBob(linkOf("report.txt")), "");
  EXPECT_EQ(overtaken.letGoToTheEnd(), 0);
  EXPECT_FALSE(info(ann_, "report.txt")["shared"].get<bool>());
  EXPECT_TRUE(eventually([&] { return bob_.names().empty(); }));
}

TEST_F(ShareCommands, WhoeverIsOvertakenByTheEndOfSharingBringsNobodyBack) {
  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "bob"}).exitCode, 0);
  const std::string link = linkOf("report.txt");
  HeldCommand overtaken(ann_, {"share", "add", "report.txt", "eve"}, store_ / "gate");
  ASSERT_TRUE(overtaken.hasRead());
  ASSERT_EQ(ann_.yomber({"share", "stop", "report.txt"}).exitCode, 0);
  EXPECT_EQ(overtaken.letGoToTheEnd(), kNoSuchItem);
  EXPECT_FALSE(info(ann_, "report.txt")["shared"].get<bool>());
  EXPECT_EQ(bob_.yomber({"share", "accept", link}).exitCode, kNoSuchItem);
}

TEST_F(ShareCommands, WhatIsRefusedToSomebodyIsInTheLogOfHisDrive) {
  if (logsToJournal()) GTEST_SKIP() << "this machine logs to its journal";
  const auto logged = [&](const std::string& line) {
    return eventually([&] {
      const ProcessResult log = bob_.yomber({"log", "--lines", "100000"});
      return log.output.find(line) != std::string::npos;
    });
  };
  const std::string guessed = "yomber-share:" + std::string(32, '0');
  EXPECT_EQ(bob_.yomber({"share", "accept", guessed}).exitCode, kNoSuchItem);
  EXPECT_TRUE(logged("[NOTICE] refused a URL of no share to bob"));

  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "carl"}).exitCode, 0);
  const std::string carls = linkOf("report.txt");
  EXPECT_EQ(bob_.yomber({"share", "accept", carls}).exitCode, kNotPermitted);
  EXPECT_TRUE(logged("[NOTICE] refused a share's URL to bob"));
  EXPECT_TRUE(bob_.names().empty());

  ASSERT_EQ(ann_.yomber({"share", "add", "report.txt", "bob"}).exitCode, 0);
  ASSERT_NE(acceptedByBob(carls), "");
  EXPECT_EQ(bob_.yomber({"share", "add", "report.txt", "eve"}).exitCode, kNotPermitted);
  EXPECT_TRUE(logged("[NOTICE] refused to save the share of ann for bob"));
  EXPECT_EQ(statusesOf("report.txt"),
            (Statuses{{"ann", "accepted"}, {"bob", "accepted"}, {"carl", "pending"}}));
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
