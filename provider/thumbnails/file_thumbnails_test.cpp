#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstdio>

#include "platform/foundation/sanitized.h"
#include "provider/testing/thumbnail_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;
using Call = ScriptedDaemon::Call;

constexpr const char* kNoneLeft = "[DEBUG] no thumbnail left to fetch";
constexpr const char* kNonEmpty = "[DEBUG] no thumbnail found for a non-empty file";
constexpr const char* kClosed = "[DEBUG] ┗# ";
constexpr const char* kFinished = "[DEBUG] finished fetching all thumbnail batches";

class FileThumbnailsTest : public ThumbnailTest {
 protected:
  static std::string startLine(const std::string& identifiers) {
    return "[DEBUG] ┏# starting fetch thumbnail for " + identifiers;
  }
  static std::string callbackLine(const std::string& identifier) {
    return "[DEBUG] ┳# received a thumbnail callback for " + identifier;
  }
  /// A document without a stored thumbnail that a thumbnailer of this machine draws.
  std::string addUndrawn(std::uint64_t rawID, std::int64_t size,
                         const std::string& type = "image/jpeg") {
    ItemFields item = scriptedDocument(rawID, "photo.jpg");
    item.contentType = type;
    daemon.addItem(item, inRoot("photo.jpg"));
    addRecord(rawID, std::nullopt, size);
    return inRoot("photo.jpg");
  }
  static void downloadAbove(std::uint64_t size) {
    QSRemoteUserDefaults::sharedDefaults().setMinFileSizeForThumbnailTransfer(size);
  }
};

TEST_F(FileThumbnailsTest, AStoredThumbnailIsHandedOverWithoutAType) {
  addDocument(10, "a.jpg");
  addRecord(10, "a picture");
  log.forget();
  EXPECT_EQ(fetchAll({"d:10"}), nullptr);
  const auto answer = onlyThumbnail();
  EXPECT_EQ(answer.identifier, "d:10");
  EXPECT_EQ(answer.image(), "a picture");
  EXPECT_EQ(answer.type, std::nullopt);
  EXPECT_EQ(answer.error, nullptr);
  expectLines({"[DEBUG] ┣# fetching the thumbnails for: {d:10 = 10 in zone (__currentUser__)}",
               callbackLine("d:10"), "[DEBUG] received a thumbnail of 9 bytes for d:10",
               kFinished});
  EXPECT_EQ(log.texts().front(), startLine("(d:10)"));
  EXPECT_TRUE(isClosed(startLine("(d:10)")));
}

TEST_F(FileThumbnailsTest, TheFetchSectionIsClosedOnceForEachRecord) {
  addRecord(10, "one");
  addRecord(11, "two");
  addRecord(12, "three");
  EXPECT_EQ(fetchAll({"d:10", "d:11", "d:12"}), nullptr);
  ASSERT_TRUE(log.waitFor(LogLevel::Debug, kFinished));
  const auto section = log.sectionOf(callbackLine("d:10"));
  EXPECT_EQ(section % 2, 1U);
  EXPECT_NE(section, log.sectionOf(startLine("(d:10, d:11, d:12)")));
  EXPECT_EQ(log.sectionOf(callbackLine("d:12")), section);
  std::array<char, 32> closing{};
  std::snprintf(closing.data(), closing.size(), "[DEBUG] ┗%llx ",
                static_cast<unsigned long long>(section));
  const auto lines = log.lines();
  EXPECT_EQ(
      std::ranges::count_if(lines, [&](const auto& line) { return line.text == closing.data(); }),
      3);
}

TEST_F(FileThumbnailsTest, WhatIsNoDocumentIsAnsweredAtOnceAndLeavesNothingToFetch) {
  addFolder(20, "folder");
  log.forget();
  const auto progress = fetch({"i:20", "rubbish", "a:7", ""});
  EXPECT_EQ(errors->values(), std::vector<NSErrorRef>{nullptr});
  const auto answers = thumbnails->values();
  ASSERT_THAT(answers, SizeIs(4));
  EXPECT_EQ(answers[0].identifier, "i:20");
  EXPECT_EQ(answers[0].data, nullptr);
  EXPECT_EQ(answers[0].error, nullptr);
  EXPECT_EQ(missingIdentifier(answers[1].error), "rubbish");
  EXPECT_EQ(answers[2].error, nullptr);
  EXPECT_EQ(domainAndCode(answers[3].error), "NSFileProviderErrorDomain -1005");
  EXPECT_EQ(log.count(LogLevel::Debug, kNoneLeft), 1U);
  EXPECT_EQ(daemon.callCount("contentRecords"), 0U);
  EXPECT_EQ(progress->totalUnitCount(), 0);
  const auto texts = log.texts();
  ASSERT_FALSE(texts.empty());
  EXPECT_EQ(texts.front(), startLine("(i:20, rubbish, a:7, )"));
  EXPECT_EQ(texts.back(), kClosed);
  EXPECT_TRUE(isClosed(texts.front()));
}

TEST_F(FileThumbnailsTest, ARequestForNothingCompletes) {
  EXPECT_EQ(fetchAll({}), nullptr);
  EXPECT_THAT(thumbnails->values(), IsEmpty());
}

TEST_F(FileThumbnailsTest, ADaemonThatCannotTellTheRecordsFailsTheRequest) {
  const auto refusal = NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorLoggedOut);
  daemon.script([refusal](ScriptedDaemon::Answers& answers) {
    answers.contentRecords = [refusal](const std::vector<std::string>&) {
      return ScriptedDaemon::Records{.records = {}, .error = refusal};
    };
  });
  EXPECT_EQ(domainAndCode(fetchAll({"d:10", "rubbish", "d:11"})),
            "NSFileProviderErrorDomain -1000");
  EXPECT_EQ(onlyThumbnail().identifier, "rubbish");
  EXPECT_EQ(log.count(LogLevel::Error, "[ERROR] can't get the record ids for (d:10, d:11): " +
                                           refusal->description()),
            1U);
  EXPECT_EQ(log.countContaining("can't get the record ids"), 1U);
  EXPECT_EQ(log.texts().back(), kClosed);
  EXPECT_TRUE(isClosed(startLine("(d:10, rubbish, d:11)")));
}

TEST_F(FileThumbnailsTest, DocumentsThatTheDaemonDoesNotMapHaveNoThumbnail) {
  EXPECT_EQ(fetchAll({"d:10", "d:11"}), nullptr);
  EXPECT_THAT(thumbnails->values(), IsEmpty());
  EXPECT_EQ(log.countContaining("scheduling operation"), 0U);
}

TEST_F(FileThumbnailsTest, AnEmptyFileHasNoThumbnail) {
  addRecord(10, std::nullopt, 0);
  EXPECT_EQ(fetchAll({"d:10"}), nullptr);
  EXPECT_EQ(onlyThumbnail().data, nullptr);
  EXPECT_EQ(onlyThumbnail().error, nullptr);
  expectLines({callbackLine("d:10"), "[DEBUG] empty record for d:10"});
}

TEST_F(FileThumbnailsTest, AnImageOfMoreThanEightMebibytesIsNone) {
  constexpr std::size_t kMost = std::size_t{8} << 20U;
  addRecord(10, std::string(kMost, 'x'));
  addRecord(11, std::string(kMost + 1, 'x'));
  EXPECT_EQ(fetchAll({"d:10", "d:11"}), nullptr);
  const auto answers = thumbnails->values();
  ASSERT_THAT(answers, SizeIs(2));
  ASSERT_NE(answers[0].data, nullptr);
  EXPECT_EQ(answers[0].data->length(), kMost);
  EXPECT_EQ(answers[1].data, nullptr);
  EXPECT_EQ(answers[1].error, nullptr);
  expectLines(
      {"[DEBUG] received a thumbnail of 8388608 bytes for d:10", callbackLine("d:11"), kNonEmpty});
}

TEST_F(FileThumbnailsTest, AFileWithoutAStoredThumbnailIsLeftAloneUpToTheThreshold) {
  (void)addUndrawn(10, 1000);
  downloadAbove(1000);
  EXPECT_EQ(fetchAll({"d:10"}), nullptr);
  EXPECT_EQ(onlyThumbnail().image(), "nil");
  EXPECT_EQ(log.count(LogLevel::Debug, kNonEmpty), 1U);
  EXPECT_EQ(daemon.callCount("startDownloading"), 0U);
}

TEST_F(FileThumbnailsTest, ALargerOneThatThisMachineDrawsIsDownloadedAndHoldsTheNextRecordUp) {
  const std::string path = addUndrawn(10, 1001);
  addRecord(11, "picture");
  downloadAbove(1000);
  daemon.hold("startDownloading");
  (void)fetch({"d:10", "d:11"});
  ASSERT_TRUE(daemon.waitForCalls("startDownloading"));
  EXPECT_THAT(thumbnails->values(), SizeIs(1));
  daemon.release("startDownloading");
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_THAT(thumbnails->values(), SizeIs(2));
  EXPECT_THAT(daemon.calls(), Contains(Call{"startDownloading", {path, "4"}}));
  expectLines({kNonEmpty, "[DEBUG] downloading file at " + textOf(path) +
                              " because glimmet can generate its thumbnail"});
}

TEST_F(FileThumbnailsTest, ADownloadThatCannotBeginIsLogged) {
  const std::string path = addUndrawn(10, 1001);
  downloadAbove(1000);
  const auto refusal = NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError);
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.startDownloading = [refusal](const std::vector<std::string>&, std::uint64_t) {
      return refusal;
    };
  });
  EXPECT_EQ(fetchAll({"d:10"}), nullptr);
  EXPECT_EQ(log.count(LogLevel::Error, "[ERROR] can't start downloading " + textOf(path) + ": " +
                                           refusal->description()),
            1U);
}

TEST_F(FileThumbnailsTest, WhatNoThumbnailerDrawsIsNotDownloaded) {
  (void)addUndrawn(10, 1001, "application/x-unheard-of");
  downloadAbove(1000);
  EXPECT_EQ(fetchAll({"d:10"}), nullptr);
  EXPECT_EQ(log.count(LogLevel::Debug, kNonEmpty), 1U);
  EXPECT_EQ(daemon.callCount("startDownloading"), 0U);
}

TEST_F(FileThumbnailsTest, ARecordThatIsGoneIsToldWithItsError) {
  addRecord(10, "picture");
  know(11, {"11", RZRecordZoneID("zone")});
  EXPECT_EQ(fetchAll({"d:10", "d:11"}), nullptr);
  const auto answers = thumbnails->values();
  ASSERT_THAT(answers, SizeIs(2));
  EXPECT_EQ(domainAndCode(answers[1].error), "RZErrorDomain 11");
  EXPECT_EQ(log.countContaining("[ERROR] error when fetching thumbnail for d:11: "), 1U);
}

TEST_F(FileThumbnailsTest, HandlersMayBeMissing) {
  addRecord(10, "picture");
  addFolder(20, "folder");
  (void)extension->fetchThumbnailsForItemIdentifiers({"d:10", "i:20", "rubbish"},
                                                     {.width = 1, .height = 1},
                                                     TypedThumbnailHandler(), into(errors));
  EXPECT_EQ(only(errors), nullptr);
  (void)extension->fetchThumbnailsForItemIdentifiers({"rubbish"}, {.width = 1, .height = 1},
                                                     TypedThumbnailHandler(), ErrorHandler());
}

/// Ends the untyped form's sending of itself after a while.
class ThumbnailsEndedBySubclass final : public QSFileProviderExtension {
 public:
  using QSFileProviderExtension::fetchThumbnailsForItemIdentifiers;
  NSProgressRef fetchThumbnailsForItemIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
      ThumbnailHandler handler, ErrorHandler completionHandler) override {
    if (++entries < 4) {
      return QSFileProviderExtension::fetchThumbnailsForItemIdentifiers(
          identifiers, requestedSize, std::move(handler), std::move(completionHandler));
    }
    const auto error = NSError::errorWithErrno(EIO);
    handler("d:10", NSData::dataWithString("picture"), error);
    completionHandler(error);
    return progress;
  }
  NSProgressRef fetchThumbnailsForItemIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& /*identifiers*/, CGSize /*size*/,
      TypedThumbnailHandler /*handler*/, ErrorHandler /*completionHandler*/) override {
    ++typedEntries;
    return nullptr;
  }

  int entries = 0;
  int typedEntries = 0;
  const NSProgressRef progress = NSProgress::progressWithTotalUnitCount(7);
};

TEST_F(FileThumbnailsTest, TheUntypedFormSendsItselfAgainWithTheHandlerWrapped) {
  const auto subclass = std::make_shared<ThumbnailsEndedBySubclass>();
  std::vector<ThumbnailAnswer> answers;
  const auto progress = subclass->fetchThumbnailsForItemIdentifiers(
      {"d:10"}, {.width = 1, .height = 1},
      ThumbnailHandler([&](const NSFileProviderItemIdentifier& identifier, const NSDataRef& data,
                           const NSErrorRef& error) {
        answers.push_back({identifier, data, std::nullopt, error});
      }),
      into(errors));
  EXPECT_EQ(subclass->entries, 4);
  EXPECT_EQ(subclass->typedEntries, 0);
  EXPECT_EQ(progress, subclass->progress);
  ASSERT_THAT(answers, SizeIs(1));
  EXPECT_EQ(answers[0].image(), "picture");
  EXPECT_EQ(answers[0].error, errors->values().at(0));
}

TEST_F(FileThumbnailsTest, FiftyThousandIdentifiersOfAllKindsAreAllAnswered) {
  // Each identifier of an object is looked up at the daemon on its own.
  const std::uint64_t ofEachKind = kIsSanitized ? 400 : 10'000;
  if (kIsSanitized) std::puts("2,000 identifiers only: a lookup is slow under a sanitizer");
  std::vector<std::string> identifiers;
  std::map<std::uint64_t, std::optional<std::string>> records;
  for (std::uint64_t i = 0; i < ofEachKind; ++i) {
    if (i % 10 == 0) records.emplace(10'000 + i, "picture");
    identifiers.push_back(identifierOf(10'000 + i));
    identifiers.push_back("rubbish " + std::to_string(i));
    identifiers.push_back("i:" + std::to_string(500'000 + i));
    identifiers.push_back("a:" + std::to_string(i + 1));
    identifiers.push_back("d:0" + std::to_string(i));
  }
  addRecords(records);
  std::size_t pictures = 0;
  std::size_t failures = 0;
  std::size_t nothing = 0;
  (void)extension->fetchThumbnailsForItemIdentifiers(
      identifiers, {.width = 1, .height = 1},
      TypedThumbnailHandler([&](const NSFileProviderItemIdentifier&, const NSDataRef& data,
                                const std::optional<std::string>&, const NSErrorRef& failure) {
        auto& count = failure != nullptr ? failures : data != nullptr ? pictures : nothing;
        ++count;
      }),
      into(errors));
  EXPECT_EQ(only(errors), nullptr);
  EXPECT_EQ(pictures, ofEachKind / 10);
  EXPECT_EQ(failures, 2 * ofEachKind);
  EXPECT_EQ(nothing, 2 * ofEachKind);
  std::string list;
  for (const auto& each : identifiers) list += (list.empty() ? "(" : ", ") + each;
  EXPECT_TRUE(isClosed(startLine(list + ")")));
  EXPECT_EQ(log.countContaining("received a thumbnail callback"), ofEachKind / 10);
  EXPECT_EQ(log.countContaining("scheduling operation"), 1U);
  EXPECT_EQ(log.count(LogLevel::Debug, kFinished), 1U);
}

}  // namespace
}  // namespace yomber
