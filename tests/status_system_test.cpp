// What `yomber status` says of transfers: at a terminal, to a pipe and to a script.
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/harness/content_client.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/terminal_process.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::ContainsRegex;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::SizeIs;
using Json = nlohmann::json;
using Upload = ContentClient::Upload;

constexpr std::size_t kSize = 3'000'000;
/// One transfer and the sum are drawn anew over the same two lines.
constexpr const char* kRedraw = "\x1b[2A\x1b[J";

/// A drive in which a transfer goes only so far until it is let go on.
class Status : public ::testing::Test {
 protected:
  ~Status() override { letGo(); }

  void upWithGateAt(const std::string& point) {
    gate_ = drive_.home() + "/gate";
    upWithFault(point + "=pause-until-file:" + gate_);
  }
  void upWithFault(const std::string& fault) {
    drive_.environment()["YOMBER_FAULTS"] = fault;
    drive_.up();
    client_.emplace(drive_.home());
  }
  void letGo() const {
    if (!gate_.empty()) std::ofstream(gate_).put('x');
  }
  [[nodiscard]] bool isReached() const {
    return eventually([&] { return fs::exists(gate_ + ".reached"); });
  }
  [[nodiscard]] std::string at(const std::string& path) const { return drive_.root() + "/" + path; }
  void addConfirmed(const std::string& name) {
    drive_.write(name, someContent(kSize, 1));
    ASSERT_TRUE(eventually([&] { return client_->state(at(name)).upload == Upload::CONFIRMED; }));
  }
  [[nodiscard]] std::vector<std::string> command(const std::vector<std::string>& words) const {
    return drive_.commandLine(words);
  }
  [[nodiscard]] Json transfers() const { return drive_.status().at("transfers"); }
  /// Of the one transfer that is stopped.
  void expectUnderWay(const std::string& kind, const std::string& name) const {
    const Json all = transfers();
    ASSERT_THAT(all.at("under_way"), SizeIs(1)) << all;
    const Json& one = all["under_way"][0];
    EXPECT_EQ(one.at("kind"), kind);
    EXPECT_EQ(one.at("location"), at(name));
    EXPECT_EQ(one.at("total"), kSize);
    EXPECT_EQ(one.at("attempts"), 0);
    EXPECT_LT(one.at("done"), one["total"]);
    EXPECT_FALSE(one.contains("failure"));
    EXPECT_FALSE(one.contains("next_attempt"));
  }

  TestDrive drive_;
  std::optional<ContentClient> client_;
  std::string gate_;
};

TEST_F(Status, AtATerminalATransferIsDrawnAnewUntilItIsDone) {
  upWithGateAt("zarn.upload.reading");
  drive_.write("film", someContent(kSize, 1));
  ASSERT_TRUE(isReached());
  TerminalProcess status(command({"status"}), drive_.environment());
  ASSERT_TRUE(status.shows("drive          " + drive_.home() + "\n"));
  for (int picture = 0; picture < 3; ++picture) {
    const std::string expected = picture > 0 ? kRedraw : "\n";
    ASSERT_TRUE(status.shows(expected + "upload  ")) << status.printed();
    ASSERT_TRUE(status.shows("of 3.0 MB  film\n")) << status.printed();
    ASSERT_TRUE(status.shows("transfers      1 under way, 0 waiting\n")) << status.printed();
  }
  EXPECT_THAT(status.printed(), ContainsRegex("upload   +[0-9]+%  \\[#* +\\] .*film\n"));
  letGo();
  ASSERT_TRUE(status.shows("transfers      none\n")) << status.printed();
  EXPECT_EQ(status.waitForEnd(), 0);
  const std::string& all = status.printed();
  EXPECT_TRUE(all.ends_with("\x1b[Jtransfers      none\n")) << "nothing is left of what was drawn";
}

TEST_F(Status, AtATerminalWithNothingToWaitForItEndsAtOnce) {
  drive_.up();
  ASSERT_TRUE(eventually([&] { return transfers().at("waiting") == 0; }));
  TerminalProcess status(command({"status"}), drive_.environment());
  EXPECT_EQ(status.waitForEnd(), 0);
  EXPECT_THAT(status.printed(), HasSubstr("transfers      none\n"));
  EXPECT_THAT(status.printed(), Not(HasSubstr("\x1b")));
}

TEST_F(Status, APipeGetsPlainLinesOfWhatIsUnderWayJustNow) {
  upWithGateAt("zarn.upload.reading");
  drive_.write("film", someContent(kSize, 1));
  ASSERT_TRUE(isReached());
  const auto status = drive_.yomber({"status"});
  EXPECT_EQ(status.exitCode, 0) << status.errors;
  EXPECT_THAT(status.output,
              ContainsRegex("\nupload   +[0-9]+%  [0-9.]+ [KM]?B of 3.0 MB  film\n"));
  EXPECT_THAT(status.output, HasSubstr("\ntransfers      1 under way, 0 waiting\n"));
  EXPECT_THAT(status.output, Not(HasSubstr("\x1b")));
}

TEST_F(Status, OnceIsPlainAndDoesNotWaitAtATerminalEither) {
  upWithGateAt("zarn.upload.reading");
  drive_.write("film", someContent(kSize, 1));
  ASSERT_TRUE(isReached());
  TerminalProcess status(command({"status", "--once"}), drive_.environment());
  EXPECT_EQ(status.waitForEnd(), 0) << "although the transfer is not done";
  EXPECT_THAT(status.printed(), HasSubstr("\ntransfers      1 under way, 0 waiting\n"));
  EXPECT_THAT(status.printed(), Not(HasSubstr("\x1b")));
}

TEST_F(Status, AScriptIsToldHowFarAnUploadIs) {
  upWithGateAt("zarn.upload.reading");
  drive_.write("film", someContent(kSize, 1));
  ASSERT_TRUE(isReached());
  expectUnderWay("upload", "film");
  letGo();
  EXPECT_TRUE(eventually([&] {
    const Json all = transfers();
    return all.at("under_way").empty() && all.at("waiting") == 0 && all.at("finished") >= 1;
  })) << transfers();
}

TEST_F(Status, AScriptIsToldHowFarADownloadIs) {
  upWithGateAt("zarn.fill.copying");
  ASSERT_NO_FATAL_FAILURE(addConfirmed("film"));
  ASSERT_EQ(client_->evict(at("film")), nullptr);
  LineProcess provide(command({"provide", "film"}), drive_.environment());
  ASSERT_TRUE(isReached());
  expectUnderWay("download", "film");
  letGo();
  EXPECT_EQ(provide.waitForEnd(), 0);
}

TEST_F(Status, AScriptIsToldOfAnEviction) {
  upWithGateAt("zarn.evict.leased");
  ASSERT_NO_FATAL_FAILURE(addConfirmed("film"));
  LineProcess evict(command({"evict", "film"}), drive_.environment());
  ASSERT_TRUE(isReached());
  expectUnderWay("evict", "film");
  letGo();
  EXPECT_EQ(evict.waitForEnd(), 0);
}

TEST_F(Status, WhyATransferFailedIsSaidAndWhenItIsTriedAgain) {
  upWithFault("zarn.upload.read=error");
  drive_.write("film", "content");
  Json failed;
  ASSERT_TRUE(eventually([&] {
    const Json underWay = transfers().at("under_way");
    if (underWay.size() == 1) failed = underWay[0];
    return failed.contains("next_attempt");
  }));
  EXPECT_EQ(failed.at("kind"), "upload");
  EXPECT_GE(failed.at("attempts"), 1);
  EXPECT_EQ(failed.at("failure").at("domain"), "NSPOSIXErrorDomain");
  EXPECT_EQ(failed["failure"].at("code"), EIO);
  EXPECT_FALSE(failed["failure"].at("message").get<std::string>().empty());
  // While it is tried once more it is under way again.
  EXPECT_TRUE(eventually([&] {
    const std::string text = drive_.yomber({"status"}).output;
    return text.find("upload    waiting  film: ") != std::string::npos;
  }));
}

}  // namespace
}  // namespace yomber::testing
