#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <kj/debug.h>
#include <sys/stat.h>

#include "zarn/recording_receiver.h"
#include "zarn/test_daemon.h"

namespace yomber::test {
namespace {

using testing::ElementsAre;
using testing::Pair;

constexpr const char* kComposed = "caf\u00e9";
constexpr const char* kDecomposed = "cafe\u0301";

/// A mount's side: hands what it is told to a receiver that notes it.
class Mount final : public protocol::TreeObserver::Server {
 public:
  enum class Answers { AtOnce, Never, WithFailure };
  explicit Mount(std::shared_ptr<RecordingReceiver> receiver, Answers answers = Answers::AtOnce)
      : receiver_(std::move(receiver)), answers_(answers) {}

  kj::Promise<void> didStart(DidStartContext context) override {
    receiver_->start(decode(context.getParams().getShownNames()), [](bool) {});
    return answer();
  }
  kj::Promise<void> didChange(DidChangeContext context) override {
    JournalBatch batch;
    for (const auto entry : context.getParams().getEntries()) {
      batch.entries.push_back(
          {.folder = entry.getFolder(), .name = stringFromWire(entry.getName())});
    }
    batch.shownNames = decode(context.getParams().getShownNames());
    receiver_->change(std::move(batch), [](bool) {});
    return answer();
  }
  kj::Promise<void> didLoseTrack(DidLoseTrackContext) override {
    receiver_->loseTrack([](bool) {});
    return answer();
  }

 private:
  static std::vector<ShownName> decode(capnp::List<protocol::ShownName>::Reader names) {
    std::vector<ShownName> result;
    for (const auto name : names) {
      result.push_back({.folder = name.getFolder(),
                        .name = stringFromWire(name.getName()),
                        .shownName = stringFromWire(name.getShownName()),
                        .location = stringFromWire(name.getLocation())});
    }
    return result;
  }
  kj::Promise<void> answer() const {
    if (answers_ == Answers::WithFailure) return KJ_EXCEPTION(FAILED, "not taken");
    if (answers_ == Answers::Never) return kj::NEVER_DONE;
    return kj::READY_NOW;
  }

  const std::shared_ptr<RecordingReceiver> receiver_;
  const Answers answers_;
};

class DaemonTreeTest : public DaemonTest {
 protected:
  struct Observed {
    std::shared_ptr<RecordingReceiver> told = std::make_shared<RecordingReceiver>();
    ipc::Remote<protocol::Registration> registration;
  };
  Observed observe(Mount::Answers answers = Mount::Answers::AtOnce) {
    return observeOver(daemon_, answers);
  }
  Observed observeOver(const ipc::Remote<Wire>& daemon, Mount::Answers answers) {
    Observed observed;
    const auto error = ipc::callAndWait(
        daemon, &Wire::Client::observeTreeRequest,
        [&](auto params) { params.setObserver(kj::heap<Mount>(observed.told, answers)); },
        [&](auto results) {
          observed.registration = ipc::Remote<protocol::Registration>(results.getRegistration());
        });
    EXPECT_EQ(error, nullptr) << error->description();
    return observed;
  }
  /// A daemon whose tree has been scanned, so that nothing but the test changes anything.
  void upScanned(Drive::Options options = {}) {
    up(options);
    const auto deadline = steady_clock::now() + std::chrono::seconds(20);
    while (drive_->observer->status().scanning && steady_clock::now() < deadline) {
      call(&Wire::Client::describeRequest, [](auto) {}, [](auto) {});
    }
    ASSERT_FALSE(drive_->observer->status().scanning);
  }
  bool waitForObservers(std::size_t count) {
    const auto deadline = steady_clock::now() + std::chrono::seconds(20);
    while (drive_->journal->count() != count && steady_clock::now() < deadline) {
      call(&Wire::Client::describeRequest, [](auto) {}, [](auto) {});
    }
    return drive_->journal->count() == count;
  }
  [[nodiscard]] DiskEntry entry(const std::string& folder, const std::string& name) const {
    return {.folder = inode(folder), .name = name};
  }
  [[nodiscard]] std::uint64_t inode(const std::string& folder) const {
    struct stat status{};
    EXPECT_EQ(lstat((root_ + "/" + folder).c_str(), &status), 0) << folder;
    return status.st_ino;
  }
};

TEST_F(DaemonTreeTest, WhatIsMadeChangedRenamedAndRemovedOnDiskIsTold) {
  write("a/there");
  write("b/there");
  upScanned();
  const auto observed = observe();
  ASSERT_TRUE(observed.told->waitForStart());
  write("a/made");
  EXPECT_TRUE(observed.told->waitForEntry(entry("a", "made")));
  write("a/there", "changed");
  EXPECT_TRUE(observed.told->waitForEntry(entry("a", "there")));
  observed.told->forgetEntries();
  fs::rename(root_ + "/a/made", root_ + "/b/moved");
  EXPECT_TRUE(observed.told->waitForEntry(entry("a", "made")));
  EXPECT_TRUE(observed.told->waitForEntry(entry("b", "moved")));
  fs::remove(root_ + "/b/there");
  EXPECT_TRUE(observed.told->waitForEntry(entry("b", "there")));
}

TEST_F(DaemonTreeTest, NamesThatTheDriveLeavesAloneAreToldToo) {
  upScanned();
  const auto observed = observe();
  ASSERT_TRUE(observed.told->waitForStart());
  write(".x.swp");
  EXPECT_TRUE(observed.told->waitForEntry(entry("", ".x.swp")));
  EXPECT_FALSE(drive_->store->itemAtPath(root_ + "/.x.swp"));
}

TEST_F(DaemonTreeTest, WhatComesWithANewFolderIsToldHoweverFastItCame) {
  upScanned();
  const auto observed = observe();
  ASSERT_TRUE(observed.told->waitForStart());
  for (int i = 0; i < 20; ++i) write("new/deep" + std::to_string(i) + "/.x.swp");
  for (int i = 0; i < 20; ++i) {
    const std::string folder = "new/deep" + std::to_string(i);
    EXPECT_TRUE(observed.told->waitFor([&](const auto& told) {
      return told.entries.contains(entry(folder, "")) ||
             told.entries.contains(entry(folder, ".x.swp"));
    })) << folder;
  }
}

TEST_F(DaemonTreeTest, WithoutWatchesWhatScansFindIsTold) {
  write("a/x");
  write("b/x");
  Drive::Options options;
  options.observer.watchLimit = 1;
  options.observer.unwatchedInterval = std::chrono::milliseconds(10);
  options.observer.unwatchedCostFactor = 1;
  upScanned(options);
  const auto observed = observe();
  ASSERT_TRUE(observed.told->waitForStart());
  write("a/made");
  fs::rename(root_ + "/b/x", root_ + "/b/y");
  EXPECT_TRUE(observed.told->waitForEntry(entry("a", "made")));
  EXPECT_TRUE(observed.told->waitForEntry(entry("b", "x")));
  EXPECT_TRUE(observed.told->waitForEntry(entry("b", "y")));
  fs::permissions(root_ + "/a/x", fs::perms::owner_read);
  EXPECT_TRUE(observed.told->waitForEntry(entry("a", "x")));
}

TEST_F(DaemonTreeTest, ATwinsShownNameIsToldAtTheStartAndWhenItChanges) {
  write(kComposed);
  upScanned();
  const auto early = observe();
  ASSERT_TRUE(early.told->waitForStart());
  EXPECT_TRUE(early.told->told().names.empty());
  write(kDecomposed);
  const auto key = std::pair(inode(""), std::string(kDecomposed));
  EXPECT_TRUE(early.told->waitFor([&](const auto& told) { return told.names.contains(key); }));
  const auto late = observe();
  ASSERT_TRUE(late.told->waitForStart());
  EXPECT_THAT(late.told->told().names, ElementsAre(Pair(key, std::string(kDecomposed) + " 2")));
  fs::remove(root_ + "/" + kDecomposed);
  for (const auto& each : {early, late}) {
    EXPECT_TRUE(each.told->waitFor([](const auto& told) { return told.names.empty(); }));
  }
}

TEST_F(DaemonTreeTest, AnObserverThatCameBeforeTheFirstScanStartsAnewAfterIt) {
  write(kComposed);
  write(kDecomposed);
  const std::string go = base_ + "/go";
  ASSERT_EQ(FaultPoint::arm("zarn.drive.before-scan=pause-until-file:" + go), nullptr);
  up();
  const auto observed = observe();
  ASSERT_TRUE(observed.told->waitForStart());
  EXPECT_TRUE(observed.told->told().names.empty());
  std::ofstream(go).put('x');
  EXPECT_TRUE(observed.told->waitFor([](const auto& told) { return told.names.size() == 1; }));
  EXPECT_THAT(observed.told->told().calls, testing::Contains("lost"));
}

TEST_F(DaemonTreeTest, AContainersFolderIsToldWithTheLocationOfItsDocuments) {
  std::ofstream(base_ + "/applications/notes.desktop")
      << "[Desktop Entry]\nName=Notes\nX-Yomber-Container=org.example.notes\n";
  upScanned();
  const auto observed = observe();
  ASSERT_TRUE(observed.told->waitForStart());
  const std::string notes = drive_->layout.documents("org.example.notes");
  EXPECT_THAT(observed.told->told().containers, ElementsAre(Pair(notes, "Notes")));
  std::ofstream(notes + "/page") << "x";
  struct stat status{};
  ASSERT_EQ(stat(notes.c_str(), &status), 0);
  EXPECT_TRUE(observed.told->waitForEntry({.folder = status.st_ino, .name = "page"}));
  fs::remove(base_ + "/applications/notes.desktop");
  EXPECT_TRUE(observed.told->waitFor([](const auto& told) { return told.containers.empty(); }));
}

TEST_F(DaemonTreeTest, TooManyChangesForOneThatDoesNotAnswerHoldUpNobodyElse) {
  fs::create_directory(root_ + "/a");
  Drive::Options options;
  options.journal.maximumWaiting = 50;
  upScanned(options);
  const auto stuck = observe(Mount::Answers::Never);
  const auto quick = observe();
  ASSERT_TRUE(stuck.told->waitForStart());
  for (int i = 0; i < 200; ++i) {
    write("a/" + std::to_string(i));
    ASSERT_TRUE(quick.told->waitForEntry(entry("a", std::to_string(i)))) << i;
  }
  EXPECT_THAT(stuck.told->told().calls, ElementsAre("start"));
}

TEST_F(DaemonTreeTest, WhenTooMuchHappensAtOnceEverythingStartsAnew) {
  fs::create_directory(root_ + "/a");
  Drive::Options options;
  options.journal.maximumWaiting = 50;
  upScanned(options);
  const auto observed = observe();
  ASSERT_TRUE(observed.told->waitForStart());
  const std::string go = base_ + "/go";
  ASSERT_EQ(FaultPoint::arm("zarn.observer.before-read=pause-until-file:" + go), nullptr);
  for (int i = 0; i < 200; ++i) write("a/" + std::to_string(i));
  std::ofstream(go).put('x');
  EXPECT_TRUE(observed.told->waitFor([](const auto& told) {
    const auto lost = std::ranges::find(told.calls, "lost");
    return std::find(lost, told.calls.end(), "start") != told.calls.end();
  }));
  write("a/last");
  EXPECT_TRUE(observed.told->waitForEntry(entry("a", "last")));
}

TEST_F(DaemonTreeTest, DroppingTheRegistrationEndsIt) {
  upScanned();
  auto observed = observe();
  EXPECT_EQ(drive_->journal->count(), 1U);
  observed.registration = nullptr;
  EXPECT_TRUE(waitForObservers(0));
}

TEST_F(DaemonTreeTest, AnObserverThatDiesOrFailsACallLeavesNothingBehind) {
  upScanned();
  NSErrorRef error;
  auto connection = ipc::Connection::connect(paths_.daemonSocket, &error);
  ASSERT_TRUE(connection) << error->description();
  auto daemon = connection->bootstrap<Wire>();
  auto dying = observeOver(daemon, Mount::Answers::Never);
  auto failing = observe(Mount::Answers::WithFailure);
  ASSERT_TRUE(dying.told->waitForStart());
  ASSERT_TRUE(failing.told->waitForStart());
  EXPECT_TRUE(waitForObservers(1));
  write("x");
  connection->close();
  EXPECT_TRUE(waitForObservers(0));
  EXPECT_THAT(dying.told->told().calls, ElementsAre("start"));
}

}  // namespace
}  // namespace yomber::test
