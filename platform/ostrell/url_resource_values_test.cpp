#include "platform/ostrell/url_resource_values.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <optional>
#include <string>

#include "platform/ostrell/errors.h"
#include "platform/ostrell/scripted_daemon.h"
#include "protocols/common.capnp.h"

namespace yomber {
namespace {

class URLResourceValuesTest : public testing::Test {
 protected:
  NSURLRef document(bool isShared) {
    ItemFields item = scriptedDocument(5, "five.txt");
    if (isShared) item.flags |= protocol::ITEM_FLAG_SHARED;
    daemon.addItem(item, daemon.root() + "/five.txt");
    return NSURL::fileURLWithPath(daemon.root() + "/five.txt");
  }

  ScriptedDaemon daemon;
  std::optional<bool> value;
  NSErrorRef error;
};

TEST_F(URLResourceValuesTest, SayWhetherTheItemIsShared) {
  EXPECT_TRUE(getResourceValue(document(true), value, NSURLUbiquitousItemIsSharedKey, &error));
  EXPECT_EQ(value, true);
  EXPECT_TRUE(getResourceValue(document(false), value, NSURLUbiquitousItemIsSharedKey, &error));
  EXPECT_EQ(value, false);
  EXPECT_EQ(error, nullptr);
}

TEST_F(URLResourceValuesTest, FailForWhatIsNotThereAndForOtherKeys) {
  const auto missing = NSURL::fileURLWithPath(daemon.root() + "/missing");
  EXPECT_FALSE(getResourceValue(missing, value, NSURLUbiquitousItemIsSharedKey, &error));
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  EXPECT_FALSE(getResourceValue(document(true), value, "NSURLOtherKey", &error));
  EXPECT_TRUE(qs_isOstrellErrorCode(error, QSOstrellErrorInvalidParameter));
  EXPECT_EQ(value, std::nullopt);
}

TEST_F(URLResourceValuesTest, KnowBookmarksWithoutAskingTheDaemon) {
  const auto url = document(false);
  std::ofstream(url->path()) << "content";
  ASSERT_EQ(symlink("five.txt", (daemon.root() + "/link").c_str()), 0);
  const auto link = NSURL::fileURLWithPath(daemon.root() + "/link");
  EXPECT_TRUE(getPromisedItemResourceValue(link, value, NSURLIsAliasFileKey, &error));
  EXPECT_EQ(value, true);
  EXPECT_TRUE(getPromisedItemResourceValue(url, value, NSURLIsAliasFileKey, &error));
  EXPECT_EQ(value, false);
  EXPECT_EQ(daemon.callCount("itemAtLocation"), 0U);
}

TEST_F(URLResourceValuesTest, AskTheDaemonAboutAnItemWithoutAFile) {
  ItemFields item = scriptedDocument(6, "link");
  item.kind = ItemKind::Bookmark;
  daemon.addItem(item, daemon.root() + "/link");
  const auto link = NSURL::fileURLWithPath(daemon.root() + "/link");
  EXPECT_TRUE(getPromisedItemResourceValue(link, value, NSURLIsAliasFileKey, &error));
  EXPECT_EQ(value, true);
  const auto missing = NSURL::fileURLWithPath(daemon.root() + "/missing");
  EXPECT_FALSE(getPromisedItemResourceValue(missing, value, NSURLIsAliasFileKey, &error));
  EXPECT_NE(error, nullptr);
}

TEST_F(URLResourceValuesTest, SayNothingOfNoLocation) {
  EXPECT_FALSE(getPromisedItemResourceValue(nullptr, value, NSURLIsAliasFileKey, &error));
  EXPECT_EQ(qs_typeIdentifierWithError(nullptr, &error), std::nullopt);
  EXPECT_EQ(value, std::nullopt);
  EXPECT_EQ(error, nullptr);
}

TEST_F(URLResourceValuesTest, SayOfWhichTypeTheItemIs) {
  EXPECT_EQ(qs_typeIdentifierWithError(document(false), &error), "text/plain");
  EXPECT_EQ(qs_typeIdentifierWithError(NSURL::fileURLWithPath(daemon.root() + "/missing"), &error),
            std::nullopt);
  EXPECT_NE(error, nullptr);
}

}  // namespace
}  // namespace yomber
