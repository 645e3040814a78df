// Copies of faults, further names of them, and faults of other accounts.
#include <sys/stat.h>
#include <sys/xattr.h>

#include <cstdlib>

#include "platform/foundation/fault_attributes.h"
#include "zarn/content/test_content.h"

namespace yomber {
namespace {

class ContentCopiesTest : public ContentDrive {
 protected:
  void copy(const std::string& how, const std::string& from, const std::string& to) const {
    const std::string command = "cp " + how + " '" + at(from) + "' '" + at(to) + "'";
    ASSERT_EQ(std::system(command.c_str()), 0) << command;
  }
};

TEST_F(ContentCopiesTest, ACopyThatWasMadeWhileItsOriginalWasFilledIsNoContent) {
  const std::string text = content(100'000);
  makeFault("a", text);
  const struct stat original = status("a");
  // As a copier leaves it that has read the holes, and then the attributes.
  write("b", "");
  ASSERT_EQ(truncate(at("b").c_str(), original.st_size), 0);
  std::string mark(4096, '\0');
  const ssize_t length = getxattr(at("a").c_str(), kFaultAttribute, mark.data(), mark.size());
  ASSERT_GT(length, 0);
  setAttribute("b", kFaultAttribute, mark.substr(0, static_cast<std::size_t>(length)));
  setAttribute("b", kFilledAttribute, bootIdentifier());
  const timespec times[2] = {original.st_atim, original.st_mtim};
  ASSERT_EQ(utimensat(AT_FDCWD, at("b").c_str(), times, 0), 0);
  ASSERT_FALSE(isFault("b"));
  settle();
  EXPECT_TRUE(waitUntil([&] { return isFault("b"); }));
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_TRUE(contentInStore(id("b")) == text);
  EXPECT_EQ(provide("b"), nullptr);
  EXPECT_TRUE(read("b") == text);
}

TEST_F(ContentCopiesTest, ACopyOfAFaultIsAFaultWithAnIDOfItsOwn) {
  const std::string text = content(300'000);
  makeFault("a", text);
  const std::uint64_t original = id("a");
  for (const char* how : {"-a", "-a --sparse=never", "-a --reflink=never"}) {
    const std::string name = std::string("copy") + how;
    copy(how, "a", name);
    settle();
    EXPECT_TRUE(isFault(name));
    EXPECT_EQ(id("a"), original);
    EXPECT_NE(id(name), original);
    EXPECT_EQ(idOnDisk(name), id(name));
    EXPECT_EQ(state(name).local, ContentState::Local::Fault);
    ASSERT_TRUE(waitUntil([&] { return contentInStore(id(name)) == text; })) << how;
  }
  // Neither hangs on the other.
  remove("a");
  settle();
  EXPECT_EQ(record(original), nullptr);
  EXPECT_EQ(provide("copy-a"), nullptr);
  EXPECT_TRUE(read("copy-a") == text);
}

TEST_F(ContentCopiesTest, AnEditedCopyLeavesTheOriginalAlone) {
  const std::string text = content(300'000);
  makeFault("a", text);
  copy("-a", "a", "b");
  settle();
  ASSERT_EQ(provide("b"), nullptr);
  write("b", "another text");
  settle();
  ASSERT_TRUE(waitUntil([&] { return contentInStore(id("b")) == "another text"; }));
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentCopiesTest, ACopyOfAFileThatWasJustFilledLosesItsMarks) {
  const std::string text = content(300'000);
  makeFault("a", text);
  engine->stop();
  engine.reset();
  options.settlePause = std::chrono::hours(1);
  engine = ContentEngine::create(
      store, std::make_shared<Scanner>(store, std::weak_ptr<FolderVisitor>()), options);
  signIn("ann");
  engine->start();
  ASSERT_EQ(provide("a"), nullptr);
  copy("-a", "a", "b");
  settle();
  char value = 0;
  EXPECT_TRUE(waitUntil([&] {
    return lgetxattr(at("b").c_str(), kFaultAttribute, &value, 0) < 0 && errno == ENODATA;
  }));
  EXPECT_TRUE(read("b") == text);
  EXPECT_EQ(contentInStore(id("b")), text);
}

TEST_F(ContentCopiesTest, AFurtherNameOfAFaultComesAndGoesWithIt) {
  const std::string text = content(300'000);
  makeFault("a", text);
  const std::uint64_t original = id("a");
  ASSERT_EQ(link(at("a").c_str(), at("b").c_str()), 0);
  settle();
  EXPECT_EQ(id("a"), original);
  EXPECT_NE(id("b"), 0U);
  EXPECT_NE(id("b"), original);
  EXPECT_EQ(provide("b"), nullptr);
  EXPECT_TRUE(read("a") == text);
  EXPECT_TRUE(read("b") == text);
  settle();
  EXPECT_EQ(state("a").local, ContentState::Local::Here);
  EXPECT_EQ(provide("a"), nullptr);
  remove("b");
  settle();
  EXPECT_EQ(id("a"), original);
  EXPECT_TRUE(contentInStore(original) == text);
  EXPECT_EQ(evict("a"), nullptr);
}

TEST_F(ContentCopiesTest, AnotherAccountNeitherFillsNorTakesWhatIsNotItsOwn) {
  const std::string text = content(300'000);
  makeFault("a", text);
  signIn("bob");
  NSErrorRef error = provide("a");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut)) << error->description();
  EXPECT_TRUE(isFault("a"));
  copy("-a", "a", "b");
  settle();
  const std::uint64_t copied = id("b");
  for (const std::uint64_t item : {id("a"), copied}) EXPECT_EQ(record(item, "bob"), nullptr);
  EXPECT_EQ(engine->transfers().waiting, 0U);
  signIn("ann");
  ASSERT_TRUE(waitUntil([&] { return contentInStore(copied) == text; }));
  EXPECT_EQ(provide("b"), nullptr);
  EXPECT_TRUE(read("b") == text);
}

}  // namespace
}  // namespace yomber
