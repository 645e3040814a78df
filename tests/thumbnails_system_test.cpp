// Thumbnails of a whole drive: out of the record store, through extension and host, to whoever
// asks.
#include <stdlib.h>
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <map>
#include <optional>
#include <sstream>
#include <stop_token>
#include <string>
#include <thread>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/foundation/sanitized.h"
#include "tests/harness/content_client.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/stored_thumbnails.h"
#include "tests/harness/terminal_process.h"
#include "tests/harness/test_drive.h"
#include "yomber/drive_client.h"
#include "yomber/drive_thumbnails.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::SizeIs;
using Local = ContentClient::Local;

class ThumbnailsSystem : public ::testing::Test {
 protected:
  ThumbnailsSystem() { unsetenv("XDG_RUNTIME_DIR"); }

  static std::string pictureOf(std::size_t index) {
    return "\x89PNG\r\n\x1a\n picture " + std::to_string(index) + std::string(8000, 'x');
  }
  /// Documents with stored thumbnails, and nothing of their content on this disk. Of a type that
  /// nobody draws, so that nobody else stores thumbnails for them.
  void upWithDocuments(std::size_t count) {
    drive_.makeFolder("photos");
    for (std::size_t i = 0; i < count; ++i) {
      drive_.write("photos/p" + std::to_string(i) + ".dat", "content " + std::to_string(i));
    }
    drive_.up();
    client_.emplace(DrivePaths::forHome(drive_.home()));
    const auto isListed = [&] { return drive_.names("photos").size() == count; };
    ASSERT_TRUE(eventually(isListed));
    std::map<std::size_t, std::string> byIndex;
    for (const auto& item : drive_.json({"ls", "photos"})) {
      byIndex[std::stoul(item.at("name").get<std::string>().substr(1))] = item.at("id");
    }
    for (const auto& [index, identifier] : byIndex) identifiers_.push_back(identifier);
    ASSERT_TRUE(eventually([&] { return countOf("uploaded") == count; }));
    const auto isEvicted = [&] {
      (void)drive_.yomber({"evict", "photos"});
      return countOf("downloaded") == 0;
    };
    ASSERT_TRUE(eventually(isEvicted));
    StoredThumbnails(drive_).put(identifiers_, pictureOf);
  }
  struct Fetched {
    std::map<std::string, ItemThumbnail> thumbnails;
    NSErrorRef error;
    std::size_t pictures = 0;
    std::size_t failures = 0;
  };
  Fetched fetch(const std::vector<std::string>& identifiers,
                const std::function<void()>& afterFirst = {}) {
    Fetched fetched;
    fetched.error = fetchThumbnails(
        *client_, identifiers, {.width = 256, .height = 256}, [&](const ItemThumbnail& each) {
          EXPECT_TRUE(fetched.thumbnails.emplace(each.identifier, each).second) << each.identifier;
          if (each.image != nullptr) ++fetched.pictures;
          if (each.error != nullptr) ++fetched.failures;
          if (fetched.thumbnails.size() == 1 && afterFirst) afterFirst();
        });
    return fetched;
  }
  /// How many of the documents have that mark.
  [[nodiscard]] std::size_t countOf(const char* mark) const {
    std::size_t count = 0;
    for (const auto& item : drive_.json({"ls", "photos"})) {
      if (item.at(mark) == true) ++count;
    }
    return count;
  }
  [[nodiscard]] std::string outside(const std::string& name) const {
    return fs::path(drive_.home()).parent_path() / name;
  }
  [[nodiscard]] std::string offline() const { return drive_.home() + "/store/offline"; }

  TestDrive drive_;
  std::optional<DriveClient> client_;
  std::vector<std::string> identifiers_;  ///< by index
};

TEST_F(ThumbnailsSystem, AFolderOfEvictedPicturesIsShownWithoutAByteOfContent) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(kIsSanitized ? 100 : 600));
  const std::string out = fs::path(drive_.home()).parent_path() / "out";
  const auto before = drive_.status();
  const auto lines = drive_.json({"thumbnail", "-r", "photos", "--size", "128x128", "--out", out});
  EXPECT_THAT(lines, SizeIs(identifiers_.size()));
  for (const auto& line : lines) EXPECT_EQ(line.at("outcome"), "thumbnail") << line;
  EXPECT_EQ(contentOf(out + "/p7.dat.png"), pictureOf(7));
  EXPECT_EQ(static_cast<std::size_t>(std::distance(fs::directory_iterator(out), {})),
            identifiers_.size());
  EXPECT_EQ(countOf("downloaded"), 0U);
  EXPECT_EQ(drive_.status().at("transfers").at("finished"), before.at("transfers").at("finished"));
}

TEST_F(ThumbnailsSystem, WhatHasNoThumbnailIsSaidInWords) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(1));
  drive_.write("plain.dat", "no picture");
  drive_.makeFolder("folder");
  ASSERT_TRUE(eventually([&] { return drive_.names().size() >= 3; }));
  const std::string out = fs::path(drive_.home()).parent_path() / "out";
  const auto result =
      drive_.yomber({"thumbnail", "plain.dat", "folder", "photos/p0.dat", "--out", out});
  EXPECT_EQ(result.exitCode, 0) << result.errors;
  EXPECT_THAT(result.output, HasSubstr("none  plain.dat: it has no thumbnail"));
  EXPECT_THAT(result.output, HasSubstr("none  folder: it has no thumbnail"));
  EXPECT_THAT(result.output, HasSubstr("thumbnail  " + out + "/p0.dat.png"));
  const auto missing = drive_.yomber({"thumbnail", "nowhere.dat", "photos/p0.dat", "--out", out});
  EXPECT_EQ(missing.exitCode, 66);
  EXPECT_THAT(missing.output, HasSubstr("p0.dat 2.png"));
  EXPECT_EQ(drive_.yomber({"thumbnail", "folder", "--size", "12", "--out", out}).exitCode, 64);
}

TEST_F(ThumbnailsSystem, AtATerminalALineCountsAndASumStandsForAllThatHaveOne) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(3));
  drive_.write("photos/plain.dat", "no picture");
  ASSERT_TRUE(eventually([&] { return drive_.names("photos").size() == 4; }));
  const std::string out = outside("out");
  TerminalProcess command(drive_.commandLine({"thumbnail", "-r", "photos", "--out", out}),
                          drive_.environment());
  EXPECT_EQ(command.waitForEnd(), 0);
  const std::string& printed = command.printed();
  EXPECT_TRUE(printed.starts_with("\r1 of 4")) << printed;
  EXPECT_THAT(printed, HasSubstr("\r4 of 4"));
  EXPECT_THAT(printed, HasSubstr("\r\x1b[Knone  plain.dat: it has no thumbnail\n"));
  EXPECT_TRUE(printed.ends_with("\r\x1b[K3 of 4 items have a thumbnail\n")) << printed;
  EXPECT_THAT(printed, Not(HasSubstr("thumbnail  " + out)));
  EXPECT_EQ(contentOf(out + "/p2.dat.png"), pictureOf(2));
}

TEST_F(ThumbnailsSystem, WhatIsNotPrintedToTheTerminalIsALineForEachAllTheSame) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(3));
  const std::string out = outside("out");
  const std::string list = outside("list");
  std::vector<std::string> words{"/bin/sh", "-c", "exec \"$@\" >\"$0\"", list};
  for (const std::string& word : drive_.commandLine({"thumbnail", "-r", "photos", "--out", out})) {
    words.push_back(word);
  }
  TerminalProcess command(words, drive_.environment());
  EXPECT_EQ(command.waitForEnd(), 0);
  EXPECT_THAT(command.printed(), HasSubstr("\r3 of 3"));
  const std::string listed = contentOf(list);
  for (const char* const name : {"p0", "p1", "p2"}) {
    EXPECT_THAT(listed, HasSubstr("thumbnail  " + out + "/" + name + ".dat.png\n"));
  }
  EXPECT_THAT(listed, Not(HasSubstr("items have a thumbnail")));
}

TEST_F(ThumbnailsSystem, AtATerminalALineOfJsonHasTheLineToItself) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(2));
  TerminalProcess command(
      drive_.commandLine({"--json", "thumbnail", "-r", "photos", "--out", outside("out")}),
      drive_.environment());
  EXPECT_EQ(command.waitForEnd(), 0);
  std::istringstream lines(command.printed());
  for (int number = 0; number < 2; ++number) {
    std::string line;
    ASSERT_TRUE(std::getline(lines, line)) << command.printed();
    EXPECT_THAT(line, HasSubstr("\r\x1b[K{"));
    EXPECT_TRUE(nlohmann::json::accept(line.substr(line.find('{')))) << line;
  }
}

TEST_F(ThumbnailsSystem, AScriptIsToldOfWhatHasNoThumbnailToo) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(1));
  drive_.write("plain.dat", "no picture");
  ASSERT_TRUE(eventually([&] { return drive_.names().size() == 2; }));
  const auto lines = drive_.json({"thumbnail", "plain.dat", "--out", outside("out")});
  ASSERT_THAT(lines, SizeIs(1));
  EXPECT_EQ(lines[0].at("outcome"), "none");
  EXPECT_EQ(lines[0].at("name"), "plain.dat");
  EXPECT_FALSE(lines[0].contains("path"));
}

TEST_F(ThumbnailsSystem, ADocumentsPictureIsTheStoredOneWhateverTheSize) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(1));
  for (const char* const size : {"16x16", "2000x2000"}) {
    const auto lines =
        drive_.json({"thumbnail", "photos/p0.dat", "--size", size, "--out", outside("out")});
    ASSERT_THAT(lines, SizeIs(1));
    EXPECT_EQ(contentOf(lines[0].at("path")), pictureOf(0)) << size;
  }
}

TEST_F(ThumbnailsSystem, AnExtensionThatIsKilledInTheMiddleLosesNothing) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(kIsSanitized ? 100 : 600));
  const auto fetched = fetch(identifiers_, [&] { drive_.kill(TestDrive::Process::Extension); });
  EXPECT_EQ(fetched.error, nullptr);
  EXPECT_EQ(fetched.pictures, identifiers_.size());
}

TEST_F(ThumbnailsSystem, AStoreThatGoesInTheMiddleFailsWhatIsLeftUntilItIsBack) {
  // Only the first part of the records comes before the store has gone.
  const std::string gate = outside("gate");
  drive_.environment()["YOMBER_FAULTS"] = "rozzel.fetch.part=pause-each-until-file:" + gate;
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(600));
  std::ofstream(gate).put('x');
  std::jthread opening;
  const auto during = fetch(identifiers_, [&] {
    std::ofstream(offline()).put('x');
    opening = std::jthread([gate](const std::stop_token& isOver) {
      while (!isOver.stop_requested()) std::ofstream(gate).put('x');
    });
  });
  EXPECT_NE(during.error, nullptr);
  EXPECT_GE(during.pictures, 1U);
  EXPECT_GE(during.failures, 1U);
  EXPECT_EQ(during.pictures + during.failures, identifiers_.size());
  fs::remove(offline());
  const auto after = fetch(identifiers_);
  EXPECT_EQ(after.error, nullptr);
  EXPECT_EQ(after.pictures, identifiers_.size());
}

TEST_F(ThumbnailsSystem, FiftyThousandIdentifiersWithRubbishAmongThemAreAllAnswered) {
  const std::size_t documents = kIsSanitized ? 100 : 500;
  const std::size_t total = kIsSanitized ? 2'000 : 50'000;
  if (kIsSanitized) std::cout << "2,000 identifiers only: lookups are slow under a sanitizer\n";
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(documents));
  std::vector<std::string> mixed = identifiers_;
  const std::vector<std::string> kinds{"rubbish ", "d:0",       "d:77000", "i:9",
                                       "a:",       "\xff\xfe ", "d:-"};
  for (std::size_t i = 0; mixed.size() < total; ++i) {
    mixed.push_back(kinds[i % kinds.size()] + std::to_string(i));
  }
  const auto fetched = fetch(mixed);
  EXPECT_THAT(fetched.thumbnails, SizeIs(total));
  EXPECT_EQ(fetched.pictures, documents);
}

TEST_F(ThumbnailsSystem, ACommandThatIsInterruptedLeavesTheDriveReady) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(kIsSanitized ? 100 : 600));
  const std::string out = fs::path(drive_.home()).parent_path() / "out";
  {
    LineProcess command(drive_.commandLine({"--json", "thumbnail", "-r", "photos", "--out", out}),
                        drive_.environment());
    ASSERT_TRUE(command.readUntil([](const std::string&) { return true; }));
  }
  const auto fetched = fetch(identifiers_);
  EXPECT_EQ(fetched.error, nullptr);
  EXPECT_EQ(fetched.pictures, identifiers_.size());
}

TEST_F(ThumbnailsSystem, NobodySignedInIsSaid) {
  ASSERT_NO_FATAL_FAILURE(upWithDocuments(2));
  ASSERT_EQ(drive_.yomber({"account", "sign-out"}).exitCode, 0);
  const auto nobody = fetch(identifiers_);
  ASSERT_NE(nobody.error, nullptr);
  EXPECT_EQ(nobody.pictures, 0U);
  drive_.signIn();
  EXPECT_EQ(fetch(identifiers_).pictures, 2U);
}

}  // namespace
}  // namespace yomber::testing
