#include <sys/mman.h>

#include <thread>

#include "zarn/content/test_content.h"

namespace yomber {
namespace {

class ContentEvictionsTest : public ContentDrive {
 protected:
  void expectRefused(const std::string& path, const std::string& why) {
    const NSErrorRef error = evict(path);
    ASSERT_NE(error, nullptr) << path;
    EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict)) << error->description();
    EXPECT_NE(error->localizedDescription().find(why), std::string::npos)
        << error->localizedDescription();
    EXPECT_FALSE(isFault(path));
  }
};

TEST_F(ContentEvictionsTest, WhatIsNotConfirmedStays) {
  goOffline();
  write("a", content(100'000));
  scan();
  expectRefused("a", "not confirmed");
}

TEST_F(ContentEvictionsTest, WhatHasChangedSinceStays) {
  write("a", content(100'000));
  settle();
  goOffline();
  write("a", content(100'000, 2));
  expectRefused("a", "changed");
  scan();
  expectRefused("a", "changed");
  EXPECT_EQ(read("a"), content(100'000, 2));
}

TEST_F(ContentEvictionsTest, AChangeThatKeepsSizeAndDateCountsAsOne) {
  write("a", content(100'000));
  settle();
  const struct stat before = status("a");
  write("a", content(100'000, 2));
  const timespec times[2] = {before.st_atim, before.st_mtim};
  ASSERT_EQ(utimensat(AT_FDCWD, at("a").c_str(), times, 0), 0);
  expectRefused("a", "changed");
}

TEST_F(ContentEvictionsTest, AChangeOfAttributesAloneIsNone) {
  write("a", content(100'000));
  settle();
  setAttribute("a", "user.note", "text");
  EXPECT_EQ(evict("a"), nullptr);
  EXPECT_TRUE(isFault("a"));
}

TEST_F(ContentEvictionsTest, NothingIsGivenUpWhileTheStoreIsOutOfReach) {
  write("a", content(100'000));
  settle();
  goOffline();
  const NSErrorRef error = evict("a");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(isOutOfReach(error)) << error->description();
  EXPECT_FALSE(isFault("a"));
  comeBack();
  EXPECT_EQ(evict("a"), nullptr);
  EXPECT_TRUE(isFault("a"));
}

TEST_F(ContentEvictionsTest, WhoIsToldThatContentWentSeesItGone) {
  write("a", content(100'000));
  settle();
  Answer answer;
  ContentState seen;
  engine->evict(at("a"), [&, told = answer.take()](const NSErrorRef& error) {
    seen = state("a");
    told(error);
  });
  ASSERT_EQ(answer.get(), nullptr);
  EXPECT_EQ(seen.local, ContentState::Local::Fault);
}

TEST_F(ContentEvictionsTest, ADateOfAnotherCenturyIsTheFilesOwnAlsoAfterwards) {
  const std::string text = content(100'000);
  for (const std::int64_t seconds : {13'569'465'600, -5'364'662'400}) {  // 2400 and 1800
    const timespec times[2] = {{seconds, 0}, {seconds, 0}};
    write("a", text);
    ASSERT_EQ(utimensat(AT_FDCWD, at("a").c_str(), times, 0), 0);
    const auto date = status("a").st_mtim.tv_sec;
    settle();
    ASSERT_EQ(evict("a"), nullptr);
    EXPECT_EQ(status("a").st_mtim.tv_sec, date);
    settle();
    ASSERT_EQ(provide("a"), nullptr);
    EXPECT_EQ(status("a").st_mtim.tv_sec, date);
    EXPECT_TRUE(read("a") == text);
  }
}

TEST_F(ContentEvictionsTest, WhatIsOpenSomewhereStays) {
  write("a", content(100'000));
  settle();
  {
    const FileDescriptor reader(::open(at("a").c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_TRUE(reader);
    expectRefused("a", "open");
  }
  EXPECT_EQ(evict("a"), nullptr);
}

TEST_F(ContentEvictionsTest, WhatIsOpenedDuringItKeepsItsContent) {
  const std::string text = content(100'000);
  write("a", text);
  settle();
  const std::string go = layout.home() + "/go";
  ASSERT_EQ(FaultPoint::arm("zarn.evict.marked=pause-until-file:" + go), nullptr);
  Answer answer;
  engine->evict(at("a"), answer.take());
  ASSERT_TRUE(waitUntil([&] { return std::filesystem::exists(go + ".reached"); }));
  EXPECT_EQ(::open(at("a").c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  std::ofstream(go).put('x');
  const NSErrorRef error = answer.get();
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict));
  EXPECT_FALSE(isFault("a"));
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentEvictionsTest, ATagThatIsSetDuringItIsSeen) {
  write("a", content(100'000));
  settle();
  stopAt("zarn.evict.punched");
  Answer answer;
  engine->evict(at("a"), answer.take());
  ASSERT_TRUE(isStopped());
  setAttribute("a", kTagsAttribute, "red");
  go();
  EXPECT_EQ(answer.get(), nullptr);
  EXPECT_TRUE(isFault("a"));
  scan();
  ASSERT_NE(row("a")->extra, nullptr);
  EXPECT_EQ(row("a")->extra->tags, std::vector<std::string>{"red"});
}

TEST_F(ContentEvictionsTest, WhatWasWrittenThroughAMapStaysAndGoesToTheStore) {
  const std::size_t size = 100'000;
  write("a", content(size));
  {
    const FileDescriptor file(::open(at("a").c_str(), O_RDWR | O_CLOEXEC));
    void* const map = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, file.get(), 0);
    ASSERT_NE(map, MAP_FAILED);
    auto* const bytes = static_cast<char*>(map);
    bytes[50'000] = 'x';
    settle();
    bytes[50'001] = 'y';  // the page is dirty already: the file's times stay as they are
    munmap(map, size);
  }
  const std::string text = read("a");
  expectRefused("a", "changed");
  EXPECT_EQ(read("a").substr(50'000, 2), "xy");
  EXPECT_TRUE(waitUntil([&] { return contentInStore(id("a")) == text; }));
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(evict("a"), nullptr);
}

TEST_F(ContentEvictionsTest, WhatTheStoreHasLostStaysAndGoesThereAgain) {
  const std::string text = content(100'000);
  write("a", text);
  settle();
  for (const std::string& asset : assetFiles()) std::filesystem::remove(asset);
  expectRefused("a", "lost");
  EXPECT_TRUE(read("a") == text);
  EXPECT_TRUE(waitUntil([&] { return state("a").upload == ContentState::Upload::Confirmed; }));
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(assetFiles().size(), 1U);
  EXPECT_EQ(evict("a"), nullptr);
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentEvictionsTest, WhatIsDamagedInTheStoreStaysAndGoesThereAgain) {
  const std::string text = content(100'000);
  write("a", text);
  settle();
  damageAssets(100'000, 50'000);
  expectRefused("a", "lost");
  EXPECT_TRUE(read("a") == text);
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(evict("a"), nullptr);
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentEvictionsTest, NothingIsGivenUpWhereTheStoreCannotBeAsked) {
  write("a", content(100'000));
  settle();
  engine->setStore(nullptr, "");
  expectRefused("a", "signed in");
  signIn("bob");
  goOffline();
  EXPECT_NE(evict("a"), nullptr);
  EXPECT_FALSE(isFault("a"));
  comeBack();
  EXPECT_TRUE(waitUntil([&] { return evict("a") == nullptr; }));
}

TEST_F(ContentEvictionsTest, AFaultBelongsToTheAccountWhoseStoreHasIt) {
  write("a", content(100'000));
  settle();
  signIn("bob");
  ASSERT_EQ(evict("a"), nullptr);
  const NSErrorRef error = provide("a");
  ASSERT_NE(error, nullptr);
  EXPECT_NE(error->localizedDescription().find("ann"), std::string::npos);
  signIn("ann");
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == content(100'000));
}

TEST_F(ContentEvictionsTest, FoldersLinksAndFilesWithSeveralNamesStay) {
  makeFolder("folder");
  ASSERT_EQ(symlink("nowhere", at("link").c_str()), 0);
  write("a", content(100'000));
  ASSERT_EQ(link(at("a").c_str(), at("b").c_str()), 0);
  settle();
  expectRefused("a", "several names");
  for (const char* path : {"folder", "link"}) {
    const NSErrorRef error = evict(path);
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(error->code(), QSOstrellErrorCannotEvict);
  }
  EXPECT_TRUE(evict("nothing")->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

TEST_F(ContentEvictionsTest, WhatIsPinnedStaysAndWhatIsPinnedAwayComesBack) {
  makeFolder("folder");
  write("folder/a", content(100'000));
  settle();
  ASSERT_EQ(evict("folder/a"), nullptr);
  ASSERT_EQ(engine->setPinned(at("folder"), true), nullptr);
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_FALSE(isFault("folder/a"));
  EXPECT_TRUE(state("folder/a").isPinned);
  expectRefused("folder/a", "pinned");
  ASSERT_EQ(engine->setPinned(at("folder"), false), nullptr);
  EXPECT_EQ(evict("folder/a"), nullptr);
}

TEST_F(ContentEvictionsTest, WhatIsMovedIntoAPinnedFolderComes) {
  makeFolder("folder");
  write("a", content(100'000));
  settle();
  ASSERT_EQ(evict("a"), nullptr);
  ASSERT_EQ(engine->setPinned(at("folder"), true), nullptr);
  rename("a", "folder/a");
  settle();
  EXPECT_FALSE(isFault("folder/a"));
  EXPECT_EQ(read("folder/a"), content(100'000));
}

TEST_F(ContentEvictionsTest, AFaultIsEvictedAlready) {
  write("a", content(100'000));
  settle();
  ASSERT_EQ(evict("a"), nullptr);
  const struct stat before = status("a");
  EXPECT_EQ(evict("a"), nullptr);
  EXPECT_EQ(status("a").st_ctim.tv_nsec, before.st_ctim.tv_nsec);
}

TEST_F(ContentEvictionsTest, SmallContentIsAFaultWithoutAHole) {
  write("a", "text");
  write("empty", "");
  settle();
  for (const char* path : {"a", "empty"}) {
    ASSERT_EQ(evict(path), nullptr);
    EXPECT_TRUE(isFault(path));
    EXPECT_EQ(row(path)->flags & row_flag::kDownloaded, 0U);
  }
  // All of it was kept, and is known to be right: no store is needed.
  goOffline();
  for (const char* path : {"a", "empty"}) {
    ASSERT_EQ(provide(path), nullptr);
    EXPECT_FALSE(isFault(path));
  }
  EXPECT_EQ(read("a"), "text");
}

TEST_F(ContentEvictionsTest, AFilePointFailingTakesTheMarkBack) {
  const std::string text = content(100'000);
  write("a", text);
  settle();
  for (const char* point :
       {"zarn.evict.leased", "zarn.evict.recorded", "zarn.evict.marked", "zarn.evict.synced"}) {
    ASSERT_EQ(FaultPoint::arm(std::string(point) + "=error"), nullptr);
    EXPECT_NE(evict("a"), nullptr) << point;
    FaultPoint::disarmAll();
    EXPECT_FALSE(isFault("a")) << point;
    EXPECT_TRUE(read("a") == text) << point;
  }
  EXPECT_EQ(evict("a"), nullptr);
}

TEST_F(ContentEvictionsTest, ManyAtOnceAllGo) {
  constexpr int kFiles = 300;
  for (int i = 0; i < kFiles; ++i) write("f" + std::to_string(i), content(10'000, unsigned(i) + 1));
  settle();
  std::vector<Answer> answers(kFiles);
  for (int i = 0; i < kFiles; ++i) {
    engine->evict(at("f" + std::to_string(i)), answers[std::size_t(i)].take());
  }
  for (auto& answer : answers) EXPECT_EQ(answer.get(), nullptr);
  for (int i = 0; i < kFiles; ++i) {
    const std::string path = "f" + std::to_string(i);
    ASSERT_TRUE(isFault(path));
    ASSERT_LE(status(path).st_blocks * 512, 8192);
  }
}

}  // namespace
}  // namespace yomber
