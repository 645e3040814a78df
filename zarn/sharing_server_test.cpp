#include "zarn/sharing_server.h"

#include <gtest/gtest.h>

#include "platform/ostrell/constants.h"
#include "platform/ostrell/share_wire.h"
#include "platform/rozzel/embedded_engine.h"
#include "zarn/test_daemon.h"

namespace yomber::test {
namespace {

using Wire = protocol::Sharing;

/// A daemon that "ada" is signed in to, and its sharing interface.
class SharingServerTest : public DaemonTest {
 protected:
  SharingServerTest() {
    write("Plans/a.txt", "text");
    write("note.txt", "note");
  }
  void begin() {
    upSignedIn();
    ASSERT_TRUE(itemAt(root_ + "/Plans/a.txt", true));
    call(
        &protocol::Daemon::Client::sharingRequest, [](auto) {},
        [&](auto results) { sharing_ = ipc::Remote<Wire>(results.getSharing()); });
  }
  ~SharingServerTest() override { sharing_ = nullptr; }

  template <typename Method, typename Fill, typename Decode>
  void ask(Method method, Fill fill, Decode decode) {
    const auto error = ipc::callAndWait(sharing_, method, fill, decode);
    ASSERT_EQ(error, nullptr) << error->description();
  }
  RZShareRef newShare(const std::string& name, NSErrorRef* error = nullptr) {
    RZShareRef share;
    NSErrorRef failure;
    if (error == nullptr) error = &failure;
    ask(
        &Wire::Client::newShareRequest,
        [&](auto params) { params.setPath(wireData(root_ + "/" + name)); },
        [&](auto results) { share = decodeShareResult(results.getResult(), error); });
    EXPECT_TRUE(share || error != &failure) << failure->description();
    return share;
  }
  RZShareRef copyShare(const std::string& name, NSErrorRef* error = nullptr,
                       std::string* rootPath = nullptr) {
    RZShareRef share;
    ask(
        &Wire::Client::copyShareRequest,
        [&](auto params) { params.setPath(wireData(root_ + "/" + name)); },
        [&](auto results) {
          share = decodeShareResult(results.getResult(), error);
          if (rootPath != nullptr && results.getRootPath().isValue())
            *rootPath = stringFromWire(results.getRootPath().getValue());
        });
    return share;
  }
  RZShareRef saveShare(const RZShareRef& share, NSErrorRef* error = nullptr) {
    RZShareRef saved;
    if (!share) return saved;
    ask(
        &Wire::Client::saveShareRequest,
        [&](auto params) { encodeShare(*share, params.initShare()); },
        [&](auto results) { saved = decodeShareResult(results.getResult(), error); });
    return saved;
  }

  ipc::Remote<Wire> sharing_;
};

TEST_F(SharingServerTest, AnItemIsSharedFoundAndSharedNoLonger) {
  begin();
  NSErrorRef error;
  EXPECT_EQ(copyShare("Plans", &error), nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorNotShared)) << error->description();
  const auto fresh = newShare("Plans");
  ASSERT_NE(fresh, nullptr);
  EXPECT_FALSE(fresh->isKnownToServer());
  EXPECT_EQ(fresh->title(), "Plans");
  EXPECT_EQ(fresh->ownerName(), "ada");
  EXPECT_EQ(fresh->type(), RZShareTypeFolder);
  const auto saved = saveShare(fresh);
  ASSERT_NE(saved, nullptr);
  EXPECT_TRUE(saved->isKnownToServer());
  std::string rootPath;
  const auto found = copyShare("Plans/a.txt", nullptr, &rootPath);
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->URL(), saved->URL());
  EXPECT_EQ(rootPath, root_ + "/Plans");
  NSErrorRef failure;
  ask(
      &Wire::Client::destroyShareRequest,
      [&](auto params) { encodeShare(*found, params.initShare()); },
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
  EXPECT_EQ(failure, nullptr);
  EXPECT_EQ(copyShare("Plans", &error), nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorNotShared));
}

TEST_F(SharingServerTest, ASharedItemHasALinkTokensAndOptions) {
  begin();
  const auto saved = saveShare(newShare("note.txt"));
  ASSERT_NE(saved, nullptr);
  std::string url;
  ask(
      &Wire::Client::copyShareURLRequest,
      [&](auto params) { params.setPath(wireData(root_ + "/note.txt")); },
      [&](auto results) { url = stringFromWire(results.getUrl().getValue()); });
  EXPECT_EQ(url, saved->URL());
  std::string token;
  ask(
      &Wire::Client::copyShareTokenRequest,
      [&](auto params) { params.setPath(wireData(root_ + "/note.txt")); },
      [&](auto results) { token = stringFromWire(results.getShareToken()); });
  EXPECT_FALSE(token.empty());
  const auto item = itemAt(root_ + "/note.txt", true);
  ASSERT_TRUE(item);
  EXPECT_NE(item->flags & row_flag::kShared, 0U);
  ask(
      &Wire::Client::shareOptionsRequest,
      [&](auto params) { params.setIdentifier(wireText(item->identifier)); },
      [&](auto results) {
        EXPECT_TRUE(results.getIsShared());
        EXPECT_TRUE(results.getMayWrite());
        EXPECT_TRUE(results.getIsSharedItself());
        EXPECT_TRUE(results.getFolderName().isNone());
        EXPECT_TRUE(results.getFailure().isNone());
      });
}

TEST_F(SharingServerTest, WithoutAnAccountNothingIsShared) {
  begin();
  ASSERT_EQ(signOut(), nullptr);
  NSErrorRef error;
  EXPECT_EQ(newShare("Plans", &error), nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut)) << error->description();
}

TEST_F(SharingServerTest, ALinkThatLeadsNowhereIsAnUnknownItem) {
  begin();
  NSErrorRef failure;
  ask(
      &Wire::Client::acceptShareRequest,
      [&](auto params) { params.setUrl("yomber-share:nothing"); },
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
  EXPECT_TRUE(rz_isError(failure, RZErrorUnknownItem));
}

TEST_F(SharingServerTest, WhatIsNoShareIsRefused) {
  begin();
  NSErrorRef failure;
  ask(
      &Wire::Client::saveShareRequest, [](auto params) { params.initShare().setTitle("half"); },
      [&](auto results) { failure = ipc::decodeError(results.getResult().getError()); });
  EXPECT_TRUE(failure->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter));
}

TEST_F(SharingServerTest, FixedPlacesCannotBeShared) {
  begin();
  const auto plans = itemAt(root_ + "/Plans", false);
  for (const auto& [id, isShareable] :
       std::vector<std::pair<std::uint64_t, bool>>{{kRootID, false}, {plans->rawID, true}}) {
    ask(
        &Wire::Client::checkIfShareableRequest, [&](auto params) { params.setRawID(id); },
        [&](auto results) {
          EXPECT_EQ(results.getShareable(), isShareable) << id;
          EXPECT_EQ(results.getFailure().isNone(), isShareable) << id;
        });
  }
}

}  // namespace
}  // namespace yomber::test
