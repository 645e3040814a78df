// The ways in which editors save, through the mount: the document stays the one that it is, and
// what the steps of a save have in common is one upload.
#include <cstdint>
#include <fstream>
#include <functional>
#include <string>
#include <vector>

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

constexpr const char* kDocument = "report.txt";

class MountSaves : public MountFixture {
 protected:
  // A pause that the steps of a save keep to also where sanitizers run.
  MountSaves() : MountFixture({}, {}, {{"YOMBER_UPLOAD_PAUSE_MS", "1000"}}) {
    std::ofstream(at(kDocument)) << "first";
    EXPECT_TRUE(isConfirmed(kDocument));
    id_ = client_.identifierAt(onDisk(kDocument));
  }

  /// A few saves in a row, so that what one leaves does not hide what the next does.
  void expectKept(const std::function<void(const std::string& text)>& save) {
    for (const std::string text : {"second", "the third", "the fourth one"}) {
      const std::uint64_t before = uploads();
      save(text);
      expectSaved(text);
      EXPECT_EQ(uploads(), before + 1) << text;
    }
    evict(kDocument);
    EXPECT_EQ(contentOf(at(kDocument)), "the fourth one");
  }
  /// How many were done, once there are no more.
  std::uint64_t uploads() {
    std::uint64_t finished = 0;
    EXPECT_TRUE(eventually([&] {
      const auto transfers = mounted_.drive().status()["transfers"];
      finished = transfers["finished"];
      return transfers["under_way"].empty() && transfers["waiting"] == 0;
    }));
    return finished;
  }
  void expectSaved(const std::string& text) {
    ASSERT_TRUE(isConfirmed(kDocument)) << text;
    EXPECT_EQ(client_.identifierAt(onDisk(kDocument)), id_) << text;
    EXPECT_EQ(contentOf(at(kDocument)), text);
    // And nothing else stays.
    EXPECT_EQ(mounted_.drive().names(), std::vector<std::string>{kDocument});
  }

  void write(const std::string& name, const std::string& text, int flags = O_CREAT | O_TRUNC) {
    const OpenedFile file(at(name), O_WRONLY | flags);
    ASSERT_GE(file.get(), 0) << name;
    ASSERT_EQ(::write(file.get(), text.data(), text.size()), static_cast<ssize_t>(text.size()));
    ASSERT_EQ(fsync(file.get()), 0);
  }
  void move(const std::string& from, const std::string& to) {
    ASSERT_EQ(rename(at(from).c_str(), at(to).c_str()), 0) << from;
  }
  void remove(const std::string& name) { ASSERT_EQ(unlink(at(name).c_str()), 0) << name; }

  std::string id_;
};

TEST_F(MountSaves, WrittenAsideAndRenamedOver) {
  expectKept([&](const std::string& text) {
    write(".goutputstream-K3J2", text, O_CREAT | O_EXCL);
    move(".goutputstream-K3J2", kDocument);
  });
}

TEST_F(MountSaves, WrittenAsideUnderAnOrdinaryNameAndRenamedOver) {
  expectKept([&](const std::string& text) {
    write("report.txt.new", text, O_CREAT | O_EXCL);
    move("report.txt.new", kDocument);
  });
}

TEST_F(MountSaves, ABackupIsRenamedAndRemovedAfterwards) {
  expectKept([&](const std::string& text) {
    move(kDocument, "report.txt~");
    write(kDocument, text, O_CREAT | O_EXCL);
    remove("report.txt~");
  });
}

TEST_F(MountSaves, EmptiedAndWrittenAnew) {
  expectKept([&](const std::string& text) { write(kDocument, text, O_TRUNC); });
}

TEST_F(MountSaves, CopiedToABackupAndWrittenInPlace) {
  expectKept([&](const std::string& text) {
    write("report.txt~", contentOf(at(kDocument)));
    write(kDocument, text, O_TRUNC);
    remove("report.txt~");
  });
}

TEST_F(MountSaves, WithALockFileBesideIt) {
  expectKept([&](const std::string& text) {
    write(".~lock.report.txt#", "ada, desk", O_CREAT | O_EXCL);
    write("lu4711.tmp", text, O_CREAT | O_EXCL);
    move("lu4711.tmp", kDocument);
    remove(".~lock.report.txt#");
  });
}

TEST_F(MountSaves, WithASwapFileAndALockThatIsALink) {
  expectKept([&](const std::string& text) {
    ASSERT_EQ(symlink("ada@desk.4711:1", at(".#report.txt").c_str()), 0);
    write(".report.txt.swp", text, O_CREAT | O_EXCL);
    write(kDocument, text, O_TRUNC);
    remove(".report.txt.swp");
    remove(".#report.txt");
  });
}

}  // namespace
}  // namespace yomber::testing
