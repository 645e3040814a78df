#include "platform/ostrell/user_defaults.h"

#include <gtest/gtest.h>

namespace yomber {
namespace {

TEST(UserDefaultsTest, AFetchTakesFiftyThousandRecordsUnlessItIsToldOtherwise) {
  auto& defaults = QSCUserDefaults::defaultsForMangledID(std::nullopt);
  EXPECT_EQ(defaults.maxRecordCountInFetchRecordsOperation(), 50'000U);
  defaults.setMaxRecordCountInFetchRecordsOperation(400);
  EXPECT_EQ(QSCUserDefaults::defaultsForMangledID("an id").maxRecordCountInFetchRecordsOperation(),
            400U);
  defaults.setMaxRecordCountInFetchRecordsOperation(0);
  EXPECT_EQ(defaults.maxRecordCountInFetchRecordsOperation(), 1U);
  defaults.setMaxRecordCountInFetchRecordsOperation(std::nullopt);
  EXPECT_EQ(defaults.maxRecordCountInFetchRecordsOperation(), 50'000U);
}

TEST(UserDefaultsTest, OnlyLargeFilesAreDownloadedForTheirThumbnail) {
  auto& defaults = QSRemoteUserDefaults::sharedDefaults();
  EXPECT_EQ(defaults.minFileSizeForThumbnailTransfer(), 64U << 20U);
  defaults.setMinFileSizeForThumbnailTransfer(0);
  EXPECT_EQ(defaults.minFileSizeForThumbnailTransfer(), 0U);
  defaults.setMinFileSizeForThumbnailTransfer(std::nullopt);
  EXPECT_EQ(defaults.minFileSizeForThumbnailTransfer(), 64U << 20U);
}

}  // namespace
}  // namespace yomber
