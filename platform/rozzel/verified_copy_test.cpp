#include "platform/rozzel/verified_copy.h"

#include <sys/stat.h>
#include <sys/vfs.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/gate.h"
#include "platform/rozzel/following_hasher.h"
#include "platform/rozzel/sha256.h"
#include "platform/rozzel/test_store.h"

namespace yomber {
namespace {

std::string someContent(std::size_t size) {
  std::string content(size, '\0');
  std::uint32_t state = 3;
  for (char& byte : content) {
    state = state * 1664525 + 1013904223;
    byte = static_cast<char>((state >> 24U) | 1U);
  }
  return content;
}

RZAsset assetOf(const std::string& text) {
  Sha256 hash;
  hash.update(std::as_bytes(std::span(text)));
  return hash.finish();
}

FileDescriptor makeFile(const std::string& path, const std::string& content) {
  FileDescriptor file(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  EXPECT_TRUE(file) << path;
  writeText(file.get(), content);
  return file;
}

std::int64_t bytesOnDisk(int file) {
  struct stat status{};
  EXPECT_EQ(fstat(file, &status), 0);
  return std::int64_t{status.st_blocks} * 512;
}

void expectCopied(const std::string& content, const std::string& from, const std::string& to) {
  const FileDescriptor source = makeFile(from, content);
  const FileDescriptor target = makeFile(to, "");
  ASSERT_EQ(ftruncate(target.get(), static_cast<off_t>(content.size())), 0);
  RZAsset copied;
  ASSERT_EQ(rz_copyAndHashTarget(source.get(), target.get(), {}, copied), nullptr);
  EXPECT_EQ(copied, assetOf(content)) << content.size();
  EXPECT_TRUE(readText(target.get()) == content) << content.size();
}

TEST(VerifiedCopyTest, CopiesFilesOfEveryLengthAndSaysWhatTheyAre) {
  TemporaryDirectory directory;
  const std::size_t step = 1 << 20;
  for (const std::size_t size : {std::size_t{0}, std::size_t{1}, std::size_t{131'072}, step - 1,
                                 step, step + 1, 12 * step + 4'711}) {
    const std::string name = directory / std::to_string(size);
    expectCopied(someContent(size), name + " from", name + " to");
  }
}

TEST(VerifiedCopyTest, CopiesToAnotherKindOfFileSystemAsWell) {
  struct statfs status{};
  constexpr decltype(status.f_type) kMemory = 0x01021994;
  if (statfs("/dev/shm", &status) != 0 || status.f_type != kMemory) {
    GTEST_SKIP() << "there is no file system in memory at /dev/shm";
  }
  TemporaryDirectory directory;
  std::string there = "/dev/shm/verified-copy-XXXXXX";
  ASSERT_NE(mkdtemp(there.data()), nullptr);
  expectCopied(someContent(3'500'000), directory / "from", there + "/to");
  std::filesystem::remove_all(there);
}

TEST(VerifiedCopyTest, LeavesHolesAsTheyAre) {
  TemporaryDirectory directory;
  const FileDescriptor source = makeFile(directory / "from", "begin");
  ASSERT_EQ(pwrite(source.get(), "middle", 6, 20'000'000), 6);
  ASSERT_EQ(ftruncate(source.get(), 90'000'000), 0);
  const FileDescriptor target = makeFile(directory / "to", "");
  std::vector<std::uint64_t> steps;
  const RZTransfer transfer{.progress = [&](std::uint64_t done) {
    steps.push_back(done);
    return true;
  }};
  RZAsset copied;
  ASSERT_EQ(rz_copyAndHashTarget(source.get(), target.get(), transfer, copied), nullptr);
  ASSERT_EQ(ftruncate(target.get(), 90'000'000), 0);
  EXPECT_EQ(copied, assetOf(readText(source.get())));
  EXPECT_TRUE(readText(target.get()) == readText(source.get()));
  EXPECT_LT(bytesOnDisk(target.get()), 1'000'000);
  EXPECT_EQ(steps.back(), 90'000'000U);
}

TEST(VerifiedCopyTest, HashesWhatTheFileHoldsAndNotWhatItShould) {
  TemporaryDirectory directory;
  const std::string content = someContent(300'000);
  const FileDescriptor file = makeFile(directory / "file", content);
  FollowingHasher hasher(file.get());
  hasher.wrote(100'000);
  ASSERT_EQ(pwrite(file.get(), "foreign", 7, 150'000), 7);
  hasher.wrote(200'000);
  std::string expected = content;
  expected.replace(150'000, 7, "foreign");
  EXPECT_EQ(hasher.finish(), assetOf(expected));
}

TEST(VerifiedCopyTest, TellsDamageInTheStoreFromBytesOfSomebodyElse) {
  TestStore store;
  TemporaryDirectory directory;
  const std::string content = someContent(3'500'000);
  const FileDescriptor source = makeFile(directory / "from", content);
  RZAsset asset;
  ASSERT_EQ(store.engine()->importAsset(source.get(), {}, asset), nullptr);
  const std::string gate = directory / "go";
  ASSERT_EQ(FaultPoint::arm("rozzel.copy.followed=pause-until-file:" + gate), nullptr);
  const FileDescriptor target = makeFile(directory / "to", "");
  Gate copied;
  const RZTransfer transfer{.progress = [&](std::uint64_t done) {
    if (done == content.size()) copied.open();
    return true;
  }};
  NSErrorRef error;
  std::thread thread([&] { error = store.engine()->copyAsset(asset, target.get(), transfer); });
  EXPECT_TRUE(copied.wait());
  EXPECT_EQ(pwrite(target.get(), "foreign", 7, 1'500'000), 7);
  std::ofstream(gate).put('x');
  thread.join();
  FaultPoint::disarmAll();
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EAGAIN)) << error->description();
  EXPECT_EQ(store.engine()->copyAsset(asset, target.get(), {}), nullptr);
  EXPECT_TRUE(readText(target.get()) == content);
}

TEST(VerifiedCopyTest, CanBeGivenUpAtAnyTime) {
  TemporaryDirectory directory;
  const FileDescriptor source = makeFile(directory / "from", someContent(12 << 20));
  for (std::uint64_t limit = 1; limit < 14; ++limit) {
    const FileDescriptor target = makeFile(directory / "to", "");
    const RZTransfer transfer{.progress = [&](std::uint64_t done) { return done < limit << 20; }};
    RZAsset copied;
    const NSErrorRef error = rz_copyAndHashTarget(source.get(), target.get(), transfer, copied);
    EXPECT_EQ(error == nullptr, limit > 12) << limit;
  }
}

}  // namespace
}  // namespace yomber
