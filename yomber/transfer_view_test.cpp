#include "yomber/transfer_view.h"

#include <gtest/gtest.h>

namespace yomber {
namespace {

Transfer transferOf(std::uint64_t done, std::uint64_t total) {
  Transfer transfer;
  transfer.path = "/tree/report.pdf";
  transfer.kind = Transfer::Kind::DOWNLOAD;
  transfer.done = done;
  transfer.total = total;
  return transfer;
}

TEST(TransferView, ShowsHowFarATransferIs) {
  EXPECT_EQ(transferLine(transferOf(500, 1'000), 0), "download   50%  500 B of 1.0 KB  report.pdf");
  EXPECT_EQ(transferLine(transferOf(500, 1'000), 4),
            "download   50%  [##  ] 500 B of 1.0 KB  report.pdf");
  EXPECT_EQ(transferLine(transferOf(0, 0), 4), "download    0%  [    ] 0 B of 0 B  report.pdf");
}

TEST(TransferView, NeverShowsMoreThanAll) {
  EXPECT_EQ(transferLine(transferOf(2'000, 1'000), 2),
            "download  100%  [##] 2.0 KB of 1.0 KB  report.pdf");
}

TEST(TransferView, SaysWhyATransferWaits) {
  auto transfer = transferOf(0, 10);
  transfer.nextAttempt = NSDate::fromNanoseconds(1);
  transfer.failure = NSError::errorWithDomain(
      NSCocoaErrorDomain, NSUbiquitousFileUnavailableError,
      {{NSLocalizedDescriptionKey, std::string("the store is out of reach")}});
  EXPECT_EQ(transferLine(transfer, 0), "download  waiting  report.pdf: the store is out of reach");
}

TEST(TransferView, SumsUp) {
  Transfers transfers;
  EXPECT_EQ(transferSummary(transfers), "none");
  transfers.underWay.push_back(transferOf(1, 2));
  transfers.waiting = 5;
  EXPECT_EQ(transferSummary(transfers), "1 under way, 4 waiting");
}

TEST(TransferView, CountsADocumentThatIsUnderWayOnce) {
  Transfers transfers;
  transfers.underWay.push_back(transferOf(1, 2));
  for (const std::uint64_t waiting : {0U, 1U}) {
    transfers.waiting = waiting;
    EXPECT_EQ(transferSummary(transfers), "1 under way, 0 waiting") << waiting;
  }
}

}  // namespace
}  // namespace yomber
