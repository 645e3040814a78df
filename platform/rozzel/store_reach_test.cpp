#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "platform/rozzel/test_store.h"

namespace yomber {
namespace {

bool isOutOfReach(const NSErrorRef& error) { return rz_isError(error, RZErrorNetworkUnavailable); }

TEST(StoreReachTest, AnswersEveryCallThatItIsOutOfReach) {
  TestStore store;
  auto& engine = *store.engine();
  const auto id = store.database()->databaseID();
  const RZAsset asset = storeText(engine, "content");
  newFile(store.folder() + "/offline");
  std::vector<RZRecordZone> zones;
  std::vector<RZFetchedRecord> records;
  std::vector<RZRecordRef> saved;
  std::vector<RZZoneMember> members;
  RZChangePage changes;
  RZQueryPage page;
  RZQuota quota;
  RZGarbageReport report;
  FileDescriptor descriptor;
  std::string bytes;
  NSErrorRef groupError;
  EXPECT_TRUE(isOutOfReach(engine.checkReachability()));
  EXPECT_TRUE(isOutOfReach(engine.createZone(id, kZone)));
  EXPECT_TRUE(isOutOfReach(engine.deleteZone(id, kZone)));
  EXPECT_TRUE(isOutOfReach(engine.fetchZones(id, zones)));
  EXPECT_TRUE(isOutOfReach(engine.fetchRecords(id, {}, {}, records)));
  EXPECT_TRUE(isOutOfReach(engine.modifyRecords(id, {}, saved)));
  EXPECT_TRUE(isOutOfReach(engine.fetchChanges(id, kZone, {}, 1, {}, changes)));
  EXPECT_TRUE(isOutOfReach(engine.queryRecords(id, {.zoneID = kZone}, {}, 1, page)));
  EXPECT_TRUE(isOutOfReach(engine.addMember(id, kZone, {.accountName = "bob"})));
  EXPECT_TRUE(isOutOfReach(engine.removeMember(id, kZone, "bob")));
  EXPECT_TRUE(isOutOfReach(engine.fetchMembers(id, kZone, members)));
  EXPECT_TRUE(isOutOfReach(engine.setQuota("ann", 1)));
  EXPECT_TRUE(isOutOfReach(engine.fetchQuota("ann", quota)));
  EXPECT_EQ(engine.newAssetGroup(&groupError), nullptr);
  EXPECT_TRUE(isOutOfReach(groupError));
  EXPECT_TRUE(isOutOfReach(engine.openAsset(asset, descriptor)));
  EXPECT_TRUE(isOutOfReach(engine.copyAsset(asset, -1, {})));
  EXPECT_TRUE(isOutOfReach(engine.readAsset(asset, 100, bytes)));
  EXPECT_TRUE(isOutOfReach(engine.verifyAsset(asset, {})));
  EXPECT_TRUE(isOutOfReach(engine.collectGarbage(report)));
}

TEST(StoreReachTest, IsBackAsSoonAsTheSwitchIs) {
  TestStore store;
  const std::string offline = store.folder() + "/offline";
  newFile(offline);
  EXPECT_TRUE(isOutOfReach(store.engine()->checkReachability()));
  ASSERT_EQ(unlink(offline.c_str()), 0);
  EXPECT_EQ(store.engine()->checkReachability(), nullptr);
  EXPECT_EQ(save(store.database(), {newRecord("a")}), nullptr);
}

TEST(StoreReachTest, StopsAGroupThatIsUnderWay) {
  TestStore store;
  NSErrorRef error;
  const auto group = store.engine()->newAssetGroup(&error);
  const auto writer = group->newWriter(&error);
  RZAsset asset;
  ASSERT_EQ(writer->finish(asset), nullptr);
  newFile(store.folder() + "/offline");
  EXPECT_EQ(group->newWriter(&error), nullptr);
  EXPECT_TRUE(isOutOfReach(error));
  EXPECT_TRUE(isOutOfReach(group->commit()));
}

TEST(StoreReachTest, ComesBackWithItsFolder) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  const std::string elsewhere = store.folder() + "-elsewhere";
  std::filesystem::rename(store.folder(), elsewhere);
  EXPECT_TRUE(isOutOfReach(store.engine()->checkReachability()));
  EXPECT_TRUE(isOutOfReach(save(store.database(), {newRecord("b")})));
  EXPECT_FALSE(std::filesystem::exists(store.folder()));
  std::filesystem::rename(elsewhere, store.folder());
  EXPECT_NE(fetch(store.database(), "a"), nullptr);
  EXPECT_EQ(save(store.database(), {newRecord("b")}), nullptr);
}

TEST(StoreReachTest, SeesWhenAnotherStoreHasComeInstead) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  storeText(*store.engine(), "content");
  std::filesystem::rename(store.folder(), store.folder() + "-elsewhere");
  ASSERT_EQ(EmbeddedEngine::create(store.folder()), nullptr);
  EXPECT_EQ(fetch(store.database(), "a"), nullptr);
  ASSERT_EQ(store.database()->createZone(kZone), nullptr);
  EXPECT_EQ(save(store.database(), {newRecord("b")}), nullptr);
  const RZAsset asset = storeText(*store.engine(), "content");
  EXPECT_EQ(access(store.pathOf(asset).c_str(), F_OK), 0);
}

TEST(StoreReachTest, IsOutOfReachForWhoMayNotReadIt) {
  TestStore store;
  store.close();
  const int status = inAnotherProcess([&] {
    if (geteuid() == 0 ? seteuid(65534) : chmod(store.folder().c_str(), 0)) return 2;
    const EmbeddedEngineOptions options;
    EmbeddedEngine engine(store.folder(), options);
    return isOutOfReach(engine.checkReachability()) ? 0 : 1;
  });
  EXPECT_EQ(status, 0);
}

TEST(StoreReachTest, NeverMakesAStoreByItself) {
  TemporaryDirectory directory;
  EmbeddedEngine engine(directory / "store");
  EXPECT_TRUE(isOutOfReach(engine.createZone({"c", "ann", RZDatabaseScope::Private}, kZone)));
  EXPECT_FALSE(std::filesystem::exists(directory / "store"));
}

TEST(StoreReachTest, CreatesAStoreOnlyWhereThereIsNone) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  EXPECT_EQ(EmbeddedEngine::create(store.folder()), nullptr);
  EXPECT_NE(fetch(store.database(), "a"), nullptr);
  EXPECT_NE(EmbeddedEngine::create(store.folder() + "/no/such/parent"), nullptr);
}

/// Saves records with content until that fails; answers how many there are.
int saveUntilFailure(const TestStore& store, NSErrorRef& error) {
  for (int index = 0;; ++index) {
    const std::string content(200'000, static_cast<char>('a' + index % 26));
    RZAsset asset;
    const std::string text = std::to_string(index) + content;
    if ((error = store.engine()->storeAsset(std::as_bytes(std::span(text)), asset))) return index;
    const auto record = newRecord(std::to_string(index), {{"content", asset}, {"text", content}});
    if ((error = save(store.database(), {record}))) return index;
  }
}

bool areWhole(const TestStore& store, int count) {
  for (int index = 0; index < count; ++index) {
    const auto record = fetch(store.database(), std::to_string(index));
    if (!record) return false;
    if (store.engine()->verifyAsset(*record->valueForKey<RZAsset>("content"), {})) return false;
  }
  return true;
}

constexpr int kNotAllowed = 77;

/// A file system of 12 MB of its own, which is gone with this process.
bool mountSmallDisk(const std::string& path) {
  return unshare(CLONE_NEWNS) == 0 &&
         mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
         mkdir(path.c_str(), 0700) == 0 &&
         mount("tmpfs", path.c_str(), "tmpfs", 0, "size=12m") == 0;
}

class StoreOnSmallDisk {
 public:
  static int run(const std::string& disk) {
    if (!mountSmallDisk(disk)) return kNotAllowed;
    const std::string folder = disk + "/store";
    if (EmbeddedEngine::create(folder)) return 1;
    const RZContainer container(std::make_shared<EmbeddedEngine>(folder), "c", "ann");
    return fillAndGoOn(container.privateCloudDatabase(), disk);
  }

 private:
  static int fillAndGoOn(const RZDatabaseRef& database, const std::string& disk) {
    if (database->createZone(kZone)) return 2;
    const std::string filler = disk + "/filler";
    const FileDescriptor file = newFile(filler);
    if (ftruncate(file.get(), 0) != 0 || posix_fallocate(file.get(), 0, 6 << 20) != 0) return 3;
    int count = 0;
    NSErrorRef error;
    while (!error) error = saveOne(database, count++);
    if (!rz_isError(error, RZErrorStoreFull) || count < 2) return 4;
    if (!allThere(database, count - 1)) return 5;
    // Room again: it goes on where it stood.
    if (unlink(filler.c_str()) != 0 || ftruncate(file.get(), 0) != 0) return 6;
    if (saveOne(database, count - 1) || !allThere(database, count)) return 7;
    return 0;
  }
  static NSErrorRef saveOne(const RZDatabaseRef& database, int index) {
    const std::string text = std::to_string(index) + std::string(300'000, 'x');
    RZAsset asset;
    if (NSErrorRef error = database->engine()->storeAsset(std::as_bytes(std::span(text)), asset)) {
      return error;
    }
    return save(database, {newRecord(std::to_string(index), {{"content", asset}, {"text", text}})},
                RZRecordSavePolicy::AllKeys);
  }
  static bool allThere(const RZDatabaseRef& database, int count) {
    for (int index = 0; index < count; ++index) {
      const auto record = fetch(database, std::to_string(index));
      if (!record) return false;
      const auto* const asset = record->valueForKey<RZAsset>("content");
      if (asset == nullptr || database->engine()->verifyAsset(*asset, {})) return false;
    }
    return true;
  }
};

TEST(StoreFullTest, LosesNothingOnADiskThatIsFullAndGoesOnWhenThereIsRoom) {
  TemporaryDirectory directory;
  const int status = inAnotherProcess([&] { return StoreOnSmallDisk::run(directory / "disk"); });
  if (status == kNotAllowed) GTEST_SKIP() << "no right to mount a small disk here";
  EXPECT_EQ(status, 0);
}

TEST(StoreFullTest, TakesALimitOnFileSizesAsAFullDisk) {
  TestStore store;
  store.close();
  const int status = inAnotherProcess([&] {
    signal(SIGXFSZ, SIG_IGN);
    const rlimit limit{.rlim_cur = 1'000'000, .rlim_max = RLIM_INFINITY};
    if (setrlimit(RLIMIT_FSIZE, &limit) != 0) return 2;
    store.reopen();
    NSErrorRef error;
    const int count = saveUntilFailure(store, error);
    if (count < 1 || !rz_isError(error, RZErrorStoreFull)) return 3;
    if (!areWhole(store, count)) return 4;
    const rlimit lifted{.rlim_cur = RLIM_INFINITY, .rlim_max = RLIM_INFINITY};
    if (setrlimit(RLIMIT_FSIZE, &lifted) != 0) return 5;
    if (save(store.database(), {newRecord("after", {{"text", std::string(900'000, 'x')}})}))
      return 6;
    return areWhole(store, count) ? 0 : 7;
  });
  EXPECT_EQ(status, 0);
}

}  // namespace
}  // namespace yomber
