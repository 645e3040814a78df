#include <gtest/gtest.h>

#include <cerrno>
#include <future>
#include <string>
#include <utility>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/served_extension.h"
#include "platform/foundation/gate.h"
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
