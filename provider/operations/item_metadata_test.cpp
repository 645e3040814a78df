#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/fileprovider/tags_data.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {
namespace {

using ::testing::Contains;
using Call = ScriptedDaemon::Call;

const NSErrorRef& diskFull() {
  static const auto* const error = new NSErrorRef(NSError::errorWithDomain(NSPOSIXErrorDomain, 28));
  return *error;
}

class ItemMetadataTest : public OperationsTest {
 protected:
  ItemMetadataTest() {
    path = addDocument(5, "five.txt");
    daemon.addItem(scriptedDocument(6, "bookmark"), makeLink("bookmark", path));
    log.forget();
  }
  ItemAnswer answered() {
    EXPECT_EQ(items->values().size(), 1U) << "answered before the call returned";
    return only(items);
  }
  void expectItemAfterScan(const std::string& location, const std::string& identifier) {
    const auto answer = answered();
    EXPECT_EQ(answer.identifier(), identifier);
    EXPECT_EQ(answer.error, nullptr);
    EXPECT_THAT(daemon.calls(), Contains(Call{"itemAtLocation", {location, "true"}}));
  }

  std::string path;
};

// ---- Last-used dates ---------------------------------------------------------------------------

TEST_F(ItemMetadataTest, ALastUsedDateIsRecordedAndTheItemAnswered) {
  const auto date = NSDate::fromNanoseconds(1'700'000'000'000'000'000);
  extension->setLastUsedDate(date, "d:5", into(items));
  expectItemAfterScan(path, "d:5");
  EXPECT_THAT(daemon.calls(), Contains(Call{"setLastUsedDate", {path, "1700000000000000000"}}));
  const std::string line = "[DEBUG] ┏# set last used date " + date.description() + " for d:5";
  expectLines({line, "[DEBUG] ┏# asked url for d:5"});
  EXPECT_TRUE(isClosed(line));
}

TEST_F(ItemMetadataTest, NoDateTakesTheDateAway) {
  extension->setLastUsedDate(std::nullopt, "d:5", into(items));
  expectItemAfterScan(path, "d:5");
  EXPECT_THAT(daemon.calls(), Contains(Call{"setLastUsedDate", {path, ""}}));
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┏# set last used date (null) for d:5"), 1U);
}

TEST_F(ItemMetadataTest, ADateLandsOnABookmarkItself) {
  extension->setLastUsedDate(NSDate::fromNanoseconds(1), "d:6", into(items));
  expectItemAfterScan(inRoot("bookmark"), "d:6");
}

TEST_F(ItemMetadataTest, ADateThatCannotBeRecordedChangesNoAnswer) {
  daemon.scriptContent([](ScriptedContentAnswers& answers) {
    answers.setLastUsedDate = [](const std::string&, std::optional<std::int64_t>) {
      return diskFull();
    };
  });
  extension->setLastUsedDate(NSDate::fromNanoseconds(1), "d:5", into(items));
  expectItemAfterScan(path, "d:5");
}

TEST_F(ItemMetadataTest, ForAnUnknownItemADateAnswersTheLookupsError) {
  extension->setLastUsedDate(NSDate::fromNanoseconds(1), "d:404", into(items));
  const auto answer = answered();
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1005");
  EXPECT_TRUE(answer.error->userInfo().empty());
  EXPECT_EQ(daemon.callCount("setLastUsedDate"), 0U);
}

// ---- Favourite ranks ---------------------------------------------------------------------------

TEST_F(ItemMetadataTest, AFavoriteRankIsRecordedAndTheItemAnswered) {
  extension->setFavoriteRank(-3, "d:5", into(items));
  expectItemAfterScan(path, "d:5");
  EXPECT_THAT(daemon.calls(), Contains(Call{"setFavoriteRank", {path, "-3"}}));
  const std::string line = "[DEBUG] ┏# set favorite rank -3 for d:5";
  expectLines({line, "[DEBUG] ┏# asked url for d:5"});
  EXPECT_TRUE(isClosed(line));
}

TEST_F(ItemMetadataTest, NoRankTakesTheItemFromTheFavourites) {
  extension->setFavoriteRank(std::nullopt, "d:6", into(items));
  expectItemAfterScan(inRoot("bookmark"), "d:6");
  EXPECT_THAT(daemon.calls(), Contains(Call{"setFavoriteRank", {inRoot("bookmark"), ""}}));
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┏# set favorite rank (null) for d:6"), 1U);
}

TEST_F(ItemMetadataTest, ARankThatCannotBeRecordedChangesNoAnswer) {
  daemon.scriptContent([](ScriptedContentAnswers& answers) {
    answers.setFavoriteRank = [](const std::string&, std::optional<std::int64_t>) {
      return diskFull();
    };
  });
  extension->setFavoriteRank(1, "d:5", into(items));
  expectItemAfterScan(path, "d:5");
}

TEST_F(ItemMetadataTest, ARankWhoseItemCannotBeLookedUpAnswersWhy) {
  failLookupsWith(NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  extension->setFavoriteRank(1, "d:5", into(items));
  EXPECT_EQ(domainAndCode(answered().error), "NSFileProviderErrorDomain -1003");
}

// ---- Tags --------------------------------------------------------------------------------------

TEST_F(ItemMetadataTest, TagsAreReplacedByTheNamesInTheirOrder) {
  const auto data = FPTagsDataFromLabels({"red", "b c", "\xff"});
  extension->setTagData(data, "d:5", into(items));
  expectItemAfterScan(path, "d:5");
  EXPECT_THAT(daemon.calls(), Contains(Call{"setTagNames", {path, "red", "b c", "\xff"}}));
  const std::string line =
      "[DEBUG] ┏# set tag data (" + std::to_string(data->length()) + " bytes) for d:5";
  expectLines({line, "[DEBUG] ┏# asked url for d:5"});
  EXPECT_TRUE(isClosed(line));
}

TEST_F(ItemMetadataTest, DataWithoutTagsIsAnEmptyListOfNames) {
  for (const auto& data : {NSData::dataWithString(""), NSDataRef()}) {
    daemon.forgetCalls();
    extension->setTagData(data, "d:5", into(items));
    EXPECT_THAT(daemon.calls(), Contains(Call{"setTagNames", {path}}));
  }
  EXPECT_EQ(log.count(LogLevel::Debug, "[DEBUG] ┏# set tag data (0 bytes) for d:5"), 2U);
  daemon.forgetCalls();
  extension->setTagData(NSData::dataWithString("no tags"), "d:5", into(items));
  EXPECT_THAT(daemon.calls(), Contains(Call{"setTagNames", {path}}));
}

TEST_F(ItemMetadataTest, TagsLandOnABookmarksTarget) {
  extension->setTagData(FPTagsDataFromLabels({"red"}), "d:6", into(items));
  expectItemAfterScan(path, "d:5");
  EXPECT_THAT(daemon.calls(), Contains(Call{"setTagNames", {path, "red"}}));
}

TEST_F(ItemMetadataTest, TagsThatCannotBeSetAnswerTheMappedError) {
  const auto error = NSError::errorWithDomain(NSCocoaErrorDomain, 4355);
  daemon.scriptContent([&](ScriptedContentAnswers& answers) {
    answers.setTagNames = [error](const std::string&, const std::vector<std::string>&) {
      return error;
    };
  });
  extension->setTagData(FPTagsDataFromLabels({"red"}), "d:5", into(items));
  const auto answer = answered();
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "NSFileProviderErrorDomain -1004");
  EXPECT_EQ(log.count(LogLevel::Error,
                      "[ERROR] can't set tags for " + textOf(path) + "; " + error->description()),
            1U);
  EXPECT_EQ(daemon.callCount("itemAtLocation"), 0U);
  extension->setTagData(FPTagsDataFromLabels({"red"}), "d:5", nullptr);
  EXPECT_EQ(log.countContaining("[ERROR] can't set tags for "), 2U);
}

TEST_F(ItemMetadataTest, TagsOfAnUnknownItemCannotBeSet) {
  extension->setTagData(FPTagsDataFromLabels({"red"}), "d:404", into(items));
  EXPECT_EQ(domainAndCode(answered().error), "NSCocoaErrorDomain 4");
  EXPECT_EQ(log.countContaining("[ERROR] can't set tags for (null); "), 1U);
}

TEST_F(ItemMetadataTest, ATaggedItemThatCannotBeLookedUpAnswersWhy) {
  failLookupsWith(NSError::errorWithDomain("SomeDomain", 5));
  extension->setTagData(FPTagsDataFromLabels({"red"}), "d:5", into(items));
  const auto answer = answered();
  EXPECT_EQ(answer.item, nullptr);
  EXPECT_EQ(domainAndCode(answer.error), "SomeDomain 5");
}

TEST_F(ItemMetadataTest, TheOtherHandlersMayBeEmpty) {
  extension->setLastUsedDate(NSDate::fromNanoseconds(1), "d:5", nullptr);
  extension->setFavoriteRank(1, "d:5", nullptr);
  EXPECT_EQ(daemon.callCount("itemAtLocation"), 2U);
}

}  // namespace
}  // namespace yomber
