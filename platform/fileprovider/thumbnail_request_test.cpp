#include "platform/fileprovider/thumbnail_request.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <kj/debug.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <functional>
#include <limits>
#include <memory>
#include <set>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/served_extension.h"
#include "platform/fileprovider/thumbnail_batch.h"
#include "platform/foundation/gate.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Extension;
using testing::ElementsAre;
using testing::SizeIs;

/// Delivers what the test says.
class ThumbnailExtension final : public NSFileProviderExtension {
 public:
  using Identifiers = std::vector<NSFileProviderItemIdentifier>;
  using NSFileProviderExtension::fetchThumbnailsForItemIdentifiers;
  NSProgressRef fetchThumbnailsForItemIdentifiers(const Identifiers& identifiers, CGSize size,
                                                  TypedThumbnailHandler handler,
                                                  ErrorHandler completionHandler) override {
    auto progress = NSProgress::progressWithTotalUnitCount(0);
    // May be called when the extension has gone.
    progress->setCancellationHandler([gate = cancelled] { gate->open(); });
    answer(identifiers, size, handler, completionHandler);
    returned.open();
    return progress;
  }

  std::function<void(const Identifiers&, CGSize, const TypedThumbnailHandler&, const ErrorHandler&)>
      answer;
  const std::shared_ptr<Gate> cancelled = std::make_shared<Gate>();
  Gate returned;
};

/// Takes thumbnails, and answers each call when it is told to.
class Receiver {
 public:
  class Server final : public protocol::ThumbnailReceiver::Server {
   public:
    explicit Server(std::shared_ptr<Receiver> receiver) : receiver_(std::move(receiver)) {}
    kj::Promise<void> didFetch(DidFetchContext context) override {
      return ThumbnailBatch::decode(context.getParams())
          .then([receiver = receiver_](ThumbnailBatch batch) { return receiver->take(batch); });
    }

   private:
    const std::shared_ptr<Receiver> receiver_;
  };

  std::vector<ItemThumbnail> all() {
    LockGuard guard(mutex_);
    return thumbnails_;
  }
  void release() {
    ipc::EventLoop::shared().runAndWait([this] {
      holds = false;
      for (auto& each : held_) {
        addAll(each.batch);
        each.answer->fulfill();
      }
      held_.clear();
    });
  }
  std::size_t taken() { return all().size(); }
  /// Files of images that were there when a call came, by inode.
  std::set<ino_t> files() {
    LockGuard guard(mutex_);
    return files_;
  }

  bool holds = false;    // loop thread once it is served; what is held has not been read
  bool refuses = false;  // loop thread once it is served
  Gate arrived;          ///< a call has

 private:
  struct Held {
    ThumbnailBatch batch;
    kj::Own<kj::PromiseFulfiller<void>> answer;
  };

  kj::Promise<void> take(ThumbnailBatch batch) {
    noteFiles();
    arrived.open();
    if (holds) {
      auto pair = kj::newPromiseAndFulfiller<void>();
      held_.push_back({std::move(batch), kj::mv(pair.fulfiller)});
      return kj::mv(pair.promise);
    }
    addAll(batch);
    if (refuses) KJ_FAIL_REQUIRE("no more");
    return kj::READY_NOW;
  }
  void addAll(const ThumbnailBatch& batch) {
    LockGuard guard(mutex_);
    for (std::size_t i = 0; i < batch.size(); ++i) thumbnails_.push_back(batch.at(i));
  }
  void noteFiles() {
    LockGuard guard(mutex_);
    for (const auto& each : std::filesystem::directory_iterator("/proc/self/fd")) {
      std::error_code gone;
      const auto target = std::filesystem::read_symlink(each.path(), gone).string();
      struct stat status{};
      if (target.starts_with("/memfd:yomber-images") && stat(each.path().c_str(), &status) == 0)
        files_.insert(status.st_ino);
    }
  }

  Mutex mutex_;
  std::vector<ItemThumbnail> thumbnails_ GUARDED_BY(mutex_);
  std::set<ino_t> files_ GUARDED_BY(mutex_);
  std::vector<Held> held_;  // loop thread
};

class ThumbnailRequestTest : public testing::Test {
 protected:
  ~ThumbnailRequestTest() override { receiver->release(); }  // a call that is held keeps everything

  /// Begins a request; `ended` opens with its failure.
  ipc::CallHandle begin(const std::vector<std::string>& identifiers, double side = 64) {
    return ipc::call(
        served_.remote, &Extension::Client::fetchThumbnailsRequest,
        [=, receiver = receiver](Extension::FetchThumbnailsParams::Builder params) {
          auto list = params.initIdentifiers(static_cast<unsigned>(identifiers.size()));
          for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(identifiers[i]));
          params.setWidth(side);
          params.setHeight(side);
          params.setReceiver(kj::heap<Receiver::Server>(receiver));
        },
        [this](NSErrorRef error, const Extension::FetchThumbnailsResults::Reader* results) {
          failure_ = results != nullptr ? ipc::decodeOptional(results->getFailure()) : error;
          ended.open();
        });
  }
  NSErrorRef request(const std::vector<std::string>& identifiers, double side = 64) {
    (void)begin(identifiers, side);
    EXPECT_TRUE(ended.wait(++requests_));
    return failure_;
  }

  const std::shared_ptr<ThumbnailExtension> extension = std::make_shared<ThumbnailExtension>();
  const std::shared_ptr<Receiver> receiver = std::make_shared<Receiver>();
  Gate ended;

 private:
  int requests_ = 0;
  NSErrorRef failure_;
  ServedExtension served_{extension};
};

TEST_F(ThumbnailRequestTest, TellsOfEachThumbnailWithItsTypeOrItsError) {
  extension->answer = [](const auto& identifiers, CGSize size, const auto& handler,
                         const auto& completion) {
    EXPECT_EQ(size, (CGSize{.width = 64, .height = 64}));
    handler(identifiers[0], NSData::dataWithString("picture"), "x/bare", nullptr);
    handler(identifiers[1], nullptr, std::nullopt, NSError::errorWithErrno(EIO));
    handler(identifiers[2], nullptr, std::nullopt, nullptr);
    handler(identifiers[2], NSData::dataWithString(""), std::nullopt, nullptr);
    completion(nullptr);
  };
  EXPECT_EQ(request({"a", "b", "c"}), nullptr);
  const auto all = receiver->all();
  ASSERT_THAT(all, SizeIs(4));
  EXPECT_EQ(all[0].identifier, "a");
  EXPECT_EQ(all[0].image->bytes(), "picture");
  EXPECT_EQ(all[0].contentType, "x/bare");
  EXPECT_EQ(all[1].image, nullptr);
  EXPECT_TRUE(all[1].error->is(NSPOSIXErrorDomain, EIO));
  EXPECT_EQ(all[2].image, nullptr);
  EXPECT_EQ(all[2].error, nullptr);
  ASSERT_NE(all[3].image, nullptr);
  EXPECT_EQ(all[3].image->length(), 0U);
}

TEST_F(ThumbnailRequestTest, FailsWithTheExtensionsErrorAfterTheLastThumbnail) {
  extension->answer = [](const auto&, CGSize, const auto& handler, const auto& completion) {
    handler("a", nullptr, std::nullopt, nullptr);
    completion(NSError::errorWithErrno(ENOSPC));
  };
  const auto failure = request({"a"});
  ASSERT_NE(failure, nullptr);
  EXPECT_TRUE(failure->is(NSPOSIXErrorDomain, ENOSPC));
  EXPECT_THAT(receiver->all(), SizeIs(1));
}

TEST_F(ThumbnailRequestTest, AnExtensionThatForgetsTheCompletionFailsTheRequest) {
  extension->answer = [](const auto&, CGSize, const auto&, const auto&) {};
  EXPECT_NE(request({"a"}), nullptr);
}

TEST_F(ThumbnailRequestTest, AnExtensionWithoutThumbnailsSaysSo) {
  const auto bare = std::make_shared<NSFileProviderExtension>();
  NSErrorRef failure;
  (void)bare->fetchThumbnailsForItemIdentifiers(
      {"a"}, {.width = 1, .height = 1}, TypedThumbnailHandler(),
      [&](NSErrorRef error) { failure = std::move(error); });
  ASSERT_NE(failure, nullptr);
  EXPECT_TRUE(failure->is(NSCocoaErrorDomain, NSFeatureUnsupportedError));
}

/// Knows no types.
class UntypedExtension final : public NSFileProviderExtension {
 public:
  using NSFileProviderExtension::fetchThumbnailsForItemIdentifiers;
  NSProgressRef fetchThumbnailsForItemIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize /*size*/,
      ThumbnailHandler handler, ErrorHandler completionHandler) override {
    if (handler) handler(identifiers.at(0), NSData::dataWithString("picture"), nullptr);
    completionHandler(nullptr);
    return nullptr;
  }
};

TEST_F(ThumbnailRequestTest, TheTypedFormOfAnExtensionWithoutTypesIsTheUntypedOne) {
  const auto untyped = std::make_shared<UntypedExtension>();
  std::vector<std::string> images;
  int completions = 0;
  const auto complete = [&](const NSErrorRef& error) { completions += error == nullptr ? 1 : 0; };
  (void)untyped->NSFileProviderExtension::fetchThumbnailsForItemIdentifiers(
      {"a"}, {.width = 1, .height = 1},
      TypedThumbnailHandler([&](const auto&, const NSDataRef& data,
                                const std::optional<std::string>& type, const NSErrorRef&) {
        images.emplace_back(data->bytes());
        EXPECT_EQ(type, std::nullopt);
      }),
      complete);
  (void)untyped->NSFileProviderExtension::fetchThumbnailsForItemIdentifiers(
      {"a"}, {.width = 1, .height = 1}, TypedThumbnailHandler(), complete);
  EXPECT_THAT(images, ElementsAre("picture"));
  EXPECT_EQ(completions, 2);
}

TEST_F(ThumbnailRequestTest, ASizeThatIsNoneIsRefused) {
  for (const double side : {0.0, -1.0, std::numeric_limits<double>::quiet_NaN(),
                            std::numeric_limits<double>::infinity()}) {
    const auto failure = request({"a"}, side);
    ASSERT_NE(failure, nullptr) << side;
    EXPECT_TRUE(failure->is(NSPOSIXErrorDomain, EINVAL));
  }
}

TEST_F(ThumbnailRequestTest, AnImageThatIsTooLargeBecomesAnError) {
  extension->answer = [](const auto&, CGSize, const auto& handler, const auto& completion) {
    handler("a", std::make_shared<NSData>(std::string(kMaximumThumbnailBytes + 1, 'x')),
            std::nullopt, nullptr);
    completion(nullptr);
  };
  const auto failure = request({"a"});
  EXPECT_EQ(failure, nullptr);
  const auto all = receiver->all();
  ASSERT_THAT(all, SizeIs(1));
  EXPECT_EQ(all[0].image, nullptr);
  EXPECT_NE(all[0].error, nullptr);
}

/// Images that tell themselves apart, four to a call.
std::string imageNumber(int number) {
  return std::string(static_cast<std::size_t>(300'000 + number), static_cast<char>('0' + number));
}

void expectImages(const std::vector<ItemThumbnail>& told, std::size_t count) {
  std::set<std::string> identifiers;
  for (const ItemThumbnail& each : told) {
    identifiers.insert(each.identifier);
    ASSERT_NE(each.image, nullptr) << each.identifier;
    EXPECT_TRUE(each.image->bytes() == imageNumber(std::stoi(each.identifier))) << each.identifier;
  }
  EXPECT_THAT(identifiers, SizeIs(count));
}

TEST_F(ThumbnailRequestTest, EveryImageIsItsOwnInFilesThatAreUsedAgain) {
  constexpr int kCount = 40;
  constexpr std::size_t kMostFiles = 8;
  extension->answer = [&](const auto&, CGSize, const auto& handler, const auto& completion) {
    for (int i = 0; i < kCount; ++i) {
      handler(std::to_string(i), NSData::dataWithString(imageNumber(i)), std::nullopt, nullptr);
      EXPECT_TRUE(receiver->arrived.wait(i + 1));  // so that each has a call of its own
    }
    completion(nullptr);
  };
  EXPECT_EQ(request({"a"}), nullptr);
  expectImages(receiver->all(), kCount);
  EXPECT_LE(receiver->files().size(), kMostFiles);
}

TEST_F(ThumbnailRequestTest, AFileIsNotUsedAgainBeforeItsCallIsAnswered) {
  receiver->holds = true;
  constexpr int kCount = 12;  // more than two calls' and less than what holds the extension up
  Gate delivered;
  extension->answer = [&](const auto&, CGSize, const auto& handler, const auto& completion) {
    for (int i = 0; i < kCount; ++i) {
      handler(std::to_string(i), NSData::dataWithString(imageNumber(i)), std::nullopt, nullptr);
    }
    delivered.open();
    completion(nullptr);
  };
  (void)begin({"a"});
  ASSERT_TRUE(delivered.wait());
  ASSERT_TRUE(receiver->arrived.wait(2));
  receiver->release();
  ASSERT_TRUE(ended.wait());
  expectImages(receiver->all(), kCount);
}

TEST_F(ThumbnailRequestTest, AReceiverThatTakesNothingHoldsTheExtensionUp) {
  receiver->holds = true;
  constexpr std::size_t kCount = 64;
  constexpr std::size_t kMostAhead = 6;
  Gate delivered;
  std::size_t mostAhead = 0;
  extension->answer = [&](const auto&, CGSize, const auto& handler, const auto& completion) {
    const auto image = NSData::dataWithString(std::string(1 << 20, 'x'));
    for (std::size_t i = 0; i < kCount; ++i) {
      handler("item " + std::to_string(i), image, std::nullopt, nullptr);
      delivered.open();
      mostAhead = std::max(mostAhead, i + 1 - receiver->taken());
    }
    completion(nullptr);
  };
  (void)begin({"a"});
  ASSERT_TRUE(receiver->arrived.wait(2));
  ASSERT_TRUE(delivered.wait(4));
  receiver->release();
  ASSERT_TRUE(ended.wait());
  EXPECT_LE(mostAhead, kMostAhead);
  EXPECT_EQ(receiver->taken(), kCount);
}

TEST_F(ThumbnailRequestTest, ARequestThatIsDroppedIsCancelledAndLetsTheExtensionGo) {
  receiver->holds = true;
  extension->answer = [](const auto&, CGSize, const auto& handler, const auto& completion) {
    const auto image = NSData::dataWithString(std::string(1 << 20, 'x'));
    for (int i = 0; i < 64; ++i) handler("a", image, std::nullopt, nullptr);
    completion(nullptr);
  };
  const auto call = begin({"a"});
  ASSERT_TRUE(receiver->arrived.wait(2));
  call.cancel();
  ASSERT_TRUE(extension->returned.wait());
  EXPECT_TRUE(extension->cancelled->wait());
}

TEST_F(ThumbnailRequestTest, AReceiverThatFailsEndsTheRequestWithoutHoldingItUp) {
  receiver->refuses = true;
  extension->answer = [](const auto&, CGSize, const auto& handler, const auto& completion) {
    const auto image = NSData::dataWithString(std::string(1 << 20, 'x'));
    for (int i = 0; i < 64; ++i) handler("a", image, std::nullopt, nullptr);
    completion(nullptr);
  };
  EXPECT_NE(request({"a"}), nullptr);
  EXPECT_LT(receiver->all().size(), 10U);
}

}  // namespace
}  // namespace yomber
