// Two whole drives, as their processes hold them, on one store.
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <cstdlib>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/ostrell/constants.h"
#include "zarn/content/shares.h"
#include "zarn/drive.h"
#include "zarn/test_waiting.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

class OneDrive {
 public:
  OneDrive(const std::string& home, const std::string& store, const std::string& account) {
    DrivePaths paths = DrivePaths::forHome(home);
    EXPECT_EQ(paths.joinStore(store), nullptr);
    EXPECT_EQ(paths.create(), nullptr);
    NSErrorRef error;
    Drive::Options options;
    options.applications.clear();
    drive = Drive::open(paths, options, &error);
    EXPECT_NE(drive, nullptr) << error->description();
    drive->start();
    EXPECT_TRUE(waitUntil([&] { return drive->firstScan->isOpen(); }));
    EXPECT_EQ(drive->account->signIn(account), nullptr);
  }
  ~OneDrive() { drive->stop(); }
  OneDrive(const OneDrive&) = delete;
  OneDrive& operator=(const OneDrive&) = delete;

  [[nodiscard]] std::string at(const std::string& path) const {
    return drive->layout.root() + "/" + path;
  }
  void write(const std::string& path, const std::string& text) const {
    std::ofstream(at(path), std::ios::binary) << text;
  }
  [[nodiscard]] bool has(const std::string& path) const { return fs::exists(at(path)); }
  [[nodiscard]] Shares& shares() const { return *drive->engine->shares(); }
  /// What whoever opens it gets; nothing when it cannot be read (yet).
  [[nodiscard]] std::optional<std::string> read(const std::string& path) const {
    Mutex mutex;
    Condition changed;
    bool isAnswered = false;
    NSErrorRef failure;
    const auto wish = drive->engine->startProviding(at(path), 0, [&](NSErrorRef error) {
      LockGuard guard(mutex);
      failure = std::move(error);
      isAnswered = true;
      changed.notifyAll();
    });
    {
      LockGuard guard(mutex);
      while (!isAnswered) changed.wait(mutex);
    }
    if (failure) return std::nullopt;
    std::ifstream file(at(path), std::ios::binary);
    return std::string{std::istreambuf_iterator<char>(file), {}};
  }

  std::shared_ptr<Drive> drive;
};

class SharingDrivesTest : public testing::Test {
 protected:
  SharingDrivesTest() {
    setenv("XDG_RUNTIME_DIR", (directory_.path() + "/run").c_str(), 1);
    fs::create_directory(directory_.path() + "/run");
    fs::permissions(directory_.path() + "/run", fs::perms::owner_all);
    ann = std::make_unique<OneDrive>(directory_.path() + "/ann", directory_ / "store", "ann");
    bob = std::make_unique<OneDrive>(directory_.path() + "/bob", directory_ / "store", "bob");
  }
  ~SharingDrivesTest() override {
    ann.reset();
    bob.reset();
  }

  RZShareRef share(const std::string& path, RZShareParticipantPermission permission) const {
    EXPECT_NE(ann->drive->scanner->scanLocation(ann->at(path)), std::nullopt);
    RZShareRef fresh;
    EXPECT_EQ(ann->shares().newShare(ann->at(path), fresh), nullptr);
    RZShare changed = *fresh;
    auto people = changed.participants();
    people.push_back({.userName = "bob", .permission = permission});
    changed.setParticipants(people);
    RZShareRef saved;
    EXPECT_EQ(ann->shares().save(changed, saved), nullptr);
    return saved;
  }

 private:
  TemporaryDirectory directory_;

 protected:
  std::unique_ptr<OneDrive> ann;
  std::unique_ptr<OneDrive> bob;
};

TEST_F(SharingDrivesTest, AFolderIsSharedReadWrittenAndSharedNoLonger) {
  const std::string text = std::string(10'000, 'x') + "end";
  fs::create_directory(ann->at("Plans"));
  ann->write("Plans/a.txt", text);
  const auto saved = share("Plans", RZShareParticipantPermission::ReadWrite);
  ASSERT_NE(saved, nullptr);
  std::string identifier;
  ASSERT_EQ(bob->shares().accept(*saved->URL(), identifier), nullptr);
  const auto row = ann->drive->store->itemAtPath(ann->at("Plans"));
  ASSERT_TRUE(row);
  EXPECT_EQ(identifier, itemIdentifier(row->id, row->kind));
  ASSERT_TRUE(waitUntil([&] { return bob->has("Plans/a.txt"); }));
  EXPECT_EQ(bob->read("Plans/a.txt"), text);
  bob->write("Plans/b.txt", "by bob");
  ASSERT_TRUE(waitUntil([&] { return ann->has("Plans/b.txt"); }));
  EXPECT_EQ(ann->read("Plans/b.txt"), "by bob");
  ann->write("Plans/a.txt", "by ann");
  // Not by reading: what somebody has open is not replaced.
  ASSERT_TRUE(waitUntil([&] { return fs::file_size(bob->at("Plans/a.txt")) < text.size(); }));
  EXPECT_EQ(bob->read("Plans/a.txt"), "by ann");
  ASSERT_EQ(::rename(ann->at("Plans/a.txt").c_str(), ann->at("Plans/c.txt").c_str()), 0);
  ASSERT_TRUE(waitUntil([&] { return bob->has("Plans/c.txt") && !bob->has("Plans/a.txt"); }));
  Shares::Copied copied;
  ASSERT_EQ(ann->shares().copyShare(ann->at("Plans"), copied), nullptr);
  ASSERT_EQ(ann->shares().destroy(*copied.share), nullptr);
  ASSERT_TRUE(waitUntil([&] { return !bob->has("Plans"); }));
  EXPECT_EQ(ann->read("Plans/c.txt"), "by ann");
}

TEST_F(SharingDrivesTest, WhatAnEditorDeletesIsInItsOwnersTrash) {
  const std::string text = std::string(10'000, 'x') + "end";
  fs::create_directory(ann->at("Plans"));
  ann->write("Plans/a.txt", text);
  const auto saved = share("Plans", RZShareParticipantPermission::ReadWrite);
  std::string identifier;
  ASSERT_EQ(bob->shares().accept(*saved->URL(), identifier), nullptr);
  ASSERT_TRUE(waitUntil([&] { return bob->has("Plans/a.txt"); }));
  fs::remove(bob->at("Plans/a.txt"));
  ASSERT_TRUE(waitUntil([&] { return !ann->has("Plans/a.txt"); }));
  const std::string trashed = ann->drive->layout.trashFiles() + "/a.txt";
  ASSERT_TRUE(waitUntil([&] { return fs::exists(trashed); }));
  EXPECT_FALSE(fs::exists(bob->drive->layout.trashFiles() + "/a.txt")) << "it is Ann's";
  const auto location = ann->drive->trash->putBackLocation(trashed, nullptr);
  EXPECT_EQ(location, ann->at("Plans/a.txt"));
  ASSERT_EQ(::rename(trashed.c_str(), ann->at("Plans/a.txt").c_str()), 0);
  EXPECT_EQ(ann->read("Plans/a.txt"), text);
  ASSERT_TRUE(waitUntil([&] { return bob->read("Plans/a.txt") == text; })) << "shared again";
}

/// Ann puts back what Bob has removed while her drive is still taking his removal over.
class PutBackMeanwhileTest : public SharingDrivesTest {
 protected:
  ~PutBackMeanwhileTest() override {
    go("zarn.pull.placed");
    FaultPoint::disarmAll();
  }

  void shareDocument() {
    fs::create_directory(ann->at("Plans"));
    ann->write("Plans/a.txt", text);
    const auto saved = share("Plans", RZShareParticipantPermission::ReadWrite);
    std::string identifier;
    ASSERT_EQ(bob->shares().accept(*saved->URL(), identifier), nullptr);
    ASSERT_TRUE(waitUntil([&] { return bob->has("Plans/a.txt"); }));
    // Or else they would stop at what they have still to hear of.
    const std::string all(NSFileProviderRootContainerItemIdentifier);
    for (const auto& each : {ann.get(), bob.get()}) {
      ASSERT_TRUE(each->drive->engine->waitUntilIdle(std::chrono::seconds(60)));
      ASSERT_EQ(each->shares().refresh(all), nullptr);
    }
  }
  void putBack() {
    const std::string trashed = ann->drive->layout.trashFiles() + "/a.txt";
    ASSERT_TRUE(waitUntil([&] { return fs::exists(trashed); }));
    ASSERT_EQ(::rename(trashed.c_str(), ann->at("Plans/a.txt").c_str()), 0);
  }
  void stopAt(const std::string& point) const {
    ASSERT_EQ(FaultPoint::arm(point + "=pause-until-file:" + gate(point)), nullptr);
  }
  void go(const std::string& point) const { std::ofstream(gate(point)).put('x'); }
  [[nodiscard]] bool isSharedAgain() const {
    return waitUntil([&] { return bob->read("Plans/a.txt") == text; });
  }

  const std::string text = std::string(10'000, 'x') + "end";

 private:
  [[nodiscard]] std::string gate(const std::string& point) const {
    return ann->drive->layout.home() + "/go-" + point;
  }
};

TEST_F(PutBackMeanwhileTest, ItIsSharedAgainWhenItsUploadCameFirst) {
  shareDocument();
  stopAt("zarn.pull.placed");
  fs::remove(bob->at("Plans/a.txt"));
  putBack();
  ASSERT_TRUE(waitUntil([&] {
    const auto row = ann->drive->store->itemAtPath(ann->at("Plans/a.txt"));
    return row && ann->drive->engine->waitUntilIdle(std::chrono::milliseconds(0));
  }));
  go("zarn.pull.placed");
  EXPECT_TRUE(isSharedAgain());
}

TEST_F(SharingDrivesTest, WhatAnEditorMovesOutAndBackIsWithItsOwnerAgain) {
  const std::string text = std::string(10'000, 'x') + "end";
  fs::create_directory(ann->at("Plans"));
  ann->write("Plans/a.txt", text);
  const auto saved = share("Plans", RZShareParticipantPermission::ReadWrite);
  std::string identifier;
  ASSERT_EQ(bob->shares().accept(*saved->URL(), identifier), nullptr);
  ASSERT_TRUE(waitUntil([&] { return bob->has("Plans/a.txt"); }));
  EXPECT_EQ(bob->read("Plans/a.txt"), text);
  ASSERT_EQ(::rename(bob->at("Plans/a.txt").c_str(), bob->at("a.txt").c_str()), 0);
  const std::string trashed = ann->drive->layout.trashFiles() + "/a.txt";
  ASSERT_TRUE(waitUntil([&] { return fs::exists(trashed); }));
  ASSERT_EQ(::rename(bob->at("a.txt").c_str(), bob->at("Plans/b.txt").c_str()), 0);
  ASSERT_TRUE(waitUntil([&] { return ann->has("Plans/b.txt"); }));
  EXPECT_EQ(ann->read("Plans/b.txt"), text);
  EXPECT_FALSE(fs::exists(trashed)) << "it is the same document";
  EXPECT_TRUE(bob->has("Plans/b.txt"));
}

TEST_F(SharingDrivesTest, AViewerIsRefusedAtEveryDoor) {
  fs::create_directory(ann->at("Plans"));
  ann->write("Plans/a.txt", "text");
  const auto saved = share("Plans", RZShareParticipantPermission::ReadOnly);
  std::string identifier;
  ASSERT_EQ(bob->shares().accept(*saved->URL(), identifier), nullptr);
  ASSERT_TRUE(waitUntil([&] { return bob->has("Plans/a.txt"); }));
  bob->write("own.txt", "own");
  NSErrorRef error;
  const auto isRefused = [&] {
    constexpr std::int64_t kNotAllowed = 513;
    return error && error->is(NSCocoaErrorDomain, kNotAllowed);
  };
  EXPECT_FALSE(bob->drive->trash->trash(bob->at("Plans/a.txt"), [] { return false; }, &error));
  EXPECT_TRUE(isRefused());
  for (const auto& [from, to] :
       std::vector<std::pair<std::string, std::string>>{{"Plans/a.txt", "Plans/b.txt"},
                                                        {"Plans/a.txt", "a.txt"},
                                                        {"own.txt", "Plans/own.txt"}}) {
    error = nullptr;
    (void)bob->drive->moves->capability(bob->at(from), bob->at(to), &error);
    EXPECT_TRUE(isRefused()) << from << " to " << to;
  }
  error = nullptr;
  (void)bob->drive->moves->capability(bob->at("Plans"), bob->at("Renamed"), &error);
  EXPECT_EQ(error, nullptr) << "its own place is Bob's business";
}

}  // namespace
}  // namespace yomber
