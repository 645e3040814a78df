#include <sys/wait.h>

#include <thread>

#include "zarn/content/test_content.h"
#include "zarn/content/test_leases.h"
#include "zarn/test_closing.h"

namespace yomber {
namespace {

/// What happens in a process that dies at a fault point is finished by the next one.
class ContentKillTest : public ContentDrive, public testing::WithParamInterface<const char*> {
 protected:
  /// Runs `work` with a drive of its own in a child that ends at the fault point. Threads are not
  /// carried across a fork: everything of ours is closed before.
  void dieDuring(const std::string& point, const std::function<void()>& work) {
    engine->stop();
    waitUntilWritten(*database);
    engine.reset();
    records.reset();
    close();
    ASSERT_FALSE(hasOpenFileIn(layout.home()));
    const pid_t child = fork();
    if (child == 0) {
      open();
      records = std::make_shared<EmbeddedEngine>(storePath);
      if (FaultPoint::arm(point + "=abort")) _exit(1);
      options.settlePause = std::chrono::milliseconds(1);
      startEngine();
      work();
      (void)engine->waitUntilIdle(kPatience);
      // What takes marks off comes after everything else.
      (void)waitUntil([&] { return false; });
      _exit(0);
    }
    int ending = 0;
    ASSERT_EQ(waitpid(child, &ending, 0), child);
    ASSERT_TRUE(WIFSIGNALED(ending)) << point << " was not reached";
    open();
    records = std::make_shared<EmbeddedEngine>(storePath);
    // In this order, as zarn does it: what the scan finds makes jobs.
    startEngine();
    scan();
    ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  }
  /// After a death in its filling: whole or a fault, and the content comes.
  void expectContentComes(const std::string& path, const std::string& text,
                          const struct stat& before) {
    if (!isFault(path)) {
      EXPECT_TRUE(read(path) == text);
    }
    EXPECT_EQ(provide(path), nullptr);
    EXPECT_TRUE(read(path) == text);
    EXPECT_EQ(status(path).st_ino, before.st_ino);
    EXPECT_EQ(status(path).st_mtim.tv_sec, before.st_mtim.tv_sec);
    EXPECT_EQ(status(path).st_mtim.tv_nsec, before.st_mtim.tv_nsec);
    ASSERT_TRUE(waitUntil([&] { return state(path).upload == ContentState::Upload::Confirmed; }));
    EXPECT_TRUE(contentInStore(id(path)) == text);
    EXPECT_EQ(engine->transfers().waiting, 0U);
  }
};

class UploadKillTest : public ContentKillTest {};
class EvictionKillTest : public ContentKillTest {};
class DownloadKillTest : public ContentKillTest {};

TEST_P(UploadKillTest, TheNextProcessGoesOnWithTheUpload) {
  const std::string text = content(500'000);
  write("a", text);
  dieDuring(GetParam(), [&] { scan(); });
  EXPECT_TRUE(read("a") == text);
  ASSERT_TRUE(waitUntil([&] { return state("a").upload == ContentState::Upload::Confirmed; }));
  EXPECT_TRUE(contentInStore(id("a")) == text);
  EXPECT_EQ(engine->transfers().waiting, 0U);
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, UploadKillTest,
                         testing::Values("zarn.upload.read", "zarn.upload.reading",
                                         "zarn.upload.staged", "zarn.upload.synced",
                                         "zarn.upload.committed", "zarn.upload.confirmed"));

TEST_P(EvictionKillTest, TheFileIsWholeOrAFaultAndItsContentComesBack) {
  const std::string text = content(500'000);
  write("a", text);
  settle();
  const struct stat before = status("a");
  dieDuring(GetParam(), [&] { (void)evict("a"); });
  const struct stat after = status("a");
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_EQ(after.st_size, before.st_size);
  if (!isFault("a")) {
    EXPECT_TRUE(read("a") == text);
  }
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
  EXPECT_EQ(status("a").st_mtim.tv_sec, before.st_mtim.tv_sec);
  EXPECT_EQ(status("a").st_mtim.tv_nsec, before.st_mtim.tv_nsec);
  EXPECT_TRUE(contentInStore(id("a")) == text);
  EXPECT_EQ(evict("a"), nullptr);
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, EvictionKillTest,
                         testing::Values("zarn.evict.leased", "zarn.evict.recorded",
                                         "zarn.evict.marked", "zarn.evict.synced",
                                         "zarn.evict.punched", "zarn.evict.stored"));

TEST_P(DownloadKillTest, TheFileIsAFaultUntilItsContentIsWhole) {
  const std::string text = content(5'000'000);
  write("a", text);
  settle();
  const struct stat before = status("a");
  ASSERT_EQ(evict("a"), nullptr);
  dieDuring(GetParam(), [&] { (void)provide("a"); });
  expectContentComes("a", text, before);
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, DownloadKillTest,
                         testing::Values("zarn.download.noted", "zarn.fill.begun",
                                         "zarn.fill.copying", "zarn.fill.verified",
                                         "zarn.fill.dated", "zarn.fill.filled",
                                         "zarn.download.filled", "zarn.settle.synced",
                                         "zarn.settle.unmarked"));

TEST_F(ContentKillTest, WhoDiesWhileAReaderWaitsForTheContentLosesNoneOfIt) {
  const std::string text = content(5'000'000);
  makeFault("a", text);
  const struct stat before = status("a");
  dieDuring("zarn.fill.waited", [&] {
    stopAt("zarn.fill.copying");
    Answer answer;
    const auto wish = engine->startProviding(at("a"), 0, answer.take());
    ASSERT_TRUE(isStopped());
    std::thread reader([&] { (void)FileDescriptor(::open(at("a").c_str(), O_RDONLY)); });
    ASSERT_TRUE(waitUntil([&] { return isLeaseWaitedFor(status("a")); }));
    go();
    (void)answer.get();
    reader.join();
  });
  expectContentComes("a", text, before);
}

class ThumbnailKillTest : public ContentKillTest {};

TEST_P(ThumbnailKillTest, TheNextProcessMakesTheThumbnail) {
  std::filesystem::copy_file(YOMBER_PICTURES "/quarters.jpg", at("photo.jpg"));
  // Not made at upload, so that the job for it is killed.
  options.drawingPatience = std::chrono::milliseconds(-1);
  dieDuring(GetParam(), [&] { scan(); });
  const auto isMade = [&] {
    const auto found = record(id("photo.jpg"));
    return found && found->objectForKey(kQSRecordKeyThumbnail1024x1024) != nullptr;
  };
  EXPECT_TRUE(waitUntil(isMade));
  ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  EXPECT_EQ(state("photo.jpg").upload, ContentState::Upload::Confirmed);
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, ThumbnailKillTest,
                         testing::Values("zarn.upload.committed", "zarn.thumbnail.drawn",
                                         "zarn.thumbnail.saved", "drawing.sent"));

TEST_F(ContentKillTest, TheNextProcessFollowsAPinToTheEnd) {
  makeFolder("top");
  makeFolder("top/one");
  write("top/one/a", content(20'000));
  settle();
  ASSERT_EQ(evict("top/one/a"), nullptr);
  dieDuring("zarn.spread.stored", [&] { (void)engine->setPinned(at("top"), true); });
  EXPECT_FALSE(isFault("top/one/a"));
  EXPECT_TRUE(read("top/one/a") == content(20'000));
}

class MoveKillTest : public ContentKillTest {};

TEST_P(MoveKillTest, TheNextProcessKnowsTheDocumentAgainAndTheStoreHearsOfIt) {
  const std::string text = content(500'000);
  makeFolder("folder");
  write("a", text);
  settle();
  const std::uint64_t document = id("a");
  ASSERT_EQ(evict("a"), nullptr);
  dieDuring(GetParam(), [&] {
    rename("a", "folder/b");
    scan();
  });
  EXPECT_EQ(id("folder/b"), document);
  EXPECT_FALSE(row("a"));
  EXPECT_TRUE(isFault("folder/b"));
  ASSERT_TRUE(
      waitUntil([&] { return state("folder/b").upload == ContentState::Upload::Confirmed; }));
  EXPECT_TRUE(contentInStore(document) == text);
  EXPECT_EQ(provide("folder/b"), nullptr);
  EXPECT_TRUE(read("folder/b") == text);
}

INSTANTIATE_TEST_SUITE_P(AtEachPoint, MoveKillTest,
                         testing::Values("zarn.move.seen", "zarn.move.stored", "zarn.upload.read",
                                         "zarn.upload.committed", "zarn.upload.confirmed"));

}  // namespace
}  // namespace yomber
