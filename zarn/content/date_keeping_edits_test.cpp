// What somebody writes into files of the tree, in their places, and then puts the date back.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <string_view>

#include "zarn/content/test_content.h"

namespace yomber {
namespace {

class DateKeepingEditsTest : public ContentDrive {
 protected:
  void edit(const std::string& path, std::string_view bytes, off_t offset) {
    const struct stat before = status(path);
    const FileDescriptor file(::open(at(path).c_str(), O_WRONLY | O_CLOEXEC));
    ASSERT_EQ(pwrite(file.get(), bytes.data(), bytes.size(), offset),
              static_cast<ssize_t>(bytes.size()));
    const timespec times[2] = {before.st_atim, before.st_mtim};
    ASSERT_EQ(futimens(file.get(), times), 0);
  }
  static std::string edited(std::string text, std::string_view bytes, std::size_t offset) {
    return text.replace(offset, bytes.size(), bytes);
  }

  const std::string text_ = content(300'000);
};

TEST_F(DateKeepingEditsTest, BeforeTheMarksAreTakenOffAreUploaded) {
  settlePause = std::chrono::hours(1);
  restartEngine();
  makeFault("a", text_);
  ASSERT_EQ(provide("a"), nullptr);
  edit("a", "written", 150'000);
  const std::string expected = edited(text_, "written", 150'000);
  scan();
  EXPECT_TRUE(waitUntil([&] { return contentInStore(id("a")) == expected; }));
  EXPECT_TRUE(read("a") == expected);
}

TEST_F(DateKeepingEditsTest, ThatNobodyHasSeenWhenTheMarksAreTakenOffAreUploaded) {
  makeFault("a", text_);
  stopAt("zarn.settle.synced");
  ASSERT_EQ(provide("a"), nullptr);
  ASSERT_TRUE(isStopped());
  edit("a", "written", 150'000);
  go();
  settle();
  EXPECT_TRUE(contentInStore(id("a")) == edited(text_, "written", 150'000));
}

TEST_F(DateKeepingEditsTest, OfWhatIsAskedForAlthoughItIsHereAreUploaded) {
  write("a", text_);
  settle();
  edit("a", "written", 150'000);
  EXPECT_EQ(provide("a", ContentEngine::kAfterWhatGoesOn), nullptr);
  settle();
  EXPECT_TRUE(contentInStore(id("a")) == edited(text_, "written", 150'000));
}

TEST_F(DateKeepingEditsTest, OfAFaultGoToAFileOfTheirOwn) {
  for (const off_t offset : {off_t(10), off_t(150'000)}) {
    const std::string name = "at " + std::to_string(offset);
    makeFault(name, text_);
    edit(name, "written", offset);
    EXPECT_EQ(provide(name), nullptr) << name;
    EXPECT_TRUE(read(name) == text_) << name;
    const std::string copy = read(name + " 2");
    ASSERT_EQ(copy.size(), text_.size()) << name;
    EXPECT_EQ(copy.substr(std::size_t(offset), 7), "written") << name;
    settle();
    EXPECT_TRUE(contentInStore(id(name)) == text_) << name;
  }
}

TEST_F(DateKeepingEditsTest, WhereTheContentIsZerosLeaveNothingBehind) {
  const std::string text = std::string(8192, '\0') + text_;
  makeFault("a", text);
  edit("a", "written", 10);
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
  EXPECT_EQ(evict("a"), nullptr);
  settle();
  EXPECT_TRUE(contentInStore(id("a")) == text);
}

TEST_F(DateKeepingEditsTest, OfASmallFaultCount) {
  makeFault("a", "a small document");
  edit("a", "THE", 0);
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_EQ(read("a"), "THEmall document");
  settle();
  EXPECT_EQ(contentInStore(id("a")), "THEmall document");
}

/// The kept bytes are what applications sniff at.
TEST_F(DateKeepingEditsTest, AreTakenOutOfWhatAFaultKeeps) {
  makeFault("a", text_);
  const std::string kept = text_.substr(0, kKeptBytes);
  edit("a", "written", 10);
  stopAt("zarn.fill.copying");
  Answer answer;
  auto wish = engine->startProviding(at("a"), 0, answer.take());
  ASSERT_TRUE(isStopped());
  wish.reset();
  go();
  EXPECT_NE(answer.get(), nullptr);
  EXPECT_TRUE(isFault("a"));
  EXPECT_TRUE(read("a").substr(0, kKeptBytes) == kept);
}

}  // namespace
}  // namespace yomber
