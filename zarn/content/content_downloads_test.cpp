#include <sys/mount.h>

#include <random>
#include <thread>

#include "zarn/content/test_content.h"

namespace yomber {
namespace {

class ContentDownloadsTest : public ContentDrive {
 protected:
  void expectCorrupt(const std::string& path) {
    const NSErrorRef error = provide(path);
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileReadCorruptFileError)) << error->description();
    EXPECT_TRUE(isFault(path));
    EXPECT_LE(status(path).st_blocks * 512, 8192);
  }
};

TEST_F(ContentDownloadsTest, TenWaitersShareOneDownload) {
  const std::string text = content(5'000'000);
  makeFault("a", text);
  stopAt("zarn.fill.begun");
  std::vector<Answer> answers(10);
  std::vector<std::unique_ptr<ContentWish>> wishes;
  for (Answer& answer : answers) {
    wishes.push_back(engine->startProviding(at("a"), 0, answer.take()));
  }
  ASSERT_TRUE(isStopped());
  EXPECT_EQ(state("a").local, ContentState::Local::Downloading);
  EXPECT_EQ(wishes.front()->progress(), wishes.back()->progress());
  const std::uint64_t before = engine->transfers().finished;
  go();
  for (Answer& answer : answers) EXPECT_EQ(answer.get(), nullptr);
  EXPECT_TRUE(read("a") == text);
  EXPECT_EQ(engine->transfers().finished, before + 1);
  EXPECT_EQ(wishes.front()->progress()->completedUnitCount(), 5'000'000);
}

TEST_F(ContentDownloadsTest, AWishTakenBackIsAnsweredAndTheOthersAreServed) {
  const std::string text = content(3'000'000);
  makeFault("a", text);
  stopAt("zarn.fill.begun");
  Answer gone;
  Answer served;
  auto first = engine->startProviding(at("a"), 0, gone.take());
  const auto second = engine->startProviding(at("a"), 0, served.take());
  ASSERT_TRUE(isStopped());
  first.reset();
  EXPECT_TRUE(gone.get()->is(NSCocoaErrorDomain, NSUserCancelledError));
  go();
  EXPECT_EQ(served.get(), nullptr);
  EXPECT_TRUE(read("a") == text);
  EXPECT_EQ(gone.calls(), 1);
}

TEST_F(ContentDownloadsTest, ADownloadThatNobodyWishesForAnyLongerIsGivenUp) {
  makeFault("a", content(3'000'000));
  const struct stat before = status("a");
  for (const char* point : {"zarn.download.noted", "zarn.fill.begun", "zarn.fill.copying"}) {
    stopAt(point);
    Answer answer;
    auto wish = engine->startProviding(at("a"), 0, answer.take());
    ASSERT_TRUE(isStopped()) << point;
    wish.reset();
    go();
    EXPECT_TRUE(answer.get()->is(NSCocoaErrorDomain, NSUserCancelledError)) << point;
    ASSERT_TRUE(engine->waitUntilIdle(kPatience));
    EXPECT_TRUE(isFault("a")) << point;
    EXPECT_LE(status("a").st_blocks * 512, 8192) << point;
    EXPECT_EQ(status("a").st_mtim.tv_nsec, before.st_mtim.tv_nsec) << point;
    EXPECT_EQ(engine->transfers().waiting, 0U) << point;
    FaultPoint::disarmAll();
  }
  EXPECT_EQ(provide("a"), nullptr);
}

TEST_F(ContentDownloadsTest, ContentThatIsWholeStaysAlsoWhenNobodyWishesForItAnyLonger) {
  const std::string text = content(3'000'000);
  makeFault("a", text);
  const struct stat before = status("a");
  for (const char* point :
       {"zarn.fill.verified", "zarn.fill.dated", "zarn.fill.filled", "zarn.download.filled"}) {
    ASSERT_EQ(evict("a"), nullptr) << point;
    const std::uint64_t finished = engine->transfers().finished;
    stopAt(point);
    Answer answer;
    auto wish = engine->startProviding(at("a"), 0, answer.take());
    ASSERT_TRUE(isStopped()) << point;
    wish.reset();
    EXPECT_TRUE(answer.get()->is(NSCocoaErrorDomain, NSUserCancelledError)) << point;
    go();
    ASSERT_TRUE(engine->waitUntilIdle(kPatience));
    EXPECT_FALSE(isFault("a")) << point;
    EXPECT_TRUE(read("a") == text) << point;
    EXPECT_EQ(status("a").st_mtim.tv_sec, before.st_mtim.tv_sec) << point;
    EXPECT_EQ(status("a").st_mtim.tv_nsec, before.st_mtim.tv_nsec) << point;
    EXPECT_EQ(state("a").local, ContentState::Local::Here) << point;
    EXPECT_EQ(engine->transfers().finished, finished + 1) << point;
    EXPECT_EQ(engine->transfers().waiting, 0U) << point;
    EXPECT_EQ(answer.calls(), 1) << point;
    FaultPoint::disarmAll();
  }
}

TEST_F(ContentDownloadsTest, AWishThatComesAsTheLastOneGoesIsServed) {
  const std::string text = content(3'000'000);
  makeFault("a", text);
  stopAt("zarn.fill.begun");
  Answer gone;
  auto first = engine->startProviding(at("a"), 0, gone.take());
  ASSERT_TRUE(isStopped());
  first.reset();
  Answer answer;
  const auto second = engine->startProviding(at("a"), 0, answer.take());
  go();
  EXPECT_EQ(answer.get(), nullptr);
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentDownloadsTest, AFlippedBitInTheStoreIsAnErrorAndNeverContent) {
  makeFault("a", content(300'000));
  makeFault("b", content(200'000, 2));
  damageAssets(300'000, 150'000);
  expectCorrupt("a");
  EXPECT_EQ(provide("b"), nullptr);
  EXPECT_EQ(read("b"), content(200'000, 2));
}

TEST_F(ContentDownloadsTest, AFlippedBitWhereAFaultKeepsTheContentDoesNotGetThere) {
  makeFault("a", content(300'000));
  damageAssets(300'000, 10);
  expectCorrupt("a");
  EXPECT_TRUE(read("a").substr(0, kKeptBytes) == content(kKeptBytes));
}

TEST_F(ContentDownloadsTest, AMissingAssetIsAnErrorAndEverythingElseGoesOn) {
  makeFault("a", content(300'000));
  makeFault("b", content(200'000, 2));
  for (const std::string& path : assetFiles()) {
    if (std::filesystem::file_size(path) == 300'000) std::filesystem::remove(path);
  }
  expectCorrupt("a");
  EXPECT_EQ(provide("b"), nullptr);
}

TEST_F(ContentDownloadsTest, OutOfReachNobodyHangsAndNothingIsLost) {
  makeFault("a", content(300'000));
  goOffline();
  for (int i = 0; i < 2; ++i) {
    const NSErrorRef error = provide("a");
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError));
  }
  comeBack();
  ASSERT_TRUE(waitUntil([&] { return !engine->transfers().isOffline; }));
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_EQ(read("a"), content(300'000));
}

TEST_F(ContentDownloadsTest, SignedOutContentIsNotToBeHad) {
  makeFault("a", content(300'000));
  engine->setStore(nullptr, {});
  EXPECT_TRUE(provide("a")->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut));
  signIn("ann");
  EXPECT_EQ(provide("a"), nullptr);
}

TEST_F(ContentDownloadsTest, WhatIsHereFoldersAndLinksAreGrantedAtOnce) {
  write("a", "text");
  makeFolder("folder");
  ASSERT_EQ(symlink("nowhere", at("link").c_str()), 0);
  settle();
  goOffline();
  for (const char* path : {"a", "folder", "link"}) {
    Answer answer;
    const auto wish = engine->startProviding(at(path), 0, answer.take());
    EXPECT_TRUE(answer.isThere()) << path;
    EXPECT_EQ(answer.get(), nullptr) << path;
  }
  EXPECT_TRUE(provide("nothing")->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
}

TEST_F(ContentDownloadsTest, WithTheOptionTheAnswerComesAfterTheEvictionAndItsReturn) {
  const std::string text = content(300'000);
  write("a", text);
  settle();
  stopAt("zarn.evict.punched");
  Answer evicted;
  engine->evict(at("a"), evicted.take());
  ASSERT_TRUE(isStopped());
  Answer answer;
  const auto wish = engine->startProviding(at("a"), ContentEngine::kAfterWhatGoesOn, answer.take());
  EXPECT_FALSE(answer.isThere());
  go();
  EXPECT_EQ(evicted.get(), nullptr);
  EXPECT_EQ(answer.get(), nullptr);
  EXPECT_FALSE(isFault("a"));
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentDownloadsTest, AFailedFillLeavesAFault) {
  makeFault("a", content(300'000));
  const struct stat before = status("a");
  for (const char* point : {"zarn.fill.begun", "zarn.fill.verified", "zarn.fill.dated"}) {
    ASSERT_EQ(FaultPoint::arm(std::string(point) + "=error"), nullptr);
    EXPECT_NE(provide("a"), nullptr) << point;
    FaultPoint::disarmAll();
    EXPECT_TRUE(isFault("a")) << point;
    EXPECT_LE(status("a").st_blocks * 512, 8192) << point;
    EXPECT_EQ(status("a").st_mtim.tv_nsec, before.st_mtim.tv_nsec) << point;
  }
  EXPECT_EQ(provide("a"), nullptr);
}

TEST_F(ContentDownloadsTest, WhatWasFilledInAnotherBootIsAFaultAgain) {
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
  ASSERT_FALSE(isFault("a"));
  setAttribute("a", kFilledAttribute, "another-boot");
  EXPECT_TRUE(isFault("a"));
  // Not all of it had reached the disk.
  {
    const FileDescriptor file(::open(at("a").c_str(), O_RDWR | O_CLOEXEC));
    const struct stat before = status("a");
    ASSERT_EQ(fallocate(file.get(), FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE, 100'000, 50'000),
              0);
    const timespec times[2] = {before.st_atim, before.st_mtim};
    ASSERT_EQ(futimens(file.get(), times), 0);
  }
  ASSERT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentDownloadsTest, FewAndManyFilledFilesLoseTheirMarksAndKeepTheirContent) {
  for (const unsigned count : {2U, 16U, 17U, 40U}) {
    const auto name = [&](unsigned i) { return std::to_string(count) + "-" + std::to_string(i); };
    const auto isMarked = [&](unsigned i) {
      return lgetxattr(at(name(i)).c_str(), kFaultAttribute, nullptr, 0) >= 0;
    };
    for (unsigned i = 0; i <= count; ++i) write(name(i), content(10'000, i + 1));
    settle();
    for (unsigned i = 0; i <= count; ++i) ASSERT_EQ(evict(name(i)), nullptr);
    // While the first is settled, the others gather.
    stopAt("zarn.settle.synced");
    ASSERT_EQ(provide(name(0)), nullptr);
    ASSERT_TRUE(isStopped());
    for (unsigned i = 1; i <= count; ++i) ASSERT_EQ(provide(name(i)), nullptr);
    for (unsigned i = 0; i <= count; ++i) EXPECT_TRUE(isMarked(i)) << name(i);
    go();
    for (unsigned i = 0; i <= count; ++i) {
      EXPECT_TRUE(waitUntil([&] { return !isMarked(i); })) << name(i);
      EXPECT_TRUE(read(name(i)) == content(10'000, i + 1)) << name(i);
    }
    FaultPoint::disarmAll();
  }
}

TEST_F(ContentDownloadsTest, WhatSomebodyWritesOverAFaultCounts) {
  makeFault("a", content(300'000));
  const std::uint64_t item = id("a");
  write("a", "quite another text");
  settle();
  ASSERT_TRUE(waitUntil([&] { return !isFault("a"); }));
  ASSERT_TRUE(waitUntil([&] { return contentInStore(item) == "quite another text"; }));
  EXPECT_EQ(id("a"), item);
  EXPECT_EQ(read("a"), "quite another text");
  EXPECT_NE(row("a")->flags & row_flag::kDownloaded, 0U);
}

TEST_F(ContentDownloadsTest, WhatSomebodyWritesIntoAFaultGoesToAFileOfItsOwn) {
  const std::string text = content(300'000);
  for (const char* how : {"middle", "end", "head"}) {
    const std::string name = std::string(how) + ".bin";
    makeFault(name, text);
    const std::string where = how;
    const off_t offset = where == "middle" ? 150'000 : (where == "end" ? 300'000 : 10);
    {
      const FileDescriptor file(::open(at(name).c_str(), O_WRONLY | O_CLOEXEC));
      ASSERT_EQ(pwrite(file.get(), "written", 7, offset), 7);
    }
    settle();
    EXPECT_EQ(provide(name), nullptr) << how;
    EXPECT_TRUE(read(name) == text) << how;
    const std::string copy = read(where + " 2.bin");
    ASSERT_GE(copy.size(), 300'000U) << how;
    EXPECT_EQ(copy.substr(std::size_t(offset), 7), "written") << how;
    settle();
    ASSERT_TRUE(waitUntil([&] {
      return state(where + " 2.bin").upload == ContentState::Upload::Confirmed;
    })) << how;
    EXPECT_TRUE(contentInStore(id(name)) == text) << how;
  }
}

TEST_F(ContentDownloadsTest, ATouchedFaultKeepsItsNewDate) {
  const std::string text = content(300'000);
  makeFault("a", text);
  const timespec times[2] = {{.tv_sec = 1'000'000, .tv_nsec = 0},
                             {.tv_sec = 1'000'000, .tv_nsec = 5}};
  ASSERT_EQ(utimensat(AT_FDCWD, at("a").c_str(), times, 0), 0);
  settle();
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
  EXPECT_EQ(status("a").st_mtim.tv_sec, 1'000'000);
  EXPECT_EQ(status("a").st_mtim.tv_nsec, 5);
  EXPECT_EQ(evict("a"), nullptr);
}

TEST_F(ContentDownloadsTest, SomebodyWhoHasTheFaultOpenIsNoHindrance) {
  const std::string text = content(3'000'000);
  makeFault("a", text);
  const FileDescriptor reader(::open(at("a").c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_EQ(provide("a"), nullptr);
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentDownloadsTest, HolesInTheContentStayHoles) {
  {
    const FileDescriptor file(::open(at("a").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    ASSERT_EQ(pwrite(file.get(), "begin", 5, 0), 5);
    ASSERT_EQ(pwrite(file.get(), "end", 3, 20'000'000), 3);
  }
  settle();
  const std::string before = read("a");
  ASSERT_EQ(evict("a"), nullptr);
  ASSERT_EQ(provide("a"), nullptr);
  EXPECT_EQ(read("a"), before);
  EXPECT_LT(status("a").st_blocks * 512, 1'000'000);
}

TEST_F(ContentDownloadsTest, AFileThatMayOnlyBeReadComesBackAsThat) {
  write("a", content(300'000));
  ASSERT_EQ(chmod(at("a").c_str(), 0440), 0);
  settle();
  ASSERT_EQ(evict("a"), nullptr);
  EXPECT_EQ(status("a").st_mode & 0777U, 0440U);
  ASSERT_EQ(provide("a"), nullptr);
  EXPECT_EQ(status("a").st_mode & 0777U, 0440U);
  EXPECT_EQ(read("a"), content(300'000));
}

TEST_F(ContentDownloadsTest, EvictingProvidingAndStoppingAtOnceLeavesWholeContent) {
  const std::string text = content(1'500'000);
  write("a", text);
  settle();
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (unsigned thread = 0; thread < 10; ++thread) {
    threads.emplace_back([&, thread] {
      std::mt19937 random(thread);
      for (int round = 0; round < 20; ++round) {
        Answer answer;
        const auto what = random() % 3;
        if (what == 0) {
          engine->evict(at("a"), answer.take());
          (void)answer.get();
          continue;
        }
        auto wish = engine->startProviding(at("a"), 0, answer.take());
        if (what == 1) wish.reset();
        const NSErrorRef error = answer.get();
        const bool isExpected =
            !error || (what == 1 && error->is(NSCocoaErrorDomain, NSUserCancelledError));
        if (!isExpected) failures.fetch_add(1);
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
  ASSERT_EQ(provide("a", ContentEngine::kAfterWhatGoesOn), nullptr);
  EXPECT_TRUE(read("a") == text);
}

TEST_F(ContentDownloadsTest, AFullDiskIsAnErrorAndAfterRoomIsMadeTheContentComes) {
  // The tree on a small file system of its own.
  const std::string image = layout.home() + "/image";
  const std::string place = at("small");
  makeFolder("small");
  std::ofstream(image).put('x');
  std::filesystem::resize_file(image, 24 << 20);
  const bool isMounted =
      geteuid() == 0 &&
      std::system(("mkfs.ext4 -q -F -m 0 " + image + " >/dev/null 2>&1").c_str()) == 0 &&
      std::system(("mount -o loop " + image + " " + place + " >/dev/null 2>&1").c_str()) == 0;
  if (!isMounted) GTEST_SKIP() << "needs root, mkfs.ext4 and a loop device for a small disk";
  const std::string file = place + "/a";
  const std::string text = content(8 << 20);
  std::ofstream(file, std::ios::binary) << text;
  struct stat status{};
  ASSERT_EQ(stat(file.c_str(), &status), 0);
  RZAsset asset;
  {
    const FileDescriptor source(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_EQ(records->importAsset(source.get(), {}, asset), nullptr);
  }
  FaultRecord fault;
  fault.content = asset;
  fault.mtime = FileStamp::of(status).mtime;
  NSErrorRef error;
  FileStamp after;
  auto eviction = Eviction::begin(file, FileStamp::of(status), fault, &error);
  ASSERT_NE(eviction, nullptr) << error->description();
  ASSERT_EQ(eviction->sync(), nullptr);
  ASSERT_EQ(eviction->finish(after), nullptr);
  eviction.reset();
  const FaultSource source{
      .copy =
          [&](const FaultRecord& record, int target,
              const std::function<bool(std::uint64_t)>& goesOn) {
            return ContentStore(records, "ann").copy(record.content, target, goesOn);
          },
      .open = {}};
  FillOutcome outcome;
  {
    std::ofstream filler(place + "/filler", std::ios::binary);
    while (filler.write(text.data(), 64 << 10).flush()) {
    }
  }
  error = fillFault(file, source, {}, outcome);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, ENOSPC)) << error->description();
  EXPECT_TRUE(isFaultAtPath(file));
  std::filesystem::remove(place + "/filler");
  EXPECT_EQ(fillFault(file, source, {}, outcome), nullptr);
  EXPECT_FALSE(isFaultAtPath(file));
  std::ifstream back(file, std::ios::binary);
  EXPECT_TRUE(std::string(std::istreambuf_iterator<char>(back), {}) == text);
  back.close();
  (void)umount2(place.c_str(), MNT_DETACH);
}

}  // namespace
}  // namespace yomber
