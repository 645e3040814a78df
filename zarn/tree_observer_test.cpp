#include "zarn/tree_observer.h"

#include <dirent.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/lock.h"

namespace yomber {
namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;
namespace fs = std::filesystem;

/// What is told of events.
class NotingSink final : public DiskEventSink {
 public:
  [[nodiscard]] bool wantsEvents() const override { return wantsEvents_; }
  void entriesDidChange(const std::vector<DiskEntry>& entries) override {
    LockGuard guard(mutex_);
    entries_.insert(entries.begin(), entries.end());
  }
  void didLoseTrack() override { ++losses_; }

  bool has(const DiskEntry& entry) {
    LockGuard guard(mutex_);
    return entries_.contains(entry);
  }
  std::set<DiskEntry> take() {
    LockGuard guard(mutex_);
    return std::exchange(entries_, {});
  }
  [[nodiscard]] int losses() const { return losses_; }
  void setWanted(bool wanted) { wantsEvents_ = wanted; }

 private:
  std::atomic<bool> wantsEvents_{true};
  std::atomic<int> losses_{0};
  Mutex mutex_;
  std::set<DiskEntry> entries_ GUARDED_BY(mutex_);
};

/// A real tree, and a scanner that keeps nothing but a picture of it: what it has seen, by path.
class TreeObserverTest : public testing::Test {
 protected:
  TreeObserverTest() {
    char directory[] = "/tmp/yomber-observer-XXXXXX";
    base_ = mkdtemp(directory);
    root_ = base_ + "/tree";
    fs::create_directory(root_);
    idsByInode_[inodeOf(root_)] = kRootID;
  }
  ~TreeObserverTest() override {
    FaultPoint::disarmAll();
    if (observer_) observer_->stop();
    fs::remove_all(base_);
  }

  void start(TreeObserver::Options options = {}) {
    observer_ = std::make_shared<TreeObserver>(options);
    observer_->setEventSink(seen_);
    observer_->start({.scanAll = [this] { return scanAll(); },
                      .scanDirty = [this](const auto& dirty, auto&) { return scanDirty(dirty); },
                      .didFinishFirstScan = {}});
    ASSERT_TRUE(waitUntil([this] { return !observer_->status().scanning; }));
    ASSERT_TRUE(waitUntilPictureIsRight());
  }

  void write(const std::string& name, const std::string& text) {
    std::ofstream(root_ + "/" + name) << text;
  }

  /// What is on disk: files with their sizes, folders with -1.
  std::map<std::string, long> actual() const {
    std::map<std::string, long> result;
    for (const auto& entry : fs::recursive_directory_iterator(root_)) {
      result[entry.path()] =
          entry.is_directory() ? -1 : static_cast<long>(fs::file_size(entry.path()));
    }
    return result;
  }
  bool waitUntil(const std::function<bool()>& condition) {
    const auto deadline = steady_clock::now() + std::chrono::seconds(20);
    LockGuard guard(mutex_);
    while (!condition()) {
      // Not everything that is waited for announces itself: looked at again after a moment.
      changed_.waitUntil(mutex_, steady_clock::now() + milliseconds(5));
      if (steady_clock::now() > deadline) return condition();
    }
    return true;
  }
  bool waitUntilPictureIsRight() {
    return waitUntil([this]() NO_THREAD_SAFETY_ANALYSIS { return picture_ == actual(); });
  }
  int fullScans() {
    LockGuard guard(mutex_);
    return fullScans_;
  }

  // --- The scanner, on the observer's thread.

  NSErrorRef scanAll() {
    LockGuard guard(mutex_);
    ++fullScans_;
    changed_.notifyAll();
    if (failures_ > 0) {
      --failures_;
      return NSError::errorWithErrno(EIO, root_);
    }
    picture_.clear();
    readFolder(root_);
    return nullptr;
  }

  NSErrorRef scanDirty(const std::vector<DirtyFolder>& dirty) {
    LockGuard guard(mutex_);
    batches_.push_back(dirty.size());
    for (const auto& folder : dirty) {
      const auto path = pathsByID_.find(folder.id);
      if (path == pathsByID_.end()) continue;
      const std::string place = path->second;
      if (folder.isWhole) {
        forgetBelow(place);
        readFolder(place);
      }
      for (const auto& name : folder.names) look(place + "/" + name);
    }
    changed_.notifyAll();
    return nullptr;
  }

  void look(const std::string& path) REQUIRES(mutex_) {
    struct stat status{};
    forgetBelow(path);
    picture_.erase(path);
    if (lstat(path.c_str(), &status) != 0) return;
    picture_[path] = S_ISDIR(status.st_mode) ? -1 : static_cast<long>(status.st_size);
    if (S_ISDIR(status.st_mode)) readFolder(path);
  }

  void readFolder(const std::string& path) REQUIRES(mutex_) {
    const int descriptor = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (descriptor < 0) return;
    const std::uint64_t visit = ++visits_;
    observer_->willReadFolder(visit, descriptor);
    const std::uint64_t id = idOf(descriptor);
    std::set<std::string> names;
    DIR* const stream = fdopendir(descriptor);
    while (const dirent* const entry = readdir(stream)) names.insert(entry->d_name);
    closedir(stream);
    pathsByID_[id] = path;
    observer_->didIdentifyFolder(visit, id);
    for (const auto& name : names) {
      if (name != "." && name != "..") look(path + "/" + name);
    }
  }

  void forgetBelow(const std::string& path) REQUIRES(mutex_) {
    static_assert('0' == '/' + 1);
    picture_.erase(picture_.lower_bound(path + "/"), picture_.lower_bound(path + "0"));
  }

  std::uint64_t idOf(int descriptor) REQUIRES(mutex_) {
    struct stat status{};
    fstat(descriptor, &status);
    const auto [at, isNew] = idsByInode_.try_emplace(status.st_ino, nextID_);
    if (isNew) ++nextID_;
    return at->second;
  }
  static ino_t inodeOf(const std::string& path) {
    struct stat status{};
    stat(path.c_str(), &status);
    return status.st_ino;
  }

  [[nodiscard]] DiskEntry entry(const std::string& folder, const std::string& name) const {
    return {.folder = inodeOf(root_ + "/" + folder), .name = name};
  }
  bool waitUntilSeen(const DiskEntry& entry) {
    return waitUntil([&] { return seen_->has(entry); });
  }

  std::string base_;
  std::string root_;
  std::shared_ptr<NotingSink> seen_ = std::make_shared<NotingSink>();
  std::shared_ptr<TreeObserver> observer_;

  Mutex mutex_;
  Condition changed_;
  std::map<std::string, long> picture_ GUARDED_BY(mutex_);
  std::map<std::uint64_t, std::string> pathsByID_ GUARDED_BY(mutex_);
  std::map<ino_t, std::uint64_t> idsByInode_ GUARDED_BY(mutex_);
  std::vector<std::size_t> batches_ GUARDED_BY(mutex_);
  std::uint64_t nextID_ GUARDED_BY(mutex_) = kFirstIssuedID;
  std::uint64_t visits_ GUARDED_BY(mutex_) = 0;
  int fullScans_ GUARDED_BY(mutex_) = 0;
  int failures_ GUARDED_BY(mutex_) = 0;
};

TEST_F(TreeObserverTest, SeesFilesAndFoldersComeChangeAndGo) {
  fs::create_directories(root_ + "/a/b");
  write("a/before", "1");
  start();
  write("new", "12345");
  write("a/b/deep", "12");
  ASSERT_TRUE(waitUntilPictureIsRight());
  write("new", "longer than before");
  fs::remove(root_ + "/a/before");
  fs::rename(root_ + "/a/b", root_ + "/c");
  ASSERT_TRUE(waitUntilPictureIsRight());
  write("c/deep", "in its new place");
  ASSERT_TRUE(waitUntilPictureIsRight());
  EXPECT_EQ(fullScans(), 1);
  EXPECT_EQ(observer_->status().watchedFolders, 3U);
  EXPECT_EQ(observer_->status().advice, "");
}

TEST_F(TreeObserverTest, LosesNoChildOfFoldersThatAreMadeAndFilledAtOnce) {
  start();
  for (int i = 0; i < 200; ++i) {
    const std::string folder = "f" + std::to_string(i) + "/g/h";
    fs::create_directories(root_ + "/" + folder);
    write(folder + "/x", "1");
    write(folder + "/y", "22");
  }
  ASSERT_TRUE(waitUntilPictureIsRight());
  EXPECT_EQ(observer_->status().watchedFolders, 601U);
}

TEST_F(TreeObserverTest, BothEndsOfAMoveAreScannedTogether) {
  fs::create_directory(root_ + "/a");
  fs::create_directory(root_ + "/b");
  write("a/x", "1");
  start();
  for (int i = 0; i < 50; ++i) {
    {
      LockGuard guard(mutex_);
      batches_.clear();
    }
    const bool isBack = i % 2 == 1;
    fs::rename(root_ + (isBack ? "/b/x" : "/a/x"), root_ + (isBack ? "/a/x" : "/b/x"));
    ASSERT_TRUE(waitUntilPictureIsRight());
    LockGuard guard(mutex_);
    EXPECT_THAT(batches_, testing::ElementsAre(2U));
  }
}

TEST_F(TreeObserverTest, AFileThatStaysOpenIsSeenToGrow) {
  start();
  std::ofstream file(root_ + "/log");
  file << "first" << std::flush;
  ASSERT_TRUE(waitUntilPictureIsRight());
  file << "second" << std::flush;
  ASSERT_TRUE(waitUntilPictureIsRight());
}

TEST_F(TreeObserverTest, GivesBackTheWatchesOfDeadFolders) {
  fs::create_directories(root_ + "/a/b");
  start();
  ASSERT_EQ(observer_->status().watchedFolders, 3U);
  // Out of the tree: the system keeps such watches.
  fs::rename(root_ + "/a", base_ + "/a");
  ASSERT_TRUE(waitUntilPictureIsRight());
  ItemChange change;
  change.row.kind = ItemKind::Folder;
  change.row.flags = row_flag::kDead;
  std::vector<ItemChange> changes(2, change);
  changes[0].row.id = kFirstIssuedID;
  changes[1].row.id = kFirstIssuedID + 1;
  observer_->committed(changes);
  EXPECT_EQ(observer_->status().watchedFolders, 1U);
  // And back.
  fs::rename(base_ + "/a", root_ + "/a");
  ASSERT_TRUE(waitUntilPictureIsRight());
  write("a/b/x", "1");
  ASSERT_TRUE(waitUntilPictureIsRight());
  EXPECT_EQ(observer_->status().watchedFolders, 3U);
}

TEST_F(TreeObserverTest, AnOverflowLeadsToAScanOfEverything) {
  start();
  int limit = 0;
  std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> limit;
  ASSERT_GT(limit, 0);
  const std::string go = base_ + "/go";
  ASSERT_EQ(FaultPoint::arm("zarn.observer.before-read=pause-until-file:" + go), nullptr);
  write("first", "1");
  ASSERT_TRUE(waitUntil([&] { return fs::exists(go + ".reached"); }));
  for (int i = 0; i < limit; ++i) {
    const std::string name = root_ + "/x" + std::to_string(i);
    close(open(name.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0600));
  }
  std::ofstream(go).put('x');
  ASSERT_TRUE(waitUntilPictureIsRight());
  EXPECT_GE(fullScans(), 2);
  EXPECT_GE(seen_->losses(), 1);
}

TEST_F(TreeObserverTest, WhateverHappensIsToldByTheFoldersInodeAndTheName) {
  fs::create_directories(root_ + "/a/b");
  write("a/x", "1");
  start();
  EXPECT_EQ(seen_->losses(), 0);
  (void)seen_->take();
  write("a/.~lock.x#", "made");
  EXPECT_TRUE(waitUntilSeen(entry("a", ".~lock.x#")));
  ASSERT_EQ(setxattr((root_ + "/a/x").c_str(), "user.of-somebody", "1", 1, 0), 0);
  EXPECT_TRUE(waitUntilSeen(entry("a", "x")));
  fs::rename(root_ + "/a/x", root_ + "/a/b/y");
  EXPECT_TRUE(waitUntilSeen(entry("a/b", "y")));
  fs::permissions(root_ + "/a/b", fs::perms::owner_all);
  EXPECT_TRUE(waitUntilSeen(entry("a", "b")));
  EXPECT_TRUE(waitUntilSeen(entry("a/b", ".")));
  fs::permissions(root_, fs::perms::owner_all);
  EXPECT_TRUE(waitUntilSeen(entry("", ".")));
  ASSERT_TRUE(waitUntilPictureIsRight());
}

TEST_F(TreeObserverTest, AFolderThatIsWatchedFromNowOnIsToldAsAWhole) {
  fs::create_directories(root_ + "/a");
  start();
  EXPECT_TRUE(seen_->has(entry("", "")));
  EXPECT_TRUE(seen_->has(entry("a", "")));
  (void)seen_->take();
  fs::create_directories(root_ + "/a/b/c");
  EXPECT_TRUE(waitUntilSeen(entry("a/b/c", "")));
  EXPECT_TRUE(seen_->has(entry("a", "b")));
  // Folders that were watched already are not, however often they are read.
  observer_->requestFullScan();
  ASSERT_TRUE(waitUntil([this]() NO_THREAD_SAFETY_ANALYSIS { return fullScans_ == 2; }));
  write("last", "1");
  ASSERT_TRUE(waitUntilSeen(entry("", "last")));
  EXPECT_FALSE(seen_->has(entry("", "")));
  EXPECT_TRUE(observer_->isWatched(kRootID));
}

TEST_F(TreeObserverTest, NothingIsToldWhileNobodyWantsIt) {
  seen_->setWanted(false);
  start();
  write("x", "1");
  ASSERT_TRUE(waitUntilPictureIsRight());
  EXPECT_TRUE(seen_->take().empty());
}

TEST_F(TreeObserverTest, WithoutWatchesFoldersAreScannedFromTimeToTime) {
  fs::create_directory(root_ + "/a");
  fs::create_directory(root_ + "/b");
  start({.watchLimit = 1, .unwatchedInterval = milliseconds(10), .unwatchedCostFactor = 1});
  ASSERT_TRUE(waitUntil([this] { return observer_->status().unwatchedFolders == 2; }));
  EXPECT_EQ(observer_->status().watchedFolders, 1U);
  EXPECT_THAT(observer_->status().advice, testing::HasSubstr("--watch-limit to at least 3"));
  write("a/x", "1");
  write("b/y", "1");
  ASSERT_TRUE(waitUntilPictureIsRight());
  EXPECT_EQ(fullScans(), 1);
}

TEST_F(TreeObserverTest, AFailedScanOfTheTreeIsTriedAgain) {
  {
    LockGuard guard(mutex_);
    failures_ = 3;
  }
  write("x", "1");
  start({.retryInterval = milliseconds(1)});
  EXPECT_EQ(fullScans(), 4);
  EXPECT_EQ(observer_->status().lastFailure, nullptr);
}

TEST_F(TreeObserverTest, AThousandChangesDuringAScanAreSeenWithFewScans) {
  start();
  {
    // Without the lock the scan of the first change does not get on.
    LockGuard guard(mutex_);
    for (int i = 0; i < 1000; ++i) write("x" + std::to_string(i % 10), std::to_string(i));
  }
  ASSERT_TRUE(waitUntilPictureIsRight());
  LockGuard guard(mutex_);
  EXPECT_LT(batches_.size(), 50U);
}

}  // namespace
}  // namespace yomber
