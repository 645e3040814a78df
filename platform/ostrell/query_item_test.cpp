#include "platform/ostrell/query_item.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/ostrell/container.h"
#include "platform/ostrell/scripted_daemon.h"

namespace yomber {
namespace {

TEST(QueryItem, TellsItsIDAndWhetherItIsDead) {
  const QSQueryItem document(scriptedDocument(5, "five.txt"));
  EXPECT_EQ(document.fileObjectID()->asString(), "d:5");
  EXPECT_FALSE(document.isDead());
  auto fields = scriptedFolder(6, "six");
  fields.flags |= 1;
  const QSQueryItem deletion(fields);
  EXPECT_EQ(deletion.fileObjectID()->asString(), "i:6");
  EXPECT_TRUE(deletion.isDead());
  fields.identifier = NSFileProviderRootContainerItemIdentifier;
  EXPECT_FALSE(QSQueryItem(fields).fileObjectID());
  EXPECT_NE(document.description().find("five.txt"), std::string::npos);
}

TEST(QueryItem, TheFrameworkGetsTheVerySameObjects) {
  const QSQueryItems items = {std::make_shared<QSQueryItem>(scriptedDocument(5, "five.txt"))};
  const auto converted = fileProviderItems(items);
  ASSERT_EQ(converted.size(), 1U);
  EXPECT_EQ(converted[0].get(), items[0].get());
}

class QueryItemTest : public testing::Test {
 protected:
  QueryItemTest() { daemon.addItem(item, daemon.root() + "/five.txt"); }

  static ItemFields fullItem() {
    auto fields = scriptedDocument(5, std::string("five\xff\n.txt"), "i:3");
    fields.size = 1U << 30U;
    fields.creationDate = NSDate::fromNanoseconds(-1);
    fields.modificationDate = NSDate::fromNanoseconds(1'700'000'000'123'456'789);
    fields.lastUsedDate = NSDate::fromNanoseconds(0);
    fields.favoriteRank = 0;
    fields.tags = {"red", "", "b c"};
    fields.rank = 99;
    fields.version = 7;
    fields.containerID = "org.example.App";
    return fields;
  }

  ScriptedDaemon daemon;
  const ItemFields item = fullItem();
};

TEST_F(QueryItemTest, AskingTheDaemonBringsEveryField) {
  NSErrorRef error;
  const auto url = NSURL::fileURLWithPath(daemon.root() + "/five.txt");
  const auto got = QSQueryItem::askDaemonQueryItemForURL(url, ForceScan::Yes, &error);
  ASSERT_TRUE(got);
  EXPECT_FALSE(error);
  EXPECT_EQ(got->fields(), item);
  EXPECT_EQ(daemon.calls().back(),
            (ScriptedDaemon::Call{"itemAtLocation", {daemon.root() + "/five.txt", "true"}}));
}

TEST_F(QueryItemTest, AskingForWhatIsNotThereGivesTheDaemonsError) {
  NSErrorRef error;
  const auto url = NSURL::fileURLWithPath(daemon.root() + "/six.txt");
  EXPECT_FALSE(QSQueryItem::askDaemonQueryItemForURL(url, ForceScan::No, &error));
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
  EXPECT_FALSE(QSQueryItem::askDaemonQueryItemForURL(url, ForceScan::No, nullptr));
  NSErrorRef nilError;
  EXPECT_FALSE(QSQueryItem::askDaemonQueryItemForURL(nullptr, ForceScan::No, &nilError));
  ASSERT_TRUE(nilError);
  EXPECT_TRUE(nilError->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

TEST_F(QueryItemTest, AnItemWithoutAnIdentityIsNoAnswer) {
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.itemAtLocation = [](const std::string&, bool) { return ScriptedDaemon::Item{}; };
  });
  NSErrorRef error;
  EXPECT_FALSE(QSQueryItem::askDaemonQueryItemForURL(NSURL::fileURLWithPath(daemon.root()),
                                                     ForceScan::No, &error));
  ASSERT_TRUE(error);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(QueryItemTest, ContainerItems) {
  const auto containers = QSContainer::allContainersByContainerID();
  const auto root =
      QSQueryItem::containerItemForContainer(containers.begin()->second, ForceScan::No);
  ASSERT_TRUE(root);
  EXPECT_EQ(root->itemIdentifier(), NSFileProviderRootContainerItemIdentifier);
  daemon.script([](ScriptedDaemon::Answers& answers) {
    answers.containerItem = [](const std::string&, bool) {
      return ScriptedDaemon::Item{{}, NSError::errorWithErrno(EIO)};
    };
  });
  EXPECT_FALSE(QSQueryItem::containerItemForContainer(containers.begin()->second, ForceScan::Yes));
  EXPECT_EQ(daemon.calls().back().arguments.at(1), "true");
  EXPECT_FALSE(QSQueryItem::containerItemForContainer(nullptr, ForceScan::No));
}

}  // namespace
}  // namespace yomber
