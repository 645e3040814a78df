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
    options.content.uploadPause = std::chrono::milliseconds::zero();
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
  /// Ann's folder with a document, which Bob has accepted and may change.
  void shareDocument() {
    fs::create_directory(ann->at("Plans"));
    ann->write("Plans/a.txt", text);
    const auto saved = share("Plans", RZShareParticipantPermission::ReadWrite);
    ASSERT_NE(saved, nullptr);
    ASSERT_EQ(bob->shares().accept(*saved->URL(), accepted), nullptr);
    ASSERT_TRUE(waitUntil([&] { return bob->has("Plans/a.txt"); }));
  }

  const std::string text = std::string(10'000, 'x') + "end";
  std::string accepted;  ///< the folder's identifier at Bob's

 private:
  TemporaryDirectory directory_;

 protected:
  std::unique_ptr<OneDrive> ann;
  std::unique_ptr<OneDrive> bob;
};

TEST_F(SharingDrivesTest, AFolderIsSharedReadWrittenAndSharedNoLonger) {
  shareDocument();
  const auto row = ann->drive->store->itemAtPath(ann->at("Plans"));
  ASSERT_TRUE(row);
  EXPECT_EQ(accepted, itemIdentifier(row->id, row->kind));
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
  shareDocument();
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

TEST_F(SharingDrivesTest, WhatIsPutBackAndSeenToBeforeItsRemovalIsTakenOverIsSharedAgain) {
  shareDocument();
  // Or else they would stop at what they have still to hear of.
  const std::string all(NSFileProviderRootContainerItemIdentifier);
  for (const auto& each : {ann.get(), bob.get()}) {
    ASSERT_TRUE(each->drive->engine->waitUntilIdle(std::chrono::seconds(60)));
    ASSERT_EQ(each->shares().refresh(all), nullptr);
  }
  const std::string gate = ann->drive->layout.home() + "/go";
  ASSERT_EQ(FaultPoint::arm("zarn.pull.placed=pause-until-file:" + gate), nullptr);
  fs::remove(bob->at("Plans/a.txt"));
  const std::string trashed = ann->drive->layout.trashFiles() + "/a.txt";
  EXPECT_TRUE(waitUntil([&] { return fs::exists(trashed); }));
  EXPECT_EQ(::rename(trashed.c_str(), ann->at("Plans/a.txt").c_str()), 0);
  EXPECT_TRUE(waitUntil([&] {
    const auto row = ann->drive->store->itemAtPath(ann->at("Plans/a.txt"));
    return row && ann->drive->engine->waitUntilIdle(std::chrono::milliseconds(0));
  }));
  std::ofstream(gate).put('x');
  EXPECT_TRUE(waitUntil([&] { return bob->read("Plans/a.txt") == text; }));
  FaultPoint::disarmAll();
}

}  // namespace
}  // namespace yomber
