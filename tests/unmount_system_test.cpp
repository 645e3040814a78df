// Taking the mount away: not from under whoever has something open there, unless that is wanted.
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <string>

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

class Unmount : public MountFixture {
 protected:
  [[nodiscard]] ProcessResult unmount(const std::vector<std::string>& options = {}) {
    std::vector<std::string> command{"unmount"};
    command.insert(command.end(), options.begin(), options.end());
    return mounted_.drive().yomber(command);
  }
  /// Refused because of this very process.
  void expectInUse() {
    constexpr int kNotNow = 75;
    const ProcessResult result = unmount();
    EXPECT_EQ(result.exitCode, kNotNow);
    std::string name;
    std::getline(std::ifstream("/proc/self/comm"), name);
    const std::string self = name + " (" + std::to_string(getpid()) + ")";
    EXPECT_NE(result.errors.find(self), std::string::npos) << result.errors;
    EXPECT_NE(result.errors.find("--lazy"), std::string::npos) << result.errors;
    EXPECT_EQ(contentOf(at("report")), "content");
  }
  [[nodiscard]] bool isMounted() {
    return mounted_.drive().status().value("mount", "") == mounted_.folder();
  }
};

TEST_F(Unmount, IsRefusedWhileADocumentIsOpenAndSaysByWhom) {
  std::ofstream(at("report")) << "content";
  {
    const OpenedFile file(at("report"), O_RDWR);
    ASSERT_GE(file.get(), 0);
    expectInUse();
    EXPECT_EQ(pwrite(file.get(), "CONTENT", 7, 0), 7);
    EXPECT_EQ(pwrite(file.get(), "content", 7, 0), 7);
  }
  EXPECT_EQ(unmount().exitCode, 0);
  EXPECT_FALSE(isMounted());
  EXPECT_FALSE(fs::exists(at("report")));
}

TEST_F(Unmount, IsRefusedWhileADocumentIsMapped) {
  std::ofstream(at("report")) << "content";
  void* map = MAP_FAILED;
  {
    const OpenedFile file(at("report"), O_RDWR);
    map = mmap(nullptr, 7, PROT_READ | PROT_WRITE, MAP_SHARED, file.get(), 0);
  }
  ASSERT_NE(map, MAP_FAILED);
  expectInUse();
  *static_cast<char*>(map) = 'C';
  EXPECT_EQ(munmap(map, 7), 0);
  EXPECT_EQ(unmount().exitCode, 0);
  EXPECT_EQ(contentOf(onDisk("report")), "Content");
}

TEST_F(Unmount, IsRefusedWhileSomebodyWorksInAFolder) {
  std::ofstream(at("report")) << "content";
  fs::create_directory(at("folder"));
  const fs::path before = fs::current_path();
  fs::current_path(at("folder"));
  expectInUse();
  fs::current_path(before);
  EXPECT_EQ(unmount().exitCode, 0);
}

TEST_F(Unmount, LazilyItIsTakenAwayNevertheless) {
  std::ofstream(at("report")) << "content";
  const OpenedFile file(at("report"), O_RDWR);
  EXPECT_EQ(unmount({"--lazy"}).exitCode, 0);
  EXPECT_FALSE(isMounted());
  EXPECT_FALSE(fs::exists(at("report")));
  EXPECT_EQ(contentOf(onDisk("report")), "content");
}

TEST_F(Unmount, SaysWhetherThereWasAnything) {
  EXPECT_TRUE(mounted_.drive().json({"unmount"}).at(0).at("was_mounted"));
  EXPECT_FALSE(mounted_.drive().json({"unmount"}).at(0).at("was_mounted"));
  mounted_.mount();
  EXPECT_TRUE(isMounted());
}

}  // namespace
}  // namespace yomber::testing
