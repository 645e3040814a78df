#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <kj/debug.h>

#include <fstream>
#include <iterator>
#include <limits>
#include <map>
#include <string>
#include <vector>

#include "fileproviderd/host_fixture.h"
#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/thumbnail_batch.h"
#include "platform/foundation/gate.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Control;
using testing::AllOf;
using testing::Each;
using testing::HasSubstr;
using testing::SizeIs;

/// A client that takes thumbnails; it answers each call at once, or not at all.
struct ThumbnailClient {
  class Receiver final : public protocol::ThumbnailReceiver::Server {
   public:
    explicit Receiver(std::shared_ptr<ThumbnailClient> client) : client_(std::move(client)) {}
    kj::Promise<void> didFetch(DidFetchContext context) override {
      return ThumbnailBatch::decode(context.getParams())
          .then([client = client_](ThumbnailBatch batch) { return client->take(batch); });
    }

   private:
    const std::shared_ptr<ThumbnailClient> client_;
  };

  kj::Promise<void> take(const ThumbnailBatch& batch) {
    {
      LockGuard guard(mutex);
      for (std::size_t i = 0; i < batch.size(); ++i) told.push_back(batch.at(i));
    }
    arrived.open();
    KJ_REQUIRE(!refuses, "no more");
    if (!holds) return kj::READY_NOW;
    return kj::NEVER_DONE;
  }
  std::vector<ItemThumbnail> all() {
    LockGuard guard(mutex);
    return told;
  }
  /// "picture", "-" or the error's code, by identifier; each is told once.
  std::map<std::string, std::string> byIdentifier() {
    std::map<std::string, std::string> result;
    for (const auto& each : all()) {
      EXPECT_FALSE(result.contains(each.identifier)) << each.identifier << " was told twice";
      result[each.identifier] = each.image != nullptr   ? std::string(each.image->bytes())
                                : each.error != nullptr ? std::to_string(each.error->code())
                                                        : "-";
    }
    return result;
  }

  bool holds = false;
  bool refuses = false;
  Mutex mutex;
  std::vector<ItemThumbnail> told GUARDED_BY(mutex);
  Gate arrived;
  Gate ended;
  NSErrorRef failure;  ///< once it ended
};

class HostThumbnailsTest : public HostTest {
 protected:
  HostThumbnailsTest() { startZarn(); }

  ipc::CallHandle begin(const std::vector<std::string>& identifiers, double width = 64,
                        double height = 32) const {
    return ipc::call(
        remote, &Control::Client::fetchThumbnailsRequest,
        [=, asking = asking](Control::FetchThumbnailsParams::Builder params) {
          auto list = params.initIdentifiers(static_cast<unsigned>(identifiers.size()));
          for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(identifiers[i]));
          params.setWidth(width);
          params.setHeight(height);
          params.setReceiver(kj::heap<ThumbnailClient::Receiver>(asking));
        },
        [asking = asking](NSErrorRef error,
                          const Control::FetchThumbnailsResults::Reader* results) {
          asking->failure = results != nullptr ? ipc::decodeOptional(results->getFailure()) : error;
          asking->ended.open();
        });
  }
  NSErrorRef fetch(const std::vector<std::string>& identifiers, double width = 64,
                   double height = 32) {
    (void)begin(identifiers, width, height);
    EXPECT_TRUE(asking->ended.wait(++fetches_));
    return asking->failure;
  }
  /// Items "t0", "t1" …
  std::vector<std::string> setManyItems(int count) const {
    std::vector<std::string> identifiers;
    std::map<std::string, std::uint64_t> items;
    for (int i = 0; i < count; ++i) {
      identifiers.push_back("t" + std::to_string(i));
      items[identifiers.back()] = 1;
    }
    setItems(items);
    return identifiers;
  }
  [[nodiscard]] std::string journal() const {
    std::ifstream file(home + "/fake/journal");
    return {std::istreambuf_iterator<char>(file), {}};
  }
  bool waitForJournal(const std::string& text) const {
    return waitForStatus([&](const Status&) { return journal().contains(text); });
  }

  const std::shared_ptr<ThumbnailClient> asking = std::make_shared<ThumbnailClient>();

 private:
  int fetches_ = 0;
};

TEST_F(HostThumbnailsTest, EachItemIsToldOfOnceWithWhatCameFirst) {
  startHost();
  EXPECT_EQ(fetch({"a", "b", "none of it", "a"}), nullptr);
  const std::map<std::string, std::string> expected{
      {"a", "wide of a"}, {"b", "wide of b"}, {"none of it", "-"}};
  EXPECT_EQ(asking->byIdentifier(), expected);
  EXPECT_EQ(asking->all().at(0).contentType, "x/fake");
}

TEST_F(HostThumbnailsTest, AFailureIsThatOfItsItemOfWhatWasLeftAndOfTheWhole) {
  startHost();
  const auto error = fetch({"a", "stray", "none of it"});
  const std::map<std::string, std::string> expected{
      {"a", "wide of a"}, {"stray", "-1005"}, {"none of it", "-1005"}};
  EXPECT_EQ(asking->byIdentifier(), expected);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem));
}

TEST_F(HostThumbnailsTest, NothingIsFetchedForNobody) {
  startHost();
  EXPECT_EQ(fetch({}), nullptr);
  EXPECT_EQ(journal(), "");
}

TEST_F(HostThumbnailsTest, ManyItemsAreAskedForInParts) {
  startHost();
  const auto identifiers = setManyItems(1000);
  EXPECT_EQ(fetch(identifiers), nullptr);
  EXPECT_THAT(asking->byIdentifier(), SizeIs(1000));
  EXPECT_THAT(journal(), AllOf(HasSubstr("thumbnails 16\n"), HasSubstr("thumbnails 256\n")));
}

TEST_F(HostThumbnailsTest, WhatIsLostWithTheExtensionIsAskedForAgain) {
  startHost();
  const auto identifiers = setManyItems(400);
  command("die-on-thumbnails");
  EXPECT_EQ(fetch(identifiers), nullptr);
  const auto told = asking->byIdentifier();
  EXPECT_THAT(told, SizeIs(400));
  EXPECT_EQ(told.at("t399"), "wide of t399");
  EXPECT_GE(status().starts, 2U);
}

TEST_F(HostThumbnailsTest, WithoutADaemonEveryItemIsToldWhy) {
  stopZarn();
  startHost([](Host::Options& options) { options.supervision.acquire = std::chrono::seconds(1); });
  const auto identifiers = setManyItems(600);
  const auto error = fetch(identifiers);
  ASSERT_NE(error, nullptr);
  EXPECT_THAT(error->localizedDescription(), HasSubstr("yomber up"));
  const auto all = asking->all();
  EXPECT_THAT(all, SizeIs(600));
  for (const auto& each : all) EXPECT_NE(each.error, nullptr);
}

TEST_F(HostThumbnailsTest, AClientThatTakesNothingHoldsTheExtensionBackAndCancelsByGoing) {
  startHost();
  command("large-thumbnails");
  const auto identifiers = setManyItems(100);
  asking->holds = true;
  const auto call = begin(identifiers);
  ASSERT_TRUE(asking->arrived.wait());
  call.cancel();
  ASSERT_TRUE(waitForJournal("thumbnails cancelled"));
  EXPECT_LT(asking->all().size(), 40U);
}

TEST_F(HostThumbnailsTest, AClientThatFailsEndsTheFetch) {
  startHost();
  const auto identifiers = setManyItems(1000);
  asking->refuses = true;
  EXPECT_NE(fetch(identifiers), nullptr);
  EXPECT_LT(asking->all().size(), 1000U);
}

TEST_F(HostThumbnailsTest, RequestsThatMakeNoSenseAreRefused) {
  startHost();
  for (const double side : {0.0, -3.0, std::numeric_limits<double>::quiet_NaN()}) {
    EXPECT_NE(fetch({"a"}, side, 32), nullptr);
    EXPECT_NE(fetch({"a"}, 32, side), nullptr);
  }
  EXPECT_NE(fetch({std::string(5000, 'x')}), nullptr);
  EXPECT_NE(fetch(std::vector<std::string>(100'001, "a")), nullptr);
  EXPECT_THAT(asking->all(), SizeIs(0));
}

TEST_F(HostThumbnailsTest, MoreFetchesThanThereMayBeAreRefused) {
  startHost([](Host::Options& options) { options.maximumThumbnailFetches = 1; });
  asking->holds = true;
  const auto call = begin({"a"});
  ASSERT_TRUE(asking->arrived.wait());
  (void)begin({"b"});
  ASSERT_TRUE(asking->ended.wait());
  EXPECT_NE(asking->failure, nullptr);
  call.cancel();
}

}  // namespace
}  // namespace yomber
