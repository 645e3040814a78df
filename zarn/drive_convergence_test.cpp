// Random changes on disk, and what everybody who looks at the drive holds in the end.
#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <set>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/lock.h"
#include "zarn/drive.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;
using std::chrono::steady_clock;

/// Keeps what it is told: the parent and the name of every item.
class Picture final : public WatchReceiver {
 public:
  using Items = std::map<std::uint64_t, std::pair<std::uint64_t, std::string>>;

  void receive(std::vector<WatchedChange> changes, std::function<void(bool)> answered) override {
    {
      LockGuard guard(mutex_);
      for (const auto& change : changes) {
        items_.erase(change.row->id);
        if (!change.isDeletion) {
          items_[change.row->id] = {change.row->parent, change.row->name};
        }
      }
      changed_.notifyAll();
    }
    answered(true);
  }
  void fail(NSErrorRef error) override { ADD_FAILURE() << error->description(); }

  /// Waits for news, but not for long: not all that is waited for is told here.
  void waitAMoment() const {
    LockGuard guard(mutex_);
    changed_.waitUntil(mutex_, steady_clock::now() + std::chrono::milliseconds(5));
  }

  /// Locations below the root, as they follow from what was told.
  std::set<std::string> locations() const {
    LockGuard guard(mutex_);
    std::set<std::string> result;
    for (const auto& [id, place] : items_) result.insert(locationOf(id));
    return result;
  }

 private:
  std::string locationOf(std::uint64_t id) const REQUIRES(mutex_) {
    std::string location;
    for (int depth = 0; id != kRootID && depth < 1000; ++depth) {
      const auto found = items_.find(id);
      if (found == items_.end()) return "?" + std::to_string(id) + location;
      location.insert(0, "/" + found->second.second);
      id = found->second.first;
    }
    return location;
  }

  mutable Mutex mutex_;
  mutable Condition changed_;
  Items items_ GUARDED_BY(mutex_);
};

class DriveConvergenceTest : public testing::Test {
 protected:
  DriveConvergenceTest() {
    char directory[] = "/tmp/yomber-convergence-XXXXXX";
    base_ = mkdtemp(directory);
    setenv("XDG_RUNTIME_DIR", base_.c_str(), 1);
    const char* const seed = std::getenv("YOMBER_TEST_SEED");
    seed_ = seed != nullptr ? std::strtoul(seed, nullptr, 10) : std::random_device()();
    random_.seed(seed_);
    RecordProperty("seed", std::to_string(seed_));
  }
  ~DriveConvergenceTest() override {
    FaultPoint::disarmAll();
    if (drive_) drive_->stop();
    drive_.reset();
    fs::remove_all(base_);
  }

  void up(Drive::Options options = {}) {
    options.applications = {};
    options.content.uploadPause = std::chrono::milliseconds::zero();
    NSErrorRef error;
    drive_ = Drive::open(DrivePaths::forHome(base_ + "/home"), options, &error);
    ASSERT_TRUE(drive_) << error->description();
    root_ = drive_->layout.root();
    picture_ = std::make_shared<Picture>();
    subscription_ = drive_->watchers->subscribe(picture_);
    ASSERT_EQ(subscription_->watch(kRootID, 23), nullptr);
    drive_->start();
    ASSERT_TRUE(waitUntil([this] { return drive_->firstScan->isOpen(); }));
  }

  unsigned pick(std::size_t count) {
    return std::uniform_int_distribution<unsigned>(0, static_cast<unsigned>(count) - 1)(random_);
  }
  std::string somePlace() {
    return folders_[pick(folders_.size())] + "/" + names_[pick(names_.size())];
  }

  /// One of the things that programs do; whether it succeeds depends on what is there.
  void changeSomething() {
    std::error_code ignored;
    const std::string place = root_ + somePlace();
    const std::string other = root_ + somePlace();
    switch (pick(9)) {
      case 0:
      case 1:
        std::ofstream(place) << std::string(pick(100) + 1, 'x');
        break;
      case 2:
        fs::create_directories(place, ignored);
        break;
      case 3:
        (void)unlink(place.c_str());
        break;
      case 4:
        fs::remove_all(place, ignored);
        break;
      case 5:
        if (fs::is_regular_file(place, ignored)) std::ofstream(place, std::ios::app) << "y";
        break;
      case 6: {  // a save: written aside, then put in the place
        std::ofstream(place + ".new") << "saved";
        fs::rename(place + ".new", place, ignored);
        break;
      }
      default:
        fs::rename(place, other, ignored);
        break;
    }
  }

  std::set<std::string> onDisk() const {
    std::set<std::string> result;
    for (const auto& entry : fs::recursive_directory_iterator(root_)) {
      result.insert(entry.path().string().substr(root_.size()));
    }
    return result;
  }
  /// What a client finds that lists everything.
  std::set<std::string> listed() const {
    std::set<std::string> result;
    std::vector<std::pair<std::uint64_t, std::string>> open{{kRootID, ""}};
    while (!open.empty()) {
      const auto [folder, location] = open.back();
      open.pop_back();
      for (const auto& row : drive_->store->children(folder)) {
        result.insert(location + "/" + row.name);
        if (row.isFolder()) open.emplace_back(row.id, location + "/" + row.name);
      }
    }
    return result;
  }
  bool waitUntil(const std::function<bool()>& condition) {
    const auto deadline = steady_clock::now() + std::chrono::seconds(30);
    while (!condition()) {
      if (steady_clock::now() > deadline) return false;
      picture_->waitAMoment();
    }
    return true;
  }
  void expectEverybodyAgrees() {
    const auto disk = onDisk();
    (void)waitUntil([&] { return listed() == disk; });
    EXPECT_EQ(difference(listed(), disk), "") << "seed " << seed_;
    (void)waitUntil([&] { return picture_->locations() == disk; });
    EXPECT_EQ(difference(picture_->locations(), disk), "") << "seed " << seed_;
  }
  static std::string difference(const std::set<std::string>& held,
                                const std::set<std::string>& disk) {
    std::string result;
    for (const auto& each : held) {
      if (!disk.contains(each)) result += " not on disk: " + each;
    }
    for (const auto& each : disk) {
      if (!held.contains(each)) result += " only on disk: " + each;
    }
    return result;
  }

  std::string base_;
  std::string root_;
  unsigned long seed_ = 0;
  std::mt19937 random_;
  const std::vector<std::string> folders_{"", "/a", "/a/b", "/a/b/c", "/d", "/d/e"};
  const std::vector<std::string> names_{"a", "b", "c", "d", "e", "f.txt", "g.txt", "h"};
  std::shared_ptr<Drive> drive_;
  std::shared_ptr<Picture> picture_;
  std::shared_ptr<Subscription> subscription_;
};

TEST_F(DriveConvergenceTest, AfterRandomChangesAllHoldWhatIsOnDisk) {
  up();
  for (int round = 0; round < 10 && !HasFailure(); ++round) {
    for (int i = 0; i < 300; ++i) changeSomething();
    expectEverybodyAgrees();
  }
}

TEST_F(DriveConvergenceTest, WithTooFewWatchesTooAllHoldWhatIsOnDiskInTheEnd) {
  Drive::Options options;
  options.observer.watchLimit = 3;
  options.observer.unwatchedInterval = std::chrono::milliseconds(5);
  options.observer.unwatchedCostFactor = 1;
  up(options);
  for (int round = 0; round < 5 && !HasFailure(); ++round) {
    for (int i = 0; i < 200; ++i) changeSomething();
    expectEverybodyAgrees();
  }
}

TEST_F(DriveConvergenceTest, AfterAnOverflowOfTheEventQueueAllHoldWhatIsOnDisk) {
  up();
  int limit = 0;
  std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> limit;
  ASSERT_GT(limit, 0);
  const std::string go = base_ + "/go";
  ASSERT_EQ(FaultPoint::arm("zarn.observer.before-read=pause-until-file:" + go), nullptr);
  std::ofstream(root_ + "/first") << "x";
  ASSERT_TRUE(waitUntil([&] { return fs::exists(go + ".reached"); }));
  for (int i = 0; i < limit; ++i) {
    if (i % 10 == 0) changeSomething();
    std::ofstream(root_ + "/x" + std::to_string(i % 100)) << "x";
  }
  std::ofstream(go).put('x');
  expectEverybodyAgrees();
}

TEST_F(DriveConvergenceTest, FoldersThatChangePlacesWithWhatTheyHoldKeepTheirIdentities) {
  up();
  for (int i = 0; i < 20; ++i) {
    fs::create_directories(root_ + "/outer" + std::to_string(i) + "/inner" + std::to_string(i));
  }
  expectEverybodyAgrees();
  const std::string go = base_ + "/go";
  ASSERT_EQ(FaultPoint::arm("zarn.observer.before-read=pause-until-file:" + go), nullptr);
  std::ofstream(root_ + "/first") << "x";
  ASSERT_TRUE(waitUntil([&] { return fs::exists(go + ".reached"); }));
  std::map<int, std::uint64_t> ids;
  for (int i = 0; i < 20; ++i) {
    const std::string outer = "/outer" + std::to_string(i);
    const std::string inner = "/inner" + std::to_string(i);
    ids[i] = drive_->store->itemAtPath(root_ + outer)->id;
    fs::rename(root_ + outer + inner, root_ + inner);
    fs::rename(root_ + outer, root_ + inner + outer);
  }
  std::ofstream(go).put('x');
  expectEverybodyAgrees();
  for (int i = 0; i < 20; ++i) {
    const std::string path = "/inner" + std::to_string(i) + "/outer" + std::to_string(i);
    const auto row = drive_->store->itemAtPath(root_ + path);
    ASSERT_TRUE(row);
    EXPECT_EQ(row->id, ids[i]) << path;
  }
}

TEST_F(DriveConvergenceTest, AfterARestartAllHoldWhatIsOnDisk) {
  up();
  for (int round = 0; round < 3 && !HasFailure(); ++round) {
    for (int i = 0; i < 200; ++i) changeSomething();
    drive_->stop();
    subscription_.reset();
    drive_.reset();
    for (int i = 0; i < 100; ++i) changeSomething();
    up();
    const auto disk = onDisk();
    (void)waitUntil([&] { return listed() == disk; });
    EXPECT_EQ(difference(listed(), disk), "") << "seed " << seed_;
  }
}

TEST_F(DriveConvergenceTest, AFolderThatMovesBeforeItWasReadIsReadInItsNewPlace) {
  up();
  const std::string go = base_ + "/go";
  ASSERT_EQ(FaultPoint::arm("zarn.scan.before-new-folders=pause-until-file:" + go), nullptr);
  fs::create_directories(root_ + "/new/below");
  ASSERT_TRUE(waitUntil([&] { return fs::exists(go + ".reached"); }));
  fs::create_directory(root_ + "/elsewhere");
  fs::rename(root_ + "/new", root_ + "/elsewhere/moved");
  std::ofstream(root_ + "/elsewhere/moved/x") << "x";
  std::ofstream(root_ + "/elsewhere/moved/below/y") << "y";
  std::ofstream(go).put('x');
  expectEverybodyAgrees();
  std::ofstream(root_ + "/elsewhere/moved/below/later") << "z";
  expectEverybodyAgrees();
}

}  // namespace
}  // namespace yomber
