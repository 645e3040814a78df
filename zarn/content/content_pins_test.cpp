#include "zarn/content/test_content.h"

namespace yomber {
namespace {

class ContentPinsTest : public ContentDrive {
 protected:
  static constexpr const char* kDocuments[] = {"top/a", "top/one/b", "top/one/two/c",
                                               "top/three/d"};

  /// A tree of documents whose content is away.
  void makeTree() {
    for (const char* folder : {"top", "top/one", "top/one/two", "top/three"}) makeFolder(folder);
    for (const char* path : kDocuments) makeFault(path, content(20'000));
  }
  int faults(const std::string& prefix = {}) const {
    int count = 0;
    for (const char* path : kDocuments) count += isFault(prefix + path) ? 1 : 0;
    return count;
  }
};

TEST_F(ContentPinsTest, APinReachesAllThatIsBelowAndOthersGetTheirTurnMeanwhile) {
  makeTree();
  stopAt("zarn.spread.stored");
  ASSERT_EQ(engine->setPinned(at("top"), true), nullptr);
  ASSERT_TRUE(isStopped());
  // Evicted or not, what is pinned stays from the first moment.
  EXPECT_TRUE(state("top/one/two/c").isPinned);
  write("other", "text");
  scan();
  EXPECT_TRUE(waitUntil([&] { return state("other").upload == ContentState::Upload::Confirmed; }));
  EXPECT_TRUE(isFault("top/one/two/c"));
  go();
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(faults(), 0);
}

TEST_F(ContentPinsTest, UnpinningTakesDownloadsAwayThatHaveNotBegun) {
  makeTree();
  engine->setStore(nullptr, {});
  ASSERT_EQ(engine->setPinned(at("top"), true), nullptr);
  ASSERT_EQ(engine->setPinned(at("top/three"), true), nullptr);
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(engine->transfers().waiting, 4U);
  ASSERT_EQ(engine->setPinned(at("top"), false), nullptr);
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(engine->transfers().waiting, 1U);
  signIn("ann");
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(faults(), 3);
  EXPECT_FALSE(isFault("top/three/d"));
}

TEST_F(ContentPinsTest, ATreeMovedIntoAPinnedFolderComesAndOneMovedOutWaitsNoLonger) {
  makeTree();
  makeFolder("pinned");
  scan();
  ASSERT_EQ(engine->setPinned(at("pinned"), true), nullptr);
  engine->setStore(nullptr, {});
  rename("top", "pinned/top");
  scan();
  ASSERT_TRUE(waitUntil([&] { return engine->transfers().waiting >= 4U; }));
  rename("pinned/top", "top");
  settle();
  signIn("ann");
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(faults(), 4);
  rename("top", "pinned/top");
  settle();
  EXPECT_EQ(faults("pinned/"), 0);
}

TEST_F(ContentPinsTest, OneDocumentIsPinnedAndUnpinned) {
  makeFault("a", content(20'000));
  engine->setStore(nullptr, {});
  ASSERT_EQ(engine->setPinned(at("a"), true), nullptr);
  EXPECT_EQ(engine->transfers().waiting, 1U);
  ASSERT_EQ(engine->setPinned(at("a"), false), nullptr);
  EXPECT_EQ(engine->transfers().waiting, 0U);
  ASSERT_EQ(engine->setPinned(at("a"), true), nullptr);
  signIn("ann");
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_FALSE(isFault("a"));
}

}  // namespace
}  // namespace yomber
