#include <gtest/gtest.h>

#include <cerrno>
#include <future>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/served_extension.h"
#include "platform/foundation/gate.h"
#include "platform/foundation/lock.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Extension;

class ContentExtension final : public NSFileProviderExtension {
 public:
  using NSFileProviderExtension::startProvidingItemAtURL;
  void startProvidingItemAtURL(const NSURLRef& url, NSFileCoordinatorReadingOptions readingOptions,
                               ErrorHandler completionHandler) override {
    provided = url->path();
    options = readingOptions;
    if (provided == "/forgotten") return;
    if (provided == "/later") {
      held = std::move(completionHandler);
      started.open();
      return;
    }
    completionHandler(provided == "/failing" ? NSError::errorWithErrno(ENOSPC) : nullptr);
  }
  void stopProvidingItemAtURL(const NSURLRef& url) override {
    stopped = url->path();
    if (held)
      std::exchange(held,
                    nullptr)(NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError));
  }
  void itemChangedAtURL(const NSURLRef& url) override { changed = url->path(); }
  void movingItemAtURL(const NSURLRef& url, const NSURLRef& destinationURL,
                       MoveHandler completionHandler) override {
    const bool isForbidden = destinationURL->path() == "/forbidden";
    completionHandler(url->path() == "/fault" && !isForbidden,
                      isForbidden ? NSError::errorWithErrno(EACCES) : nullptr);
  }

  std::string provided;
  std::uint64_t options = 0;
  std::string stopped;
  std::string changed;
  ErrorHandler held;
  Gate started;
};

/// An extension whose start of "/gated" waits at a gate before it has begun anything.
class GatedExtension final : public NSFileProviderExtension {
 public:
  using NSFileProviderExtension::startProvidingItemAtURL;
  void startProvidingItemAtURL(const NSURLRef& url, NSFileCoordinatorReadingOptions /*options*/,
                               ErrorHandler completionHandler) override {
    begun.open();
    const bool mayGoOn = url->path() != "/gated" || gate.wait();
    EXPECT_TRUE(mayGoOn);
    note("start " + url->path());
    completionHandler(nullptr);
  }
  void stopProvidingItemAtURL(const NSURLRef& url) override { note("stop " + url->path()); }

  std::vector<std::string> notes() {
    LockGuard guard(mutex_);
    return notes_;
  }

  Gate begun;
  Gate gate;

 private:
  void note(const std::string& text) {
    LockGuard guard(mutex_);
    notes_.push_back(text);
  }

  Mutex mutex_;
  std::vector<std::string> notes_ GUARDED_BY(mutex_);
};

class ContentRequests : public testing::Test {
 protected:
  NSErrorRef provide(const std::string& path, std::uint64_t options = 0) {
    NSErrorRef failure;
    EXPECT_EQ(nullptr,
              ipc::callAndWait(
                  served_.remote, &Extension::Client::startProvidingRequest,
                  [&](auto params) {
                    params.setPath(wireData(path));
                    params.setOptions(options);
                  },
                  [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); }));
    return failure;
  }
  void stop(const std::string& path) {
    EXPECT_EQ(nullptr, ipc::callAndWait(
                           served_.remote, &Extension::Client::stopProvidingRequest,
                           [&](auto params) { params.setPath(wireData(path)); }, [](auto) {}));
  }
  std::pair<bool, NSErrorRef> moving(const std::string& path, const std::string& destination) {
    std::pair<bool, NSErrorRef> answer;
    EXPECT_EQ(nullptr, ipc::callAndWait(
                           served_.remote, &Extension::Client::movingItemRequest,
                           [&](auto params) {
                             params.setPath(wireData(path));
                             params.setDestination(wireData(destination));
                           },
                           [&](auto results) {
                             answer = {results.getRequiresProviding(),
                                       ipc::decodeOptional(results.getFailure())};
                           }));
    return answer;
  }

  const std::shared_ptr<ContentExtension> extension_ = std::make_shared<ContentExtension>();
  const ServedExtension served_{extension_};
};

TEST_F(ContentRequests, ProvidesWithTheOptionsGiven) {
  EXPECT_EQ(provide("/there", 0x20000), nullptr);
  EXPECT_EQ(extension_->provided, "/there");
  EXPECT_EQ(extension_->options, 0x20000U);
  EXPECT_TRUE(provide("/failing")->is(NSPOSIXErrorDomain, ENOSPC));
}

TEST_F(ContentRequests, AStopEndsWhatIsUnderWay) {
  std::promise<NSErrorRef> answered;
  (void)ipc::call(
      served_.remote, &Extension::Client::startProvidingRequest,
      [](auto params) { params.setPath(wireData("/later")); },
      [&](const NSErrorRef&, const Extension::StartProvidingResults::Reader* results) {
        answered.set_value(ipc::decodeOptional(results->getFailure()));
      });
  ASSERT_TRUE(extension_->started.wait());
  stop("/later");
  EXPECT_EQ(extension_->stopped, "/later");
  EXPECT_TRUE(answered.get_future().get()->is(NSCocoaErrorDomain, NSUserCancelledError));
}

TEST(ContentRequestOrder, AStopNeverOvertakesTheStartThatCameBeforeItAndHoldsUpNoOther) {
  const auto extension = std::make_shared<GatedExtension>();
  const ServedExtension served(extension);
  Gate answered;
  const auto start = [&](const std::string& path) {
    (void)ipc::call(
        served.remote, &Extension::Client::startProvidingRequest,
        [path](auto params) { params.setPath(wireData(path)); },
        [&](const NSErrorRef&, const Extension::StartProvidingResults::Reader*) {
          answered.open();
        });
  };
  const auto stop = [&](const std::string& path) {
    (void)ipc::call(
        served.remote, &Extension::Client::stopProvidingRequest,
        [path](auto params) { params.setPath(wireData(path)); },
        [&](const NSErrorRef&, const Extension::StopProvidingResults::Reader*) {
          answered.open();
        });
  };
  start("/gated");
  stop("/gated");
  ASSERT_TRUE(extension->begun.wait());
  start("/other");
  stop("/other");
  ASSERT_TRUE(answered.wait(2));
  EXPECT_EQ(extension->notes(), (std::vector<std::string>{"start /other", "stop /other"}));
  extension->gate.open();
  ASSERT_TRUE(answered.wait(4));
  EXPECT_EQ(extension->notes(), (std::vector<std::string>{"start /other", "stop /other",
                                                          "start /gated", "stop /gated"}));
}

TEST_F(ContentRequests, AnswersWhatTheExtensionForgets) {
  EXPECT_TRUE(provide("/forgotten")->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ContentRequests, AsksWhetherAMoveNeedsTheContent) {
  EXPECT_EQ(moving("/fault", "/x"), std::pair(true, NSErrorRef()));
  EXPECT_EQ(moving("/here", "/x"), std::pair(false, NSErrorRef()));
  EXPECT_TRUE(moving("/fault", "/forbidden").second->is(NSPOSIXErrorDomain, EACCES));
}

TEST_F(ContentRequests, TellsOfChanges) {
  EXPECT_EQ(nullptr, ipc::callAndWait(
                         served_.remote, &Extension::Client::itemChangedRequest,
                         [](auto params) { params.setPath(wireData("/written")); }, [](auto) {}));
  EXPECT_EQ(extension_->changed, "/written");
}

TEST_F(ContentRequests, WhatIsNoLocationNeverReachesTheExtension) {
  EXPECT_TRUE(provide("relative")->is(NSPOSIXErrorDomain, EINVAL));
  EXPECT_TRUE(provide("/" + std::string(5'000, 'x'))->is(NSPOSIXErrorDomain, EINVAL));
  EXPECT_TRUE(moving("/x", "").second->is(NSPOSIXErrorDomain, EINVAL));
  stop("relative");
  EXPECT_EQ(extension_->provided + extension_->stopped, "");
}

}  // namespace
}  // namespace yomber
