// What takes more room than is to be kept is given up, save what cannot be.
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <fcntl.h>

#include <gtest/gtest.h>

#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

constexpr std::uint64_t kLimit = 1U << 20U;
constexpr std::size_t kKept = 4096;

class MountSpace : public MountFixture {
 protected:
  MountSpace() {
    mounted_.unmount();
    mounted_.mount({"--keep", std::to_string(kLimit)});
  }
  void write(const std::string& name) { std::ofstream(at(name), std::ios::binary) << content_; }
  [[nodiscard]] bool isGone(const std::string& name) const {
    return bytesOnDisk(onDisk(name)) <= 2 * kKept;
  }
  [[nodiscard]] bool hasSaid(const std::string& text) {
    return mounted_.drive().yomber({"log"}).output.find(text) != std::string::npos;
  }

  const std::string content_ = someContent(400'000, 21);
};

TEST_F(MountSpace, WhatIsOpenIsNotGivenUp) {
  write("open");
  ASSERT_TRUE(isConfirmed("open"));
  const OpenedFile file(at("open"), O_RDONLY);
  write("older");
  ASSERT_TRUE(isConfirmed("older"));
  write("newer");
  ASSERT_TRUE(isConfirmed("newer"));
  EXPECT_TRUE(eventually([&] { return isGone("older"); }));
  EXPECT_FALSE(isGone("open"));
  EXPECT_EQ(file.read(content_.size(), 0), content_);
}

TEST_F(MountSpace, WhatTheStoreDoesNotHaveStaysUntilItHasIt) {
  goOffline();
  const std::vector<std::string> names{"a", "b", "c", "d"};
  for (const std::string& name : names) write(name);
  ASSERT_TRUE(eventually([&] { return hasSaid("nothing more can be given up now"); }));
  for (const std::string& name : names) EXPECT_FALSE(isGone(name)) << name;
  goOnline();
  for (const std::string& name : names) ASSERT_TRUE(isConfirmed(name)) << name;
  write("e");  // what comes has those that were refused asked for again
  ASSERT_TRUE(isConfirmed("e"));
  EXPECT_TRUE(eventually([&] {
    std::uint64_t sum = 0;
    for (const std::string& name : names) sum += isGone(name) ? 0 : bytesOnDisk(onDisk(name));
    return sum + bytesOnDisk(onDisk("e")) <= kLimit;
  }));
  for (const std::string& name : names) EXPECT_EQ(contentOf(at(name)), content_) << name;
}

TEST_F(MountSpace, BothOfTwoNamesThatAreOneToTheDriveAreGivenUp) {
  const std::vector<std::string> names{"caf\xc3\xa9", "cafe\xcc\x81"};
  for (const std::string name : {"pinned", "pinned too"}) {
    write(name);
    ASSERT_EQ(mounted_.drive().yomber({"pin", name}).exitCode, 0);
  }
  for (const std::string& name : names) write(name);
  EXPECT_TRUE(eventually([&] { return isGone(names[0]) && isGone(names[1]); }));
}

}  // namespace
}  // namespace yomber::testing
