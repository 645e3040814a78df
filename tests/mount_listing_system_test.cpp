// Listings of folders in the mount: who is told more than names, and what that spares him.
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/utsname.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/aside.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

constexpr const char* kLooked = "mount.lookup.looked";
constexpr const char* kTold = "mount.change.told";
/// Which the kernel gets in several replies.
constexpr std::size_t kEntries = 3000;

/// Before, the kernel decided who is told.
bool isOurChoice() {
  utsname system{};
  int major = 0;
  int minor = 0;
  if (uname(&system) != 0 || std::sscanf(system.release, "%d.%d", &major, &minor) != 2)
    return false;
  return major > 6 || (major == 6 && minor >= 16);
}

/// An open folder whose entries are read one after the other, and looked at.
class Reader {
 public:
  /// Who walks a tree follows no link.
  explicit Reader(const std::string& path, int flags = 0)
      : folder_(fdopendir(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC | flags)),
                closedir) {}

  /// The name of the next one; empty at the end.
  std::string next() {
    const dirent* entry = nullptr;
    do {
      entry = readdir(folder_.get());
    } while (entry != nullptr && entry->d_name[0] == '.');
    return entry == nullptr ? "" : entry->d_name;
  }
  [[nodiscard]] int look(const std::string& name) const {
    struct stat status{};
    return fstatat(dirfd(folder_.get()), name.c_str(), &status, AT_SYMLINK_NOFOLLOW);
  }

 private:
  const std::unique_ptr<DIR, int (*)(DIR*)> folder_;
};

/// A folder of which the kernel knows nothing yet.
class MountListing : public MountFixture {
 protected:
  MountListing() : MountFixture({}, {}, {}, {kLooked, kTold}) {}

  void SetUp() override {
    if (!isOurChoice()) GTEST_SKIP() << "before Linux 6.16 the kernel decides who gets attributes";
    mounted_.unmount();
    std::filesystem::create_directory(onDisk("folder"));
    for (std::size_t i = 0; i < kEntries; ++i) std::ofstream(onDisk("folder/" + std::to_string(i)));
    ASSERT_TRUE(eventually([&] { return isQuiet(); }));
    mounted_.mount();
    waitUntilTold();
    ASSERT_TRUE(std::filesystem::exists(at("folder")));
  }

  /// From then on, the kernel keeps what it is told.
  void waitUntilTold() {
    mounted_.closeGate(kTold);
    EXPECT_TRUE(eventually([&] {
      std::ofstream(onDisk("witness"), std::ios::app) << "x";
      return mounted_.isReached(kTold);
    }));
    mounted_.openGate(kTold);
  }

  /// Whether the drive has everything, and nothing to do.
  bool isQuiet() {
    if (mounted_.drive().json({"ls", "/folder"}).size() != kEntries) return false;
    const auto transfers = mounted_.drive().json({"status"}).at(0).at("transfers");
    return transfers.at("waiting") == 0 && transfers.at("under_way").empty();
  }

  /// `work` is done without a lookup, and answers 0.
  void expectNoLookup(const std::function<int()>& work) {
    mounted_.closeGate(kLooked);
    Aside aside(work);
    EXPECT_TRUE(eventually([&] { return aside.isDone() || mounted_.isReached(kLooked); }));
    EXPECT_FALSE(mounted_.isReached(kLooked));
    mounted_.openGate(kLooked);
    EXPECT_EQ(aside.result(), 0);
  }
  /// The first lookup of `work` is seen.
  void expectLookup(const std::function<int()>& work) {
    mounted_.closeGate(kLooked);
    Aside aside(work);
    EXPECT_TRUE(eventually([&] { return aside.isDone() || mounted_.isReached(kLooked); }));
    EXPECT_TRUE(mounted_.isReached(kLooked));
    mounted_.openGate(kLooked);
    EXPECT_EQ(aside.result(), 0);
  }

  /// Reads all names, then looks at every entry; 0, or -1.
  int walk() {
    Reader reader(at("folder"), O_NOFOLLOW);
    std::set<std::string> names;
    for (std::string name = reader.next(); !name.empty(); name = reader.next()) names.insert(name);
    if (names.size() != kEntries) return -1;
    for (const auto& name : names) {
      if (reader.look(name) != 0) return -1;
    }
    return 0;
  }
};

TEST_F(MountListing, WhoWalksATreeIsToldOfEveryEntryWithItsName) {
  expectNoLookup([this] { return walk(); });
}

TEST_F(MountListing, WhoWalksWhereOnlyNamesWereReadBeforeIsToldTheRest) {
  Reader names(at("folder"));
  std::size_t count = 0;
  while (!names.next().empty()) ++count;
  EXPECT_EQ(count, kEntries);
  expectNoLookup([this] { return walk(); });
}

TEST_F(MountListing, WhoReadsOnWithoutLookingGetsNamesAlone) {
  Reader reader(at("folder"));
  std::string last;
  for (std::string name = reader.next(); !name.empty(); name = reader.next()) last = name;
  expectLookup([&] { return reader.look(last); });
}

TEST_F(MountListing, WhoLooksAtWhatHeReadsIsToldOfWhatFollows) {
  Reader reader(at("folder"));
  std::string name;
  // Of the first reply, of which the last is known by name alone.
  for (std::size_t i = 0; i < kEntries / 2; ++i) {
    name = reader.next();
    ASSERT_EQ(reader.look(name), 0) << name;
  }
  const std::string there = reader.next();
  expectNoLookup([&] { return reader.look(there); });
}

TEST_F(MountListing, AFolderAdvisesToReadMuchOfItAtOnce) {
  struct stat status{};
  ASSERT_EQ(stat(at("folder").c_str(), &status), 0);
  EXPECT_GE(status.st_blksize, 128 << 10);
}

/// Whoever shows many files asks for each one's label until he is told that there are none.
TEST_F(MountListing, WhoAsksForALabelIsToldThatThereAreNone) {
  char label[64];
  EXPECT_EQ(lgetxattr(at("folder/1").c_str(), "security.selinux", label, sizeof label), -1);
  EXPECT_EQ(errno, EOPNOTSUPP);
  if (lsetxattr(onDisk("folder/1").c_str(), "security.selinux", "u:r:t", 6, 0) != 0)
    GTEST_SKIP() << "this user may label nothing";
  EXPECT_EQ(lgetxattr(at("folder/1").c_str(), "security.selinux", label, sizeof label), 6);
}

}  // namespace
}  // namespace yomber::testing
