// Others who write to faults while they are filled, and what becomes of their bytes.
#include <thread>

#include "zarn/content/test_content.h"
#include "zarn/content/test_leases.h"

namespace yomber {
namespace {

constexpr std::size_t kSize = 5'000'000;
constexpr off_t kWhere = 4'500'000;

class ForeignWritesTest : public ContentDrive {
 protected:
  /// Whether somebody waits for the end of a lease on the file.
  bool isWaitedFor(const std::string& path) const { return isLeaseWaitedFor(status(path)); }
  [[nodiscard]] FileDescriptor openAt(const std::string& path, int flags) const {
    FileDescriptor file(::open(at(path).c_str(), flags | O_CLOEXEC));
    EXPECT_TRUE(file) << path;
    return file;
  }
  static void writeTo(const FileDescriptor& file) {
    EXPECT_EQ(pwrite(file.get(), "written", 7, kWhere), 7);
  }
  void expectCopyWithWhatWasWritten() {
    const std::string copy = read("a 2");
    ASSERT_EQ(copy.size(), kSize);
    EXPECT_EQ(copy.substr(kWhere, 7), "written");
  }
  /// As a filling that was killed half-way leaves it.
  void interruptFilling(const std::string& path, const std::string& text) {
    const FileDescriptor file = openAt(path, O_RDWR);
    const struct stat before = status(path);
    const auto date = FileStamp::of(before).mtime;
    setAttribute(path, kHeldDateAttribute, std::to_string(date));
    ASSERT_EQ(pwrite(file.get(), text.data(), 1 << 20, 0), 1 << 20);
  }
};

TEST_F(ForeignWritesTest, WhoOpensAFaultWhileItIsFilledWaitsForTheContent) {
  const std::string text = content(kSize);
  for (const int flags : {O_RDONLY, O_RDWR}) {
    const std::string name = flags == O_RDONLY ? "reader" : "writer";
    makeFault(name, text);
    stopAt("zarn.fill.copying");
    Answer answer;
    const auto wish = engine->startProviding(at(name), 0, answer.take());
    ASSERT_TRUE(isStopped());
    std::string seen(kSize, '\0');
    std::thread other([&] {
      const FileDescriptor file = openAt(name, flags);
      EXPECT_EQ(pread(file.get(), seen.data(), seen.size(), 0), ssize_t{kSize});
      if (flags == O_RDWR) writeTo(file);
    });
    EXPECT_TRUE(waitUntil([&] { return isWaitedFor(name); }));
    go();
    EXPECT_EQ(answer.get(), nullptr);
    other.join();
    EXPECT_TRUE(seen == text) << name;
    FaultPoint::disarmAll();
  }
  // An edit like any other.
  scan();
  std::string edited = text;
  edited.replace(kWhere, 7, "written");
  EXPECT_TRUE(read("writer") == edited);
  EXPECT_TRUE(waitUntil([&] { return contentInStore(id("writer")) == edited; }));
  EXPECT_FALSE(std::filesystem::exists(at("writer 2")));
}

TEST_F(ForeignWritesTest, WhileAFaultIsOpenForWritingItIsNotFilled) {
  const std::string text = content(kSize);
  makeFault("a", text);
  auto writer = openAt("a", O_WRONLY);
  NSErrorRef error = provide("a");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EBUSY)) << error->description();
  writeTo(writer);
  error = provide("a");
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EBUSY)) << error->description();
  EXPECT_TRUE(isFault("a"));
  writer = FileDescriptor();
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
  expectCopyWithWhatWasWritten();
}

TEST_F(ForeignWritesTest, AWriterWhoCannotWaitAnyLongerGetsTheFaultAsItWas) {
  const std::string text = content(kSize);
  makeFault("a", text);
  stopAt("zarn.fill.copying");
  ASSERT_EQ(FaultPoint::arm("zarn.fill.waited=error"), nullptr);
  Answer answer;
  const auto wish = engine->startProviding(at("a"), 0, answer.take());
  ASSERT_TRUE(isStopped());
  off_t firstData = 0;
  std::thread other([&] {
    const FileDescriptor file = openAt("a", O_RDWR);
    firstData = lseek(file.get(), kKeptBytes, SEEK_DATA);
    writeTo(file);
  });
  EXPECT_TRUE(waitUntil([&] { return isWaitedFor("a"); }));
  go();
  const NSErrorRef error = answer.get();
  other.join();
  EXPECT_EQ(firstData, -1) << "a part of the content was left in it";
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EBUSY)) << error->description();
  FaultPoint::disarmAll();
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
  expectCopyWithWhatWasWritten();
}

TEST_F(ForeignWritesTest, WhatIsWrittenBehindAFillingThatEndsEarlyIsKept) {
  const std::string text = content(kSize);
  makeFault("a", text);
  auto reader = openAt("a", O_RDONLY);
  stopAt("zarn.fill.copying");
  Answer answer;
  auto wish = engine->startProviding(at("a"), 0, answer.take());
  ASSERT_TRUE(isStopped());
  constexpr off_t kBehind = 8192;
  ASSERT_EQ(lseek(reader.get(), kBehind, SEEK_DATA), kBehind)
      << "the filling has not come here yet";
  auto writer = openAt("a", O_WRONLY);
  EXPECT_EQ(pwrite(writer.get(), "written", 7, kBehind), 7);
  wish.reset();
  ASSERT_EQ(FaultPoint::arm("zarn.fill.copying=error"), nullptr);
  go();
  EXPECT_NE(answer.get(), nullptr);
  FaultPoint::disarmAll();
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  reader = FileDescriptor();
  writer = FileDescriptor();
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
  EXPECT_EQ(read("a 2").substr(kBehind, 7), "written");
}

TEST_F(ForeignWritesTest, AWriterBesideAReaderLosesNothing) {
  const std::string text = content(kSize);
  makeFault("a", text);
  auto reader = openAt("a", O_RDONLY);
  stopAt("zarn.fill.copying");
  Answer answer;
  const auto wish = engine->startProviding(at("a"), 0, answer.take());
  ASSERT_TRUE(isStopped());
  auto writer = openAt("a", O_WRONLY);
  writeTo(writer);
  go();
  EXPECT_NE(answer.get(), nullptr);
  EXPECT_TRUE(isFault("a"));
  FaultPoint::disarmAll();
  reader = FileDescriptor();
  writer = FileDescriptor();
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
  expectCopyWithWhatWasWritten();
  EXPECT_TRUE(contentInStore(id("a")) == text);
}

TEST_F(ForeignWritesTest, WhatIsWrittenIntoAnInterruptedFillingIsKept) {
  const std::string text = content(kSize);
  makeFault("a", text);
  interruptFilling("a", text);
  writeTo(openAt("a", O_WRONLY));
  const NSErrorRef refused = evict("a");
  ASSERT_NE(refused, nullptr);
  EXPECT_TRUE(refused->is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict));
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
  expectCopyWithWhatWasWritten();
}

TEST_F(ForeignWritesTest, AnInterruptedFillingThatNobodyWroteIntoLeavesNoCopy) {
  const std::string text = content(kSize);
  makeFault("a", text);
  const struct stat before = status("a");
  interruptFilling("a", text);
  EXPECT_EQ(evict("a"), nullptr);
  EXPECT_LE(status("a").st_blocks * 512, 8192);
  interruptFilling("a", text);
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
  EXPECT_EQ(status("a").st_mtim.tv_nsec, before.st_mtim.tv_nsec);
  EXPECT_FALSE(std::filesystem::exists(at("a 2")));
}

}  // namespace
}  // namespace yomber
