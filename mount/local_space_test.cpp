#include "mount/local_space.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <map>
#include <memory>
#include <set>
#include <thread>

#include "mount/content_walk.h"
#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

using namespace std::chrono_literals;

constexpr std::size_t kSmall = 8192;
constexpr LocalSpace::Pace kAtOnce{
    .burst = 1ms, .others = 1h, .firstRetry = 1h, .longestRetry = 1h};

bool waitUntil(const std::function<bool()>& holds) {
  const auto deadline = std::chrono::steady_clock::now() + 60s;
  while (!holds()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::yield();
  }
  return true;
}

/// A tree without a host: what is given up is cut to nothing.
class LocalSpaceTest : public ::testing::Test {
 protected:
  LocalSpaceTest() {
    for (const std::string& folder : {root(), trash()}) mkdir(folder.c_str(), 0700);
    places_ = Places::open(root(), trash(), nullptr);
  }
  ~LocalSpaceTest() override { space_.reset(); }
  [[nodiscard]] std::string root() const { return directory_.path() + "/root"; }
  [[nodiscard]] std::string trash() const { return directory_.path() + "/trash"; }
  [[nodiscard]] std::string at(const std::string& name) const { return root() + "/" + name; }

  /// Files that are older the smaller their numbers are, with all blocks on the disk: while ext4 is
  /// moving blocks there, a look may find a file to have none.
  void make(const std::string& folder, std::size_t count) {
    for (std::size_t i = 0; i < count; ++i) makeFile(folder + "/" + std::to_string(i), i);
    const int descriptor = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    EXPECT_EQ(syncfs(descriptor), 0);
    close(descriptor);
  }
  static void makeFile(const std::string& path, std::size_t number, std::size_t bytes = kSmall) {
    std::ofstream(path) << std::string(bytes, 'x');
    const timespec date{.tv_sec = 1'000'000'000 + static_cast<time_t>(number), .tv_nsec = 0};
    const timespec dates[2] = {date, date};
    ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), dates, 0), 0);
  }
  static std::uint64_t inodeOf(const std::string& path) {
    struct stat status{};
    EXPECT_EQ(lstat(path.c_str(), &status), 0) << path;
    return status.st_ino;
  }

  void start(std::uint64_t limit, LocalSpace::Pace pace = kAtOnce) {
    space_.emplace(
        *places_, [this](const std::string& location) { return giveUp(location); }, limit, pace);
  }
  NSErrorRef giveUp(const std::string& location) {
    LockGuard guard(mutex_);
    ++asked_;
    lastAsked_ = location;
    if (refusal_) return refusal_;
    if (kept_.contains(location)) return NSError::errorWithErrno(EBUSY, location);
    const auto onDisk = onDisk_.find(location);
    (void)truncate((onDisk == onDisk_.end() ? location : onDisk->second).c_str(), 0);
    return nullptr;
  }
  void refuse(const NSErrorRef& error) {
    LockGuard guard(mutex_);
    refusal_ = error;
  }
  /// Refused from now on.
  void keep(const std::string& name) {
    LockGuard guard(mutex_);
    kept_.insert(at(name));
  }
  [[nodiscard]] std::size_t asked() const {
    LockGuard guard(mutex_);
    return asked_;
  }
  [[nodiscard]] bool isHere(const std::string& path) const { return contentBytesAt(path) > 0; }
  [[nodiscard]] std::uint64_t total() const {
    std::uint64_t sum = 0;
    for (const std::string& folder : {root(), trash()}) {
      walkContent(folder, [&](ContentFile&& file) {
        sum += file.bytes;
        return true;
      });
    }
    return sum;
  }
  /// Whether the tree was looked through so often, and no more often.
  [[nodiscard]] bool hasLooked(std::uint64_t times) const {
    return waitUntil([&] { return space_->looks() >= times; }) && space_->looks() == times;
  }

  TemporaryDirectory directory_;
  std::unique_ptr<Places> places_;
  mutable Mutex mutex_;
  std::size_t asked_ GUARDED_BY(mutex_) = 0;
  std::string lastAsked_ GUARDED_BY(mutex_);
  NSErrorRef refusal_ GUARDED_BY(mutex_);
  std::set<std::string> kept_ GUARDED_BY(mutex_);
  std::map<std::string, std::string> onDisk_ GUARDED_BY(mutex_);
  std::optional<LocalSpace> space_;
};

TEST_F(LocalSpaceTest, ThousandsOfSmallFilesObeyTheBound) {
  mkdir(at("folder").c_str(), 0700);
  make(at("folder"), 2'000);
  const std::uint64_t limit = total() / 4;
  start(limit);
  EXPECT_TRUE(waitUntil([&] { return total() <= limit; }));
  EXPECT_FALSE(isHere(at("folder/0")));
  EXPECT_TRUE(isHere(at("folder/1999")));
}

TEST_F(LocalSpaceTest, WhatIsInTheTrashCountsAndGoes) {
  makeFile(at("new"), 2, 100'000);
  makeFile(trash() + "/old", 1, 100'000);
  start(150'000);
  EXPECT_TRUE(waitUntil([&] { return !isHere(trash() + "/old"); }));
  EXPECT_TRUE(isHere(at("new")));
}

TEST_F(LocalSpaceTest, WhatFitsHasNothingLookedThrough) {
  start(1U << 30U);
  ASSERT_TRUE(hasLooked(1));
  for (int i = 0; i < 1'000; ++i) {
    space_->noteGrowth(1U << 18U);
    space_->noteChange();
  }
  space_->noteGrowth(1U << 30U);
  EXPECT_TRUE(hasLooked(2));
}

TEST_F(LocalSpaceTest, WhileFilesAreSavedAtTheBoundTheTreeIsLookedThroughNowAndThen) {
  make(root(), 160);
  const std::uint64_t bound = total();
  const std::uint64_t each = bound / 160;
  start(bound);
  ASSERT_TRUE(hasLooked(1));
  for (std::size_t i = 160; i < 240; ++i) {
    makeFile(at(std::to_string(i)), i);
    space_->noteGrowth(each);
    ASSERT_TRUE(waitUntil([&] { return total() <= bound; })) << i;
  }
  // One for each sixteenth of the bound, that is ten files; some more where a save came amid one.
  EXPECT_LE(space_->looks(), 16U);
}

TEST_F(LocalSpaceTest, WhatOthersChangeIsSeenAfterAPause) {
  start(50'000, {.burst = 1ms, .others = 1ms, .firstRetry = 1h, .longestRetry = 1h});
  ASSERT_TRUE(hasLooked(1));
  makeFile(at("file"), 1, 100'000);
  space_->noteChange();
  EXPECT_TRUE(waitUntil([&] { return !isHere(at("file")); }));
}

TEST_F(LocalSpaceTest, UsesAreRememberedWhenManyMoreCome) {
  makeFile(at("used"), 1, 100'000);
  makeFile(at("newer"), 2, 100'000);
  start(250'000);
  ASSERT_TRUE(hasLooked(1));
  space_->noteUse(inodeOf(at("used")));
  for (std::uint64_t i = 0; i < 16'384; ++i) space_->noteUse((1ULL << 40U) + i);
  makeFile(at("third"), 3, 100'000);
  space_->noteUse(inodeOf(at("third")));
  space_->noteGrowth(200'000);
  EXPECT_TRUE(waitUntil([&] { return !isHere(at("newer")); }));
  EXPECT_TRUE(isHere(at("used")));
}

TEST_F(LocalSpaceTest, TheHostIsAskedForWhatIsShownOtherwiseByThatName) {
  mkdir(at("folder 2").c_str(), 0700);
  makeFile(at("folder 2/name 2"), 1, 100'000);
  places_->showName(inodeOf(root()), "folder 2", "Folder");
  places_->showName(inodeOf(at("folder 2")), "name 2", "Name");
  {
    LockGuard guard(mutex_);
    onDisk_[at("Folder/Name")] = at("folder 2/name 2");
  }
  start(1'000);
  EXPECT_TRUE(waitUntil([&] { return !isHere(at("folder 2/name 2")); }));
}

TEST_F(LocalSpaceTest, WhenNothingCanBeGivenUpThoseThatWereRefusedAreAskedForAgain) {
  make(root(), 10);
  refuse(NSError::errorWithErrno(EBUSY, "pinned"));
  start(1'000, {.burst = 1ms, .others = 1h, .firstRetry = 1ms, .longestRetry = 2ms});
  EXPECT_TRUE(waitUntil([&] { return asked() >= 100; }));
  EXPECT_EQ(space_->looks(), 1U);
  EXPECT_TRUE(space_->isStuck());
  refuse(nullptr);
  EXPECT_TRUE(waitUntil([&] { return total() == 0; }));
  EXPECT_TRUE(hasLooked(2));
  EXPECT_TRUE(waitUntil([&] { return !space_->isStuck(); }));
}

TEST_F(LocalSpaceTest, WhenNothingCanBeGivenUpTheTreeRestsUntilMoreHasCome) {
  makeFile(at("pinned"), 1, 1U << 20U);
  keep("pinned");
  start(1U << 19U);
  ASSERT_TRUE(waitUntil([&] { return space_->isStuck(); }));
  space_->noteGrowth(1'000);
  makeFile(at("file"), 2, 100'000);
  space_->noteGrowth(100'000);
  EXPECT_TRUE(waitUntil([&] { return !isHere(at("file")); }));
  EXPECT_TRUE(hasLooked(2));
}

TEST_F(LocalSpaceTest, WithTheStoreOutOfReachTheRestIsNotAskedFor) {
  make(root(), 10);
  refuse(NSError::errorWithDomain(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError));
  start(1'000);
  EXPECT_TRUE(waitUntil([&] { return space_->isStuck(); }));
  EXPECT_EQ(asked(), 1U);
}

TEST_F(LocalSpaceTest, WhatCanBeGivenUpIsFoundBehindAnyNumberThatCannot) {
  constexpr std::size_t kMany = 10'001;
  make(root(), kMany);
  for (std::size_t i = 0; i + 1 < kMany; ++i) keep(std::to_string(i));
  start(total() - 1);
  EXPECT_TRUE(waitUntil([&] { return !isHere(at(std::to_string(kMany - 1))); }));
}

}  // namespace
}  // namespace yomber
