#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/rozzel/hashed_copy.h"
#include "platform/rozzel/sha256.h"
#include "platform/rozzel/test_store.h"

namespace yomber {
namespace {

std::span<const std::byte> bytesOf(const std::string& text) {
  return std::as_bytes(std::span(text));
}

RZAsset assetOf(const std::string& text) {
  Sha256 hash;
  hash.update(bytesOf(text));
  return hash.finish();
}

/// Bytes that do not repeat and hold no block of zeros.
std::string someContent(std::size_t size) {
  std::string content(size, '\0');
  std::uint32_t state = 1;
  for (char& byte : content) {
    state = state * 1664525 + 1013904223;
    byte = static_cast<char>(state >> 24U);
  }
  return content;
}

std::string contentOf(RZEngine& engine, const RZAsset& asset) {
  FileDescriptor descriptor;
  EXPECT_EQ(engine.openAsset(asset, descriptor), nullptr);
  return readText(descriptor.get());
}

std::uint64_t filesBelow(const std::string& folder) {
  std::uint64_t count = 0;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(folder)) {
    count += entry.is_regular_file() ? 1 : 0;
  }
  return count;
}

std::int64_t blocksOf(const std::string& path) {
  struct stat status{};
  EXPECT_EQ(stat(path.c_str(), &status), 0) << path;
  return status.st_blocks;
}

void flipABit(const std::string& path, off_t offset) {
  ASSERT_EQ(chmod(path.c_str(), 0600), 0);
  const FileDescriptor file(open(path.c_str(), O_RDWR | O_CLOEXEC));
  char byte = 0;
  ASSERT_EQ(pread(file.get(), &byte, 1, offset), 1);
  byte = static_cast<char>(byte ^ 1);
  ASSERT_EQ(pwrite(file.get(), &byte, 1, offset), 1);
}

/// An asset of one fixed text has the hash that everybody computes for it.
TEST(AssetStoreTest, NamesContentByItsSha256) {
  TestStore store;
  const RZAsset asset = storeText(*store.engine(), "abc");
  EXPECT_EQ(asset.hexHash(), "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
  EXPECT_EQ(asset.size, 3U);
  EXPECT_EQ(storeText(*store.engine(), "").hexHash(),
            "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855");
}

TEST(AssetStoreTest, GivesBackWhatWasWrittenInPiecesOfAnySize) {
  TestStore store;
  const std::string content = someContent(5'000'001);
  for (const std::size_t piece : {std::size_t{1000}, std::size_t{1 << 20}, content.size()}) {
    NSErrorRef error;
    const auto group = store.engine()->newAssetGroup(&error);
    ASSERT_NE(group, nullptr);
    const auto writer = group->newWriter(&error);
    ASSERT_NE(writer, nullptr);
    for (std::size_t offset = 0; offset < content.size(); offset += piece) {
      ASSERT_EQ(writer->write(bytesOf(content.substr(offset, piece))), nullptr);
    }
    RZAsset asset;
    ASSERT_EQ(writer->finish(asset), nullptr);
    EXPECT_EQ(asset, assetOf(content));
    ASSERT_EQ(group->commit(), nullptr);
    EXPECT_EQ(contentOf(*store.engine(), asset), content);
    EXPECT_EQ(store.engine()->verifyAsset(asset, {}), nullptr);
  }
}

TEST(AssetStoreTest, HasNothingBeforeTheGroupIsCommitted) {
  TestStore store;
  NSErrorRef error;
  FileDescriptor descriptor;
  RZAsset asset;
  {
    const auto group = store.engine()->newAssetGroup(&error);
    {
      const auto abandoned = group->newWriter(&error);
      ASSERT_EQ(abandoned->write(bytesOf("abandoned")), nullptr);
    }
    const auto writer = group->newWriter(&error);
    ASSERT_EQ(writer->write(bytesOf("content")), nullptr);
    ASSERT_EQ(writer->finish(asset), nullptr);
    EXPECT_TRUE(rz_isError(store.engine()->openAsset(asset, descriptor), RZErrorAssetMissing));
  }
  EXPECT_TRUE(rz_isError(store.engine()->openAsset(asset, descriptor), RZErrorAssetMissing));
  EXPECT_EQ(filesBelow(store.folder() + "/assets"), 0U);
  EXPECT_EQ(filesBelow(store.folder() + "/staging"), 1U);  // the session's mark alone
}

TEST(AssetStoreTest, KeepsIdenticalContentOnce) {
  TestStore store;
  const std::string large = someContent(200'000);
  for (int round = 0; round < 3; ++round) {
    storeText(*store.engine(), "small");
    storeText(*store.engine(), large);
  }
  EXPECT_EQ(filesBelow(store.folder() + "/assets"), 2U);
  EXPECT_EQ(contentOf(*store.engine(), assetOf(large)), large);
}

TEST(AssetStoreTest, TakesManyAssetsInOneGroup) {
  TestStore store;
  NSErrorRef error;
  const auto group = store.engine()->newAssetGroup(&error);
  std::vector<RZAsset> assets;
  for (int index = 0; index < 300; ++index) {
    const auto writer = group->newWriter(&error);
    ASSERT_EQ(writer->write(bytesOf("content " + std::to_string(index))), nullptr);
    ASSERT_EQ(writer->finish(assets.emplace_back()), nullptr);
  }
  ASSERT_EQ(group->commit(), nullptr);
  for (const RZAsset& asset : assets) EXPECT_EQ(store.engine()->verifyAsset(asset, {}), nullptr);
}

TEST(AssetStoreTest, ImportsAFileWithItsHoles) {
  TestStore store;
  TemporaryDirectory directory;
  const FileDescriptor file = newFile(directory / "sparse");
  constexpr off_t kHole = 50 << 20;
  writeText(file.get(), "begin");
  writeText(file.get(), "middle", kHole);
  ASSERT_EQ(ftruncate(file.get(), 2 * kHole + 1), 0);
  RZAsset asset;
  ASSERT_EQ(store.engine()->importAsset(file.get(), {}, asset), nullptr);
  EXPECT_EQ(asset.size, static_cast<std::uint64_t>(2 * kHole + 1));
  EXPECT_EQ(asset, assetOf(readText(file.get())));
  EXPECT_LT(blocksOf(store.pathOf(asset)), 64);
  EXPECT_EQ(store.engine()->verifyAsset(asset, {}), nullptr);
}

TEST(AssetStoreTest, TakesNoRoomForBlocksOfZeros) {
  TestStore store;
  TemporaryDirectory directory;
  std::string content(10 << 20, '\0');
  content[5'000'000] = 'x';
  const FileDescriptor file = newFile(directory / "zeros");
  writeText(file.get(), content);
  RZAsset imported;
  ASSERT_EQ(store.engine()->importAsset(file.get(), {}, imported), nullptr);
  EXPECT_EQ(imported, assetOf(content));
  EXPECT_LT(blocksOf(store.pathOf(imported)), 64);
  EXPECT_EQ(contentOf(*store.engine(), imported), content);
}

TEST(AssetStoreTest, WritesHolesWithoutBeingGivenThem) {
  TestStore store;
  NSErrorRef error;
  const auto group = store.engine()->newAssetGroup(&error);
  const auto writer = group->newWriter(&error);
  ASSERT_EQ(writer->write(bytesOf("a")), nullptr);
  ASSERT_EQ(writer->writeZeros(3'000'000), nullptr);
  ASSERT_EQ(writer->write(bytesOf("b")), nullptr);
  ASSERT_EQ(writer->writeZeros(5), nullptr);
  RZAsset asset;
  ASSERT_EQ(writer->finish(asset), nullptr);
  ASSERT_EQ(group->commit(), nullptr);
  const std::string content = "a" + std::string(3'000'000, '\0') + "b" + std::string(5, '\0');
  EXPECT_EQ(asset, assetOf(content));
  EXPECT_EQ(contentOf(*store.engine(), asset), content);
}

TEST(AssetStoreTest, FillsAFileInPlaceAndVerifiesIt) {
  TestStore store;
  TemporaryDirectory directory;
  const std::string content = someContent(3'500'000);
  const RZAsset asset = storeText(*store.engine(), content);
  const FileDescriptor file = newFile(directory / "target");
  ASSERT_EQ(ftruncate(file.get(), static_cast<off_t>(content.size())), 0);
  std::vector<std::uint64_t> steps;
  const RZTransfer transfer{.progress = [&](std::uint64_t bytes) {
    steps.push_back(bytes);
    return true;
  }};
  ASSERT_EQ(store.engine()->copyAsset(asset, file.get(), transfer), nullptr);
  EXPECT_EQ(readText(file.get()), content);
  EXPECT_TRUE(std::is_sorted(steps.begin(), steps.end()));
  EXPECT_EQ(steps.back(), content.size());
  EXPECT_GE(steps.size(), 4U);
}

TEST(AssetStoreTest, StopsATransferThatIsCancelled) {
  TestStore store;
  TemporaryDirectory directory;
  const std::string content = someContent(3'500'000);
  const RZAsset asset = storeText(*store.engine(), content);
  const FileDescriptor file = newFile(directory / "target");
  const RZTransfer cancelled{.progress = [](std::uint64_t bytes) { return bytes < 2'000'000; }};
  const auto isCancelled = [](const NSErrorRef& error) {
    return error && error->is(NSCocoaErrorDomain, NSUserCancelledError);
  };
  EXPECT_TRUE(isCancelled(store.engine()->copyAsset(asset, file.get(), cancelled)));
  EXPECT_TRUE(isCancelled(store.engine()->verifyAsset(asset, cancelled)));
  writeText(file.get(), content);
  RZAsset imported;
  EXPECT_TRUE(isCancelled(store.engine()->importAsset(file.get(), cancelled, imported)));
  EXPECT_EQ(imported, RZAsset{});
  EXPECT_EQ(filesBelow(store.folder() + "/staging"), 1U);
}

TEST(AssetStoreTest, NeverGivesDamagedContentOutAsSound) {
  TestStore store;
  TemporaryDirectory directory;
  const std::string content = someContent(2'500'000);
  const RZAsset asset = storeText(*store.engine(), content);
  const RZAsset other = storeText(*store.engine(), "other");
  flipABit(store.pathOf(asset), 1'500'000);
  const FileDescriptor file = newFile(directory / "target");
  std::string bytes = "untouched";
  EXPECT_TRUE(rz_isError(store.engine()->verifyAsset(asset, {}), RZErrorAssetDamaged));
  EXPECT_TRUE(rz_isError(store.engine()->copyAsset(asset, file.get(), {}), RZErrorAssetDamaged));
  EXPECT_TRUE(rz_isError(store.engine()->readAsset(asset, 1 << 30, bytes), RZErrorAssetDamaged));
  EXPECT_EQ(bytes, "untouched");
  EXPECT_EQ(store.engine()->verifyAsset(other, {}), nullptr);
}

TEST(AssetStoreTest, SeesAtOnceWhenAnAssetWasCutShort) {
  TestStore store;
  const RZAsset asset = storeText(*store.engine(), "content");
  ASSERT_EQ(chmod(store.pathOf(asset).c_str(), 0600), 0);
  ASSERT_EQ(truncate(store.pathOf(asset).c_str(), 3), 0);
  FileDescriptor descriptor;
  EXPECT_TRUE(rz_isError(store.engine()->openAsset(asset, descriptor), RZErrorAssetDamaged));
  EXPECT_FALSE(descriptor);
  EXPECT_TRUE(rz_isError(save(store.database(), {newRecord("a", {{"content", asset}})}),
                         RZErrorAssetDamaged));
}

TEST(AssetStoreTest, MendsDamagedContentWhenItIsStoredAgain) {
  TestStore store;
  for (const std::string& content : {std::string("small"), someContent(500'000)}) {
    const RZAsset asset = storeText(*store.engine(), content);
    flipABit(store.pathOf(asset), 2);
    ASSERT_TRUE(rz_isError(store.engine()->verifyAsset(asset, {}), RZErrorAssetDamaged));
    storeText(*store.engine(), content);
    EXPECT_EQ(store.engine()->verifyAsset(asset, {}), nullptr);
  }
}

TEST(AssetStoreTest, SaysThatAnAssetIsMissing) {
  TestStore store;
  const auto database = store.database();
  const RZAsset asset = storeText(*store.engine(), "content");
  const RZAsset never = assetOf("never stored");
  ASSERT_EQ(save(database, {newRecord("a", {{"content", asset}})}), nullptr);
  ASSERT_EQ(unlink(store.pathOf(asset).c_str()), 0);
  EXPECT_TRUE(rz_isError(store.engine()->verifyAsset(asset, {}), RZErrorAssetMissing));
  EXPECT_TRUE(
      rz_isError(save(database, {newRecord("b", {{"content", never}})}), RZErrorAssetMissing));
  EXPECT_EQ(fetch(database, "b"), nullptr);
  // The rest of the record can still be changed.
  EXPECT_EQ(change(database, "a", "name", "renamed"), nullptr);
}

TEST(AssetStoreTest, ReadsSmallAssetsIntoMemoryAlone) {
  TestStore store;
  const RZAsset asset = storeText(*store.engine(), "content");
  std::string bytes;
  EXPECT_TRUE(rz_isError(store.engine()->readAsset(asset, 6, bytes), RZErrorLimitExceeded));
  ASSERT_EQ(store.engine()->readAsset(asset, 7, bytes), nullptr);
  EXPECT_EQ(bytes, "content");
}

TEST(AssetStoreTest, HashesWhatItReadsOfAFileThatChangesMeanwhile) {
  TestStore store;
  TemporaryDirectory directory;
  const FileDescriptor file = newFile(directory / "growing");
  writeText(file.get(), someContent(3'000'000));
  off_t end = 3'000'000;
  const RZTransfer transfer{.progress = [&](std::uint64_t) {
    if (end < 3'000'100) writeText(file.get(), "more", end);
    end += 40;
    return true;
  }};
  RZAsset asset;
  ASSERT_EQ(store.engine()->importAsset(file.get(), transfer, asset), nullptr);
  EXPECT_EQ(store.engine()->verifyAsset(asset, {}), nullptr);
}

TEST(AssetStoreTest, StoresFromSeveralThreadsInOneGroup) {
  TestStore store;
  NSErrorRef error;
  const auto group = store.engine()->newAssetGroup(&error);
  std::vector<RZAsset> assets(4);
  std::vector<std::thread> threads;
  for (std::size_t index = 0; index < assets.size(); ++index) {
    threads.emplace_back([&, index] {
      NSErrorRef ignored;
      const auto writer = group->newWriter(&ignored);
      const std::string content = someContent(1'500'000 + index);
      EXPECT_EQ(writer->write(bytesOf(content)), nullptr);
      EXPECT_EQ(writer->finish(assets[index]), nullptr);
    });
  }
  for (auto& thread : threads) thread.join();
  ASSERT_EQ(group->commit(), nullptr);
  for (const RZAsset& asset : assets) EXPECT_EQ(store.engine()->verifyAsset(asset, {}), nullptr);
}

/// A store whose clock stands until it is told otherwise.
class AssetGarbageTest : public testing::Test {
 protected:
  static constexpr std::int64_t kSecond = 1'000'000'000;
  static constexpr std::int64_t kDay = 24 * 3600 * kSecond;

  RZGarbageReport collect() {
    RZGarbageReport report;
    EXPECT_EQ(store_.engine()->collectGarbage(report), nullptr);
    return report;
  }
  [[nodiscard]] bool isThere(const RZAsset& asset) const {
    return access(store_.pathOf(asset).c_str(), F_OK) == 0;
  }

  std::atomic<std::int64_t> now_{1'700'000'000 * kSecond};
  TestStore store_{{.clock = [this] { return NSDate::fromNanoseconds(now_); },
                    .assetGraceSeconds = kDay / kSecond}};
};

TEST_F(AssetGarbageTest, KeepsWhatARecordRefersToForEver) {
  const RZAsset asset = storeText(*store_.engine(), "content");
  ASSERT_EQ(save(store_.database(), {newRecord("a", {{"content", asset}})}), nullptr);
  now_ += 1000 * kDay;
  EXPECT_EQ(collect().assetsDropped, 0U);
  EXPECT_TRUE(isThere(asset));
}

TEST_F(AssetGarbageTest, DropsWhatNobodyReferredToForADay) {
  const RZAsset asset = storeText(*store_.engine(), "content");
  now_ += kDay;
  EXPECT_EQ(collect().assetsDropped, 0U);
  now_ += kSecond;
  const auto report = collect();
  EXPECT_EQ(report.assetsDropped, 1U);
  EXPECT_EQ(report.bytesDropped, 7U);
  EXPECT_FALSE(isThere(asset));
  EXPECT_EQ(filesBelow(store_.folder() + "/staging"), 1U);
}

TEST_F(AssetGarbageTest, CountsTheDayFromTheLastStoring) {
  const RZAsset asset = storeText(*store_.engine(), "content");
  now_ += kDay;
  storeText(*store_.engine(), "content");
  now_ += kDay;
  EXPECT_EQ(collect().assetsDropped, 0U);
  EXPECT_TRUE(isThere(asset));
}

TEST_F(AssetGarbageTest, CountsTheDayFromTheLastRecordsEnd) {
  const auto database = store_.database();
  const RZAsset asset = storeText(*store_.engine(), "content");
  ASSERT_EQ(save(database, {newRecord("a", {{"content", asset}}),
                            newRecord("b", {{"content", asset}, {"again", asset}})}),
            nullptr);
  now_ += 10 * kDay;
  ASSERT_EQ(remove(database, recordID("a")), nullptr);
  now_ += 10 * kDay;
  EXPECT_EQ(collect().assetsDropped, 0U);
  const RZAsset next = storeText(*store_.engine(), "next");
  ASSERT_EQ(change(database, "b", "content", next), nullptr);
  now_ += 10 * kDay;
  EXPECT_EQ(collect().assetsDropped, 0U);
  ASSERT_EQ(change(database, "b", "again", next), nullptr);
  now_ += kDay;
  EXPECT_EQ(collect().assetsDropped, 0U);
  now_ += kSecond;
  EXPECT_EQ(collect().assetsDropped, 1U);
  EXPECT_FALSE(isThere(asset));
  EXPECT_TRUE(isThere(next));
}

TEST_F(AssetGarbageTest, DropsTheAssetsOfADeletedZone) {
  std::vector<RZRecordRef> records;
  for (int index = 0; index < 100; ++index) {
    const std::string name = std::to_string(index);
    records.push_back(newRecord(name, {{"content", storeText(*store_.engine(), name)}}));
  }
  ASSERT_EQ(save(store_.database(), records), nullptr);
  ASSERT_EQ(store_.database()->deleteZone(kZone), nullptr);
  now_ += 2 * kDay;
  EXPECT_EQ(collect().recordsCleared, 100U);
  now_ += 2 * kDay;
  EXPECT_EQ(collect().assetsDropped, 100U);
  EXPECT_EQ(filesBelow(store_.folder() + "/assets"), 0U);
}

TEST_F(AssetGarbageTest, MakesRoomAlsoWhereItCannotBeNoted) {
  const RZAsset asset = storeText(*store_.engine(), "content");
  now_ += 2 * kDay;
  ASSERT_EQ(FaultPoint::arm("rozzel.garbage.moved=error"), nullptr);
  RZGarbageReport report;
  EXPECT_NE(store_.engine()->collectGarbage(report), nullptr);
  FaultPoint::disarmAll();
  EXPECT_FALSE(isThere(asset));
  EXPECT_EQ(filesBelow(store_.folder() + "/staging"), 1U) << "the engine's own file";
  collect();
  EXPECT_EQ(store_.engine()->verifyAsset(storeText(*store_.engine(), "content"), {}), nullptr);
}

TEST_F(AssetGarbageTest, LeavesFilesAloneThatAreNoAssets) {
  storeText(*store_.engine(), "content");
  const std::string stray = store_.folder() + "/assets/00/notes.txt";
  newFile(stray);
  now_ += 10'000 * kDay;
  collect();
  EXPECT_EQ(access(stray.c_str(), F_OK), 0);
}

/// What happens to an asset after it was chosen to be dropped, and before it is.
class AssetGarbageChoiceTest : public AssetGarbageTest {
 protected:
  void collectWhile(const std::function<void()>& work) {
    TemporaryDirectory directory;
    const std::string go = directory / "go";
    ASSERT_EQ(FaultPoint::arm("rozzel.garbage.chosen=pause-until-file:" + go), nullptr);
    std::thread collector([&] { collect(); });
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (access((go + ".reached").c_str(), F_OK) != 0 &&
           std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
    EXPECT_EQ(access((go + ".reached").c_str(), F_OK), 0);
    work();
    newFile(go);
    collector.join();
    FaultPoint::disarmAll();
  }
};

TEST_F(AssetGarbageChoiceTest, IsTakenBackWhenARecordRefersToItAgain) {
  const RZAsset stray = storeText(*store_.engine(), "stray");
  const RZAsset released = storeText(*store_.engine(), "released");
  ASSERT_EQ(save(store_.database(), {newRecord("a", {{"content", released}})}), nullptr);
  ASSERT_EQ(remove(store_.database(), recordID("a")), nullptr);
  now_ += 2 * kDay;
  collectWhile([&] {
    EXPECT_EQ(save(store_.database(), {newRecord("b", {{"x", stray}, {"y", released}})}), nullptr);
  });
  EXPECT_EQ(store_.engine()->verifyAsset(stray, {}), nullptr);
  EXPECT_EQ(store_.engine()->verifyAsset(released, {}), nullptr);
}

TEST_F(AssetGarbageChoiceTest, IsTakenBackWhenTheContentIsStoredAgain) {
  const RZAsset stray = storeText(*store_.engine(), "stray");
  const RZAsset dropped = storeText(*store_.engine(), "dropped");
  now_ += 2 * kDay;
  collectWhile([&] { storeText(*store_.engine(), "stray"); });
  EXPECT_EQ(store_.engine()->verifyAsset(stray, {}), nullptr);
  EXPECT_FALSE(isThere(dropped));
}

TEST(AssetGarbageRaceTest, NeverDropsWhatASaveHasJustReferredTo) {
  TestStore store({.assetGraceSeconds = -3600});  // whatever is unused goes at once
  std::atomic<bool> ended{false};
  std::thread collector([&] {
    const auto engine = std::make_shared<EmbeddedEngine>(
        store.folder(), EmbeddedEngineOptions{.assetGraceSeconds = -3600});
    while (!ended) {
      RZGarbageReport report;
      EXPECT_EQ(engine->collectGarbage(report), nullptr);
    }
  });
  int saves = 0;
  for (int round = 0; saves < 20 && round < 2000; ++round) {
    const RZAsset asset = storeText(*store.engine(), "content");
    const NSErrorRef error = save(store.database(), {newRecord("a", {{"content", asset}})});
    if (rz_isError(error, RZErrorAssetMissing)) continue;  // dropped before: nothing was promised
    ASSERT_EQ(error, nullptr);
    ++saves;
    EXPECT_EQ(store.engine()->verifyAsset(asset, {}), nullptr);
    ASSERT_EQ(remove(store.database(), recordID("a")), nullptr);
  }
  ended = true;
  collector.join();
  EXPECT_EQ(saves, 20);
}

}  // namespace
}  // namespace yomber
