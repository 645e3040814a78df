// A drive on a disk that is filled to its last block, and then has room again.
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/content_client.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using Local = ContentClient::Local;
using Upload = ContentClient::Upload;

constexpr std::uintmax_t kDiskSize = 48 << 20;
constexpr std::size_t kSize = 3 << 20;
constexpr int kNoRoom = 28;

class FullDiskSystem : public ::testing::Test {
 protected:
  /// The drive's home becomes a small disk of its own.
  void SetUp() override {
    const std::string image = beside("image");
    std::ofstream(image).put('\0');
    fs::resize_file(image, kDiskSize);
    const auto runs = [](const std::string& command) {
      return std::system((command + " >/dev/null 2>&1").c_str()) == 0;
    };
    isMounted_ = geteuid() == 0 && runs("mkfs.ext4 -q -F -m 0 " + image) &&
                 runs("mount -o loop " + image + " " + drive_.home());
    if (!isMounted_) GTEST_SKIP() << "needs root, mkfs.ext4 and a loop device for a small disk";
    fs::create_directories(drive_.root());
    for (fs::path place = drive_.root(); place != fs::path(drive_.home()).parent_path();
         place = place.parent_path()) {
      fs::permissions(place, fs::perms::owner_all);
    }
    drive_.up();
    client_.emplace(drive_.home());
  }
  void TearDown() override {
    client_.reset();
    if (!isMounted_) return;
    drive_.down();
    EXPECT_EQ(umount2(drive_.home().c_str(), MNT_DETACH), 0);
  }
  [[nodiscard]] std::string beside(const std::string& name) const {
    return fs::path(drive_.home()).parent_path() / name;
  }
  [[nodiscard]] std::string at(const std::string& name) const { return drive_.root() + "/" + name; }
  bool isConfirmed(const std::string& name) {
    return eventually([&] { return client_->state(at(name)).upload == Upload::CONFIRMED; });
  }
  /// To the last block.
  void fill() const {
    const int file = open(filler().c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    ASSERT_GE(file, 0);
    const std::string piece(1 << 20, 'f');
    for (std::size_t size = piece.size(); size >= 4096;) {
      if (write(file, piece.data(), size) <= 0) size /= 2;
    }
    ASSERT_EQ(fsync(file), 0);
    EXPECT_EQ(write(file, piece.data(), 4096), -1);
    close(file);
  }
  void makeRoom() const { fs::remove(filler()); }
  [[nodiscard]] std::string filler() const { return drive_.home() + "/filler"; }
  [[nodiscard]] std::string offline() const { return drive_.home() + "/store/offline"; }

  TestDrive drive_;
  std::optional<ContentClient> client_;
  bool isMounted_ = false;
};

TEST_F(FullDiskSystem, LosesNothingAndGoesOnWhenThereIsRoomAgain) {
  const std::string away = someContent(kSize, 1);
  const std::string edited = someContent(kSize, 2);
  drive_.write("away", away);
  ASSERT_TRUE(isConfirmed("away"));
  ASSERT_EQ(client_->evict(at("away")), nullptr);
  const std::string id = drive_.json({"id", "away"}).at(0).at("id");
  // An upload that waits until the disk is full.
  std::ofstream(offline()).put('x');
  drive_.write("edited", edited);
  ASSERT_TRUE(eventually([&] { return client_->state(at("edited")).upload == Upload::WAITING; }));
  std::ofstream(beside("new"), std::ios::binary) << someContent(kSize, 3);
  fill();
  fs::remove(offline());

  EXPECT_TRUE(eventually([&] { return client_->state(at("edited")).lastFailure != nullptr; }));
  const auto put = drive_.yomber({"put", beside("new")});
  EXPECT_EQ(put.exitCode, kNoRoom) << put.errors;
  EXPECT_FALSE(fs::exists(at("new")));
  const auto provided = drive_.yomber({"provide", "away"});
  EXPECT_EQ(provided.exitCode, kNoRoom) << provided.errors;
  EXPECT_EQ(client_->state(at("away")).local, Local::FAULT);
  EXPECT_EQ(drive_.names(), (std::vector<std::string>{"away", "edited"}));

  makeRoom();
  EXPECT_TRUE(isConfirmed("edited"));
  EXPECT_EQ(drive_.yomber({"provide", "away"}).exitCode, 0);
  EXPECT_TRUE(contentOf(at("away")) == away);
  EXPECT_TRUE(contentOf(at("edited")) == edited);
  EXPECT_EQ(drive_.json({"id", "away"}).at(0).at("id"), id);
  EXPECT_EQ(drive_.yomber({"put", beside("new")}).exitCode, 0);
  EXPECT_TRUE(isConfirmed("new"));
  EXPECT_EQ(client_->evict(at("edited")), nullptr);
  EXPECT_EQ(client_->provide(at("edited")), nullptr);
  EXPECT_TRUE(contentOf(at("edited")) == edited);
}

TEST_F(FullDiskSystem, ADriveThatIsStartedOnAFullDiskGoesOnToo) {
  const std::string away = someContent(kSize, 4);
  drive_.write("away", away);
  ASSERT_TRUE(isConfirmed("away"));
  ASSERT_EQ(client_->evict(at("away")), nullptr);
  fill();
  drive_.kill(TestDrive::Process::Zarn);
  ASSERT_TRUE(eventually([&] {
    try {
      client_.emplace(drive_.home());
      return client_->state(at("away")).local == Local::FAULT;
    } catch (const std::exception&) {
      return false;
    }
  }));
  EXPECT_NE(client_->provide(at("away")), nullptr);
  // That it failed may not have been written down either.
  EXPECT_NE(client_->state(at("away")).local, Local::HERE);
  makeRoom();
  EXPECT_EQ(client_->provide(at("away")), nullptr);
  EXPECT_TRUE(contentOf(at("away")) == away);
}

}  // namespace
}  // namespace yomber::testing
