#include "zarn/item_setters.h"

#include <gmock/gmock.h>

#include <thread>

#include "platform/foundation/fault_attributes.h"
#include "platform/ostrell/constants.h"
#include "zarn/test_drive.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

class ItemSettersTest : public TestDrive {
 protected:
  ItemSettersTest() {
    makeSetters();
    scan();
  }
  void makeSetters() {
    setters.emplace(store, std::shared_ptr<Scanner>(scanner.get(), [](Scanner*) {}));
  }

  NSErrorRef tag(const std::string& path, const std::vector<std::string>& names) {
    return setters->setTagNames(at(path), names);
  }
  [[nodiscard]] ItemExtra extraOf(const std::string& path) const {
    const auto found = row(path);
    return found && found->extra ? *found->extra : ItemExtra{};
  }
  [[nodiscard]] std::optional<std::string> attributeOf(const std::string& path,
                                                       const char* name) const {
    std::string value(65536, '\0');
    const ssize_t length = lgetxattr(at(path).c_str(), name, value.data(), value.size());
    if (length < 0) return std::nullopt;
    value.resize(static_cast<std::size_t>(length));
    return value;
  }
  [[nodiscard]] struct stat statusOf(const std::string& path) const {
    struct stat status{};
    EXPECT_EQ(lstat(at(path).c_str(), &status), 0);
    return status;
  }
  static void expectInvalid(const NSErrorRef& error) {
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter))
        << error->description();
  }
  static void expectRefused(const NSErrorRef& error, int number) {
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileWriteUnknownError)) << error->description();
    ASSERT_NE(error->underlyingError(), nullptr);
    EXPECT_EQ(error->underlyingError()->code(), number) << error->description();
  }

  std::optional<ItemSetters> setters;
};

TEST_F(ItemSettersTest, SetsTagsWhereOtherProgramsReadThem) {
  write("a.txt");
  EXPECT_EQ(tag("a.txt", {"work", "two words", "\xc3\xa9"}), nullptr);
  EXPECT_EQ(attributeOf("a.txt", kTagsAttribute), "work,two words,\xc3\xa9");
  EXPECT_THAT(extraOf("a.txt").tags, ElementsAre("work", "two words", "\xc3\xa9"));
  EXPECT_EQ(tag("a.txt", {"only"}), nullptr);
  EXPECT_THAT(extraOf("a.txt").tags, ElementsAre("only"));
}

TEST_F(ItemSettersTest, RemovesTheAttributeWithTheLastTag) {
  write("a.txt");
  EXPECT_EQ(tag("a.txt", {"work"}), nullptr);
  EXPECT_EQ(tag("a.txt", {}), nullptr);
  EXPECT_EQ(attributeOf("a.txt", kTagsAttribute), std::nullopt);
  EXPECT_EQ(row("a.txt")->extra, nullptr);
  EXPECT_EQ(tag("a.txt", {}), nullptr);
}

TEST_F(ItemSettersTest, KeepsTagsInTheirOrderAndEachOnce) {
  write("a.txt");
  EXPECT_EQ(tag("a.txt", {"z", " a ", "z", "a", "m"}), nullptr);
  EXPECT_THAT(extraOf("a.txt").tags, ElementsAre("z", "a", "m"));
}

TEST_F(ItemSettersTest, RefusesTagsThatCannotBeReadBack) {
  write("a.txt");
  EXPECT_EQ(tag("a.txt", {"before"}), nullptr);
  for (const std::string& bad :
       {std::string("a,b"), std::string(","), std::string(), std::string("  "),
        std::string("\xff\xfe"), std::string("a\0b", 3)}) {
    expectInvalid(tag("a.txt", {"good", bad}));
  }
  EXPECT_THAT(extraOf("a.txt").tags, ElementsAre("before"));
}

TEST_F(ItemSettersTest, RefusesMoreTagsThanAFileCanCarry) {
  write("a.txt");
  EXPECT_EQ(tag("a.txt", {"before"}), nullptr);
  std::vector<std::string> names;
  for (int i = 0; i < 20'000; ++i) names.push_back("tag" + std::to_string(i));
  const NSErrorRef error = tag("a.txt", names);
  expectRefused(error, E2BIG);
  EXPECT_THAT(error->localizedDescription(), HasSubstr("fewer"));
  EXPECT_THAT(extraOf("a.txt").tags, ElementsAre("before"));
  EXPECT_EQ(attributeOf("a.txt", kTagsAttribute), "before");
}

TEST_F(ItemSettersTest, SetsDatesAndRanks) {
  write("a.txt");
  EXPECT_EQ(setters->setLastUsedDate(at("a.txt"), 1'700'000'000'123'456'789), nullptr);
  EXPECT_EQ(setters->setFavoriteRank(at("a.txt"), -3), nullptr);
  EXPECT_EQ(extraOf("a.txt").lastUsed, 1'700'000'000'123'456'789);
  EXPECT_EQ(extraOf("a.txt").favoriteRank, -3);
  EXPECT_EQ(attributeOf("a.txt", kLastUsedAttribute), "1700000000123456789");
  EXPECT_EQ(attributeOf("a.txt", kFavoriteAttribute), "-3");
  EXPECT_EQ(setters->setLastUsedDate(at("a.txt"), {}), nullptr);
  EXPECT_EQ(setters->setFavoriteRank(at("a.txt"), {}), nullptr);
  EXPECT_EQ(row("a.txt")->extra, nullptr);
}

TEST_F(ItemSettersTest, SetsFoldersAndFaultsToo) {
  makeFolder("folder");
  write("fault.txt", "beginning");
  setAttribute("fault.txt", kFaultAttribute, "x");
  for (const char* path : {"folder", "fault.txt"}) {
    EXPECT_EQ(tag(path, {"work"}), nullptr);
    EXPECT_EQ(attributeOf(path, kTagsAttribute), "work");
    EXPECT_THAT(extraOf(path).tags, ElementsAre("work"));
  }
  EXPECT_EQ(row("fault.txt")->flags & row_flag::kDownloaded, 0U);
}

TEST_F(ItemSettersTest, SetsAnApplicationsFolder) {
  ASSERT_EQ(store->setContainers({{"org.example.Notes", "Notes"}}), nullptr);
  const std::string documents = layout.documents("org.example.Notes");
  EXPECT_EQ(setters->setFavoriteRank(documents, 1), nullptr);
  const auto folder = store->itemForContainer("org.example.Notes");
  ASSERT_TRUE(folder && folder->extra);
  EXPECT_EQ(folder->extra->favoriteRank, 1);
  EXPECT_EQ(folder->extra->containerID, "org.example.Notes");
}

TEST_F(ItemSettersTest, LeavesContentAndDatesAlone) {
  write("a.txt", "content");
  ASSERT_TRUE(scanner->scanLocation(at("a.txt")).has_value());
  const struct stat before = statusOf("a.txt");
  const auto version = itemVersion(*row("a.txt"));
  EXPECT_EQ(tag("a.txt", {"work"}), nullptr);
  const struct stat after = statusOf("a.txt");
  EXPECT_EQ(after.st_mtim.tv_sec, before.st_mtim.tv_sec);
  EXPECT_EQ(after.st_mtim.tv_nsec, before.st_mtim.tv_nsec);
  EXPECT_EQ(after.st_size, before.st_size);
  EXPECT_EQ(itemVersion(*row("a.txt")), version);
}

TEST_F(ItemSettersTest, KeepsAnItemMarkedAsUploaded) {
  write("a.txt", "content");
  ASSERT_TRUE(scanner->scanLocation(at("a.txt")).has_value());
  ASSERT_EQ(database->write([&](WriteTransaction& transaction) -> NSErrorRef {
    ItemRow uploaded = *row("a.txt");
    const ItemRow before = uploaded;
    uploaded.flags |= row_flag::kUploaded;
    (void)transaction.update(before, uploaded);
    return nullptr;
  }),
            nullptr);
  EXPECT_EQ(tag("a.txt", {"work"}), nullptr);
  scan();
  EXPECT_NE(row("a.txt")->flags & row_flag::kUploaded, 0U);
}

TEST_F(ItemSettersTest, IsSeenAsOneChangeByScansThatFollow) {
  write("a.txt");
  scan();
  (void)sink->take();
  EXPECT_EQ(tag("a.txt", {"work"}), nullptr);
  EXPECT_EQ(sink->take().size(), 1U);
  EXPECT_EQ(scan().changes, 0U);
  EXPECT_EQ(tag("a.txt", {"work"}), nullptr);
  EXPECT_THAT(sink->take(), IsEmpty());
}

TEST_F(ItemSettersTest, SetsTwiceWithinOneTickOfTheDisksClock) {
  write("a.txt");
  for (int i = 0; i < 50; ++i) {
    const std::string name = std::to_string(i);
    EXPECT_EQ(tag("a.txt", {name}), nullptr);
    EXPECT_THAT(extraOf("a.txt").tags, ElementsAre(name));
  }
}

TEST_F(ItemSettersTest, KeepsForLinksWhatTheyCannotCarry) {
  write("target.txt");
  write("two.txt");
  fs::create_symlink("target.txt", at("link"));
  fs::create_symlink("nowhere", at("dangling"));
  fs::create_hard_link(at("two.txt"), at("second.txt"));
  scan();
  for (const char* path : {"link", "dangling", "second.txt"}) {
    EXPECT_EQ(tag(path, {"work", path}), nullptr) << path;
    EXPECT_EQ(setters->setFavoriteRank(at(path), 7), nullptr) << path;
  }
  EXPECT_EQ(attributeOf("target.txt", kTagsAttribute), std::nullopt);
  EXPECT_EQ(attributeOf("two.txt", kTagsAttribute), std::nullopt);
  EXPECT_THAT(extraOf("two.txt").tags, IsEmpty());

  rename("link", "renamed");
  ASSERT_EQ(lutimes(at("dangling").c_str(), nullptr), 0);
  ASSERT_EQ(chmod(at("second.txt").c_str(), 0640), 0);
  scan();
  reopen();
  makeSetters();
  scan();
  EXPECT_THAT(extraOf("renamed").tags, ElementsAre("work", "link"));
  EXPECT_THAT(extraOf("dangling").tags, ElementsAre("work", "dangling"));
  EXPECT_THAT(extraOf("second.txt").tags, ElementsAre("work", "second.txt"));
  EXPECT_EQ(extraOf("second.txt").favoriteRank, 7);
  EXPECT_EQ(tag("dangling", {}), nullptr);
  scan();
  EXPECT_THAT(extraOf("dangling").tags, IsEmpty());
  EXPECT_EQ(extraOf("dangling").favoriteRank, 7);
}

TEST_F(ItemSettersTest, TakesTagsFromOneNameOfAFileWithoutTheOthers) {
  write("one.txt");
  EXPECT_EQ(tag("one.txt", {"work"}), nullptr);
  fs::create_hard_link(at("one.txt"), at("two.txt"));
  scan();
  EXPECT_EQ(tag("two.txt", {}), nullptr);
  ASSERT_EQ(chmod(at("two.txt").c_str(), 0640), 0);
  scan();
  EXPECT_THAT(extraOf("two.txt").tags, IsEmpty());
  EXPECT_THAT(extraOf("one.txt").tags, ElementsAre("work"));
}

TEST_F(ItemSettersTest, GivesAFileItsTagsOnceItCanCarryThem) {
  write("one.txt");
  fs::create_hard_link(at("one.txt"), at("two.txt"));
  scan();
  EXPECT_EQ(tag("two.txt", {"work"}), nullptr);
  fs::remove(at("one.txt"));
  scan();
  EXPECT_EQ(attributeOf("two.txt", kTagsAttribute), "work");
  EXPECT_THAT(extraOf("two.txt").tags, ElementsAre("work"));
  setAttribute("two.txt", kTagsAttribute, "others");
  scan();
  EXPECT_THAT(extraOf("two.txt").tags, ElementsAre("others"));
}

TEST_F(ItemSettersTest, LeavesADocumentItsTagsWhenItIsSavedAnew) {
  write("a.txt", "first");
  EXPECT_EQ(tag("a.txt", {"work"}), nullptr);
  const std::uint64_t before = id("a.txt");
  write(".a.txt.new", "second");
  rename(".a.txt.new", "a.txt");
  scan();
  EXPECT_EQ(id("a.txt"), before);
  EXPECT_THAT(extraOf("a.txt").tags, ElementsAre("work"));
  EXPECT_EQ(attributeOf("a.txt", kTagsAttribute), "work");
  write(".a.txt.new", "third");
  setAttribute(".a.txt.new", kTagsAttribute, "of its own");
  rename(".a.txt.new", "a.txt");
  scan();
  EXPECT_EQ(id("a.txt"), before);
  EXPECT_THAT(extraOf("a.txt").tags, ElementsAre("of its own"));
}

TEST_F(ItemSettersTest, TakesPhysicalLocationsToo) {
  write("e\xcc\x81");
  write("\xc3\xa9");
  scan();
  const auto rows = store->children(kRootID);
  for (const ItemRow& item : rows) {
    EXPECT_EQ(setters->setFavoriteRank(at(item.nameOnDisk()), 5), nullptr);
  }
  int favorites = 0;
  for (const ItemRow& item : store->children(kRootID)) {
    favorites += item.extra && item.extra->favoriteRank == 5 ? 1 : 0;
  }
  EXPECT_EQ(favorites, 2);
}

TEST_F(ItemSettersTest, LeavesDiskAndRowInStepWhenManySetAtOnce) {
  write("a.txt");
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 10; ++i) {
        EXPECT_EQ(tag("a.txt", {"tag" + std::to_string(t * 100 + i)}), nullptr);
        EXPECT_EQ(setters->setFavoriteRank(at("a.txt"), t), nullptr);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  const auto attributes = readItemAttributes(at("a.txt").c_str());
  EXPECT_EQ(extraOf("a.txt").tags, attributes.extra.tags);
  EXPECT_EQ(extraOf("a.txt").favoriteRank, attributes.extra.favoriteRank);
}

TEST_F(ItemSettersTest, RefusesTheDriveItself) {
  for (const std::string& path : {layout.root(), layout.trashFiles()}) {
    expectRefused(setters->setTagNames(path, {"work"}), EPERM);
    expectRefused(setters->setFavoriteRank(path, 1), EPERM);
    expectRefused(setters->setLastUsedDate(path, 1), EPERM);
  }
}

TEST_F(ItemSettersTest, RefusesPrivatePlacesAndWhatIsOutside) {
  expectRefused(setters->setTagNames(layout.promises() + "/1", {"x"}), EPERM);
  expectInvalid(setters->setTagNames("/etc/passwd", {"x"}));
  const NSErrorRef error = tag("nothing", {"x"});
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

}  // namespace
}  // namespace yomber
