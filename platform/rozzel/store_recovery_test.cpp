#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/rozzel/test_store.h"

namespace yomber {
namespace {

std::string contentFor(int index) {
  return "content " + std::to_string(index) +
         std::string(static_cast<std::size_t>(index) * 97, '.');
}

NSErrorRef storeContent(RZEngine& engine, int index, RZAsset& asset) {
  const std::string content = contentFor(index);
  return engine.storeAsset(std::as_bytes(std::span(content)), asset);
}

/// Stores content `index` and saves a record of it, named after it.
NSErrorRef saveWithContent(const RZDatabaseRef& database, int index) {
  RZAsset asset;
  if (NSErrorRef error = storeContent(*database->engine(), index, asset)) return error;
  return save(database, {newRecord(std::to_string(index), {{"content", asset}, {"index", index}})});
}

/// Whether the record is there, with content that is whole and its own.
testing::AssertionResult isWhole(const TestStore& store, int index) {
  const auto record = fetch(store.database(), std::to_string(index));
  if (!record) return testing::AssertionFailure() << "no record " << index;
  const auto* const asset = record->valueForKey<RZAsset>("content");
  if (asset == nullptr) return testing::AssertionFailure() << "no asset in record " << index;
  std::string bytes;
  if (const NSErrorRef error = store.engine()->readAsset(*asset, 1 << 20, bytes)) {
    return testing::AssertionFailure() << error->description();
  }
  if (bytes != contentFor(index)) return testing::AssertionFailure() << "other content";
  return testing::AssertionSuccess();
}

/// Only the staging folders of living engines may be left after garbage was collected.
std::size_t stagingFolders(const TestStore& store) {
  std::size_t count = 0;
  for (const auto& entry : std::filesystem::directory_iterator(store.folder() + "/staging")) {
    count += entry.is_directory() ? 1 : 0;
  }
  return count;
}

/// A crash of a process at one step of storing an asset and saving its record.
class StoreCrashTest : public testing::TestWithParam<const char*> {};

TEST_P(StoreCrashTest, LeavesTheStoreWhole) {
  TestStore store;
  ASSERT_EQ(saveWithContent(store.database(), 1), nullptr);
  store.close();
  const int status = inAnotherProcess([&] {
    store.reopen();
    if (FaultPoint::arm(std::string(GetParam()) + "=abort")) return 2;
    const auto record = fetch(store.database(), "1");
    if (!record) return 3;
    // A batch of both: the new record, and the old one changed.
    RZAsset asset;
    if (storeContent(*store.engine(), 2, asset)) return 4;
    auto changed = std::make_shared<RZRecord>(*record);
    changed->setObject(100, "index");
    if (save(store.database(), {newRecord("2", {{"content", asset}}), changed})) return 5;
    return 0;
  });
  ASSERT_EQ(status, 128 + SIGABRT);
  store.reopen();
  EXPECT_TRUE(isWhole(store, 1));
  const bool saved = fetch(store.database(), "2") != nullptr;
  EXPECT_EQ(saved, std::string(GetParam()) == "rozzel.batch.committed");
  const auto index = *fetch(store.database(), "1")->valueForKey<std::int64_t>("index");
  EXPECT_EQ(index, saved ? 100 : 1);
  // The same work goes through now, and nothing of the dead process is left.
  if (!saved) {
    EXPECT_EQ(saveWithContent(store.database(), 2), nullptr);
  }
  EXPECT_TRUE(isWhole(store, 2));
  RZGarbageReport report;
  ASSERT_EQ(store.engine()->collectGarbage(report), nullptr);
  EXPECT_EQ(stagingFolders(store), 1U);
  EXPECT_TRUE(isWhole(store, 1));
}

/// The same steps failing, as on a full disk.
TEST_P(StoreCrashTest, SurvivesAFailureThere) {
  TestStore store;
  ASSERT_EQ(saveWithContent(store.database(), 1), nullptr);
  ASSERT_EQ(FaultPoint::arm(std::string(GetParam()) + "=error"), nullptr);
  const NSErrorRef error = saveWithContent(store.database(), 2);
  FaultPoint::disarmAll();
  EXPECT_TRUE(rz_isError(error, RZErrorStoreFull));
  EXPECT_TRUE(isWhole(store, 1));
  const bool saved = std::string(GetParam()) == "rozzel.batch.committed";
  EXPECT_EQ(fetch(store.database(), "2") != nullptr, saved);
  if (!saved) {
    EXPECT_EQ(saveWithContent(store.database(), 2), nullptr);
  }
  EXPECT_TRUE(isWhole(store, 2));
}

INSTANTIATE_TEST_SUITE_P(Steps, StoreCrashTest,
                         testing::Values("rozzel.asset.staged", "rozzel.asset.written",
                                         "rozzel.asset.synced", "rozzel.asset.published",
                                         "rozzel.asset.durable", "rozzel.batch.begun",
                                         "rozzel.batch.written", "rozzel.batch.committed"),
                         [](const auto& param) {
                           std::string name(param.param);
                           std::replace(name.begin(), name.end(), '.', '_');
                           return name;
                         });

TEST(StoreKillTest, LosesNothingConfirmedHoweverOftenItIsKilled) {
  TestStore store;
  store.close();
  int next = 0;
  int killedAtWork = 0;
  for (int round = 0; round < 25; ++round) {
    int ends[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends), 0);
    const pid_t child = startProcess([&] {
      store.reopen();
      for (int index = next;; ++index) {
        if (saveWithContent(store.database(), index)) return 1;
        if (::write(ends[1], &index, sizeof index) != sizeof index) return 2;
      }
    });
    ::close(ends[1]);
    int confirmed = next - 1;
    for (int count = 0; count <= round % 7; ++count) {
      ASSERT_EQ(::read(ends[0], &confirmed, sizeof confirmed),
                static_cast<ssize_t>(sizeof confirmed));
    }
    kill(child, SIGKILL);
    killedAtWork += waitForProcess(child) == 128 + SIGKILL ? 1 : 0;
    while (::read(ends[0], &confirmed, sizeof confirmed) > 0) {
    }
    ::close(ends[0]);
    store.reopen();
    for (int index = next; index <= confirmed; ++index) ASSERT_TRUE(isWhole(store, index));
    // The one under way when it was killed is there as a whole or not at all.
    next = confirmed + 1;
    if (fetch(store.database(), std::to_string(next))) {
      ASSERT_TRUE(isWhole(store, next));
      ++next;
    }
    ASSERT_EQ(fetch(store.database(), std::to_string(next)), nullptr);
    store.close();
  }
  EXPECT_EQ(killedAtWork, 25);
  store.reopen();
  RZGarbageReport report;
  ASSERT_EQ(store.engine()->collectGarbage(report), nullptr);
  EXPECT_EQ(stagingFolders(store), 1U);
  for (int index = 0; index < next; ++index) EXPECT_TRUE(isWhole(store, index));
}

TEST(StoreKillTest, LosesNothingWhenKilledWhileDroppingAssets) {
  const EmbeddedEngineOptions impatient{.assetGraceSeconds = -3600};
  TestStore store(impatient);
  ASSERT_EQ(saveWithContent(store.database(), 1), nullptr);
  const RZAsset unused = storeText(*store.engine(), "unused");
  ASSERT_EQ(saveWithContent(store.database(), 2), nullptr);
  ASSERT_EQ(remove(store.database(), recordID("2")), nullptr);
  store.close();
  const int status = inAnotherProcess([&] {
    store.reopen();
    if (FaultPoint::arm("rozzel.garbage.moved=abort")) return 2;
    RZGarbageReport report;
    return store.engine()->collectGarbage(report) ? 3 : 0;
  });
  ASSERT_EQ(status, 128 + SIGABRT);
  store.reopen();
  EXPECT_TRUE(isWhole(store, 1));
  RZGarbageReport report;
  ASSERT_EQ(store.engine()->collectGarbage(report), nullptr);
  EXPECT_EQ(access(store.pathOf(unused).c_str(), F_OK), -1);
  EXPECT_EQ(saveWithContent(store.database(), 2), nullptr);
  EXPECT_TRUE(isWhole(store, 1));
  EXPECT_TRUE(isWhole(store, 2));
}

TEST(StoreKillTest, LeavesTheStagedFilesOfLivingProcessesAlone) {
  TestStore store;
  NSErrorRef error;
  const auto group = store.engine()->newAssetGroup(&error);
  const auto writer = group->newWriter(&error);
  ASSERT_EQ(writer->write(std::as_bytes(std::span("content", 7))), nullptr);
  EmbeddedEngine other(store.folder());
  RZGarbageReport report;
  ASSERT_EQ(other.collectGarbage(report), nullptr);
  RZAsset asset;
  ASSERT_EQ(writer->finish(asset), nullptr);
  ASSERT_EQ(group->commit(), nullptr);
  EXPECT_EQ(other.verifyAsset(asset, {}), nullptr);
}

/// Adds one to a counter in the store, again whenever another was faster.
bool countUp(const RZDatabaseRef& database, int times) {
  for (int done = 0; done < times;) {
    const auto record = fetch(database, "counter");
    if (!record) return false;
    const auto copy = std::make_shared<RZRecord>(*record);
    copy->setObject(*record->valueForKey<std::int64_t>("count") + 1, "count");
    const NSErrorRef error = save(database, {copy});
    if (!error) ++done;
    if (error && !rz_isError(error, RZErrorServerRecordChanged)) return false;
  }
  return true;
}

std::int64_t counterOf(const TestStore& store) {
  return *fetch(store.database(), "counter")->valueForKey<std::int64_t>("count");
}

TEST(StoreConcurrencyTest, LosesNoUpdateBetweenThreads) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("counter", {{"count", 0}})}), nullptr);
  std::vector<std::thread> threads;
  for (int index = 0; index < 4; ++index) {
    threads.emplace_back([&] { EXPECT_TRUE(countUp(store.database(), 20)); });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(counterOf(store), 80);
}

TEST(StoreConcurrencyTest, LosesNoUpdateBetweenProcesses) {
  TestStore store;
  ASSERT_EQ(save(store.database(), {newRecord("counter", {{"count", 0}})}), nullptr);
  store.close();
  std::vector<pid_t> children;
  for (int index = 0; index < 2; ++index) {
    children.push_back(startProcess([&] {
      store.reopen();
      return countUp(store.database(), 20) ? 0 : 1;
    }));
  }
  store.reopen();
  EXPECT_TRUE(countUp(store.database(), 20));
  for (const pid_t child : children) EXPECT_EQ(waitForProcess(child), 0);
  EXPECT_EQ(counterOf(store), 60);
}

TEST(StoreConcurrencyTest, TellsAReaderEveryChangeThatAnotherProcessMakes) {
  TestStore store;
  store.close();
  const pid_t child = startProcess([&] {
    store.reopen();
    for (int index = 0; index < 40; ++index) {
      if (saveWithContent(store.database(), index)) return 1;
    }
    return 0;
  });
  store.reopen();
  std::vector<std::string> names;
  RZChangePage page;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
  while (names.size() < 40 && std::chrono::steady_clock::now() < deadline) {
    ASSERT_EQ(store.database()->fetchChanges(kZone, page.token, 7, {}, page), nullptr);
    for (const auto& change : page.changes) {
      names.push_back(change.recordID.recordName());
      EXPECT_TRUE(isWhole(store, std::stoi(names.back())));
    }
  }
  EXPECT_EQ(waitForProcess(child), 0);
  ASSERT_EQ(names.size(), 40U);
  for (int index = 0; index < 40; ++index)
    EXPECT_EQ(names[static_cast<std::size_t>(index)], std::to_string(index));
}

TEST(StoreConcurrencyTest, GivesUpWhenAnotherKeepsTheStoreLocked) {
  TestStore store({.busyMilliseconds = 1});
  TemporaryDirectory directory;
  const std::string go = directory / "go";
  store.close();
  const pid_t child = startProcess([&] {
    store.reopen();
    if (FaultPoint::arm("rozzel.batch.written=pause-until-file:" + go)) return 2;
    return saveWithContent(store.database(), 1) ? 3 : 0;
  });
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (access((go + ".reached").c_str(), F_OK) != 0) {
    ASSERT_LT(std::chrono::steady_clock::now(), deadline);
    std::this_thread::yield();
  }
  store.reopen();
  const NSErrorRef error = save(store.database(), {newRecord("a")});
  EXPECT_TRUE(rz_isError(error, RZErrorStoreBusy));
  EXPECT_TRUE(rz_isTransient(error));
  // Readers are not hindered, and see nothing of what is under way.
  EXPECT_EQ(fetch(store.database(), "1"), nullptr);
  newFile(go);
  EXPECT_EQ(waitForProcess(child), 0);
  EXPECT_EQ(save(store.database(), {newRecord("a")}), nullptr);
  EXPECT_TRUE(isWhole(store, 1));
}

}  // namespace
}  // namespace yomber
