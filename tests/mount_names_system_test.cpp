// Names in the mount: files that have several, that lose them, and that move.
#include <algorithm>
#include <array>
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/aside.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

class MountNames : public MountFixture {
 protected:
  using MountFixture::MountFixture;

  [[nodiscard]] std::ptrdiff_t descriptors() const {
    const fs::path folder = "/proc/" + std::to_string(mounted_.pid()) + "/fd";
    return std::distance(fs::directory_iterator(folder), fs::directory_iterator());
  }
};

/// Files of which one name each goes, by `removeName(kept, other)`.
class HardLinks : public MountNames {
 protected:
  static constexpr int kLinks = 3000;
  /// Of folders, and of files of which a name has just gone.
  static constexpr std::ptrdiff_t kMostKept = 128 + 128;

  void make() {
    fs::create_directory(at("a"));
    fs::create_directory(at("b"));
    for (int i = 0; i < kLinks; ++i) {
      std::ofstream(kept(i)) << i;
      ASSERT_EQ(link(kept(i).c_str(), other(i).c_str()), 0) << i;
    }
  }
  [[nodiscard]] std::string kept(int i) const { return at("a/" + std::to_string(i)); }
  [[nodiscard]] std::string other(int i) const { return at("b/" + std::to_string(i)); }

  void expectUsable() {
    for (int i = 0; i < kLinks; i += 97) {
      struct stat status{};
      ASSERT_EQ(stat(kept(i).c_str(), &status), 0) << i;
      EXPECT_EQ(status.st_nlink, 1U) << i;
      EXPECT_EQ(chmod(kept(i).c_str(), 0600), 0) << i;
      EXPECT_EQ(setxattr(kept(i).c_str(), "user.comment", "x", 1, 0), 0) << i;
      EXPECT_EQ(contentOf(kept(i)), std::to_string(i));
    }
  }
};

TEST_F(HardLinks, OfWhichTheNameThatIsKnownHasJustGoneAreUsedAsBefore) {
  fs::create_directory(at("a"));
  fs::create_directory(at("b"));
  for (const bool isReplaced : {false, true}) {
    const int i = isReplaced ? 1 : 0;
    std::ofstream(kept(i)) << "it";
    ASSERT_EQ(link(kept(i).c_str(), other(i).c_str()), 0);
    // Nobody looks a name up for who has one of these.
    const OpenedFile place(kept(i), O_PATH);
    if (isReplaced) {
      std::ofstream(at("new")) << "new";
      ASSERT_EQ(rename(at("new").c_str(), other(i).c_str()), 0);
    } else {
      ASSERT_EQ(unlink(other(i).c_str()), 0);
    }
    struct stat status{};
    EXPECT_EQ(fstat(place.get(), &status), 0) << std::strerror(errno);
    EXPECT_EQ(status.st_nlink, 1U);
    const std::string path = "/proc/self/fd/" + std::to_string(place.get());
    EXPECT_EQ(chmod(path.c_str(), 0640), 0) << std::strerror(errno);
    EXPECT_EQ(contentOf(path), "it");
    ASSERT_EQ(stat(kept(i).c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & ALLPERMS, 0640U);
  }
}

TEST_F(HardLinks, ThatAreRemovedKeepNoDescriptor) {
  make();
  const OpenedFile reader(kept(0), O_RDWR);
  const auto before = descriptors();
  for (int i = 0; i < kLinks; ++i) ASSERT_EQ(unlink(other(i).c_str()), 0) << i;
  EXPECT_LE(descriptors(), before + kMostKept);
  EXPECT_EQ(reader.read(1, 0), "0");
  EXPECT_EQ(pwrite(reader.get(), "0", 1, 0), 1);
  expectUsable();
}

TEST_F(HardLinks, ThatAreReplacedKeepNoDescriptor) {
  make();
  const auto before = descriptors();
  for (int i = 0; i < kLinks; ++i) {
    std::ofstream(at("new")) << "new";
    ASSERT_EQ(rename(at("new").c_str(), other(i).c_str()), 0) << i;
  }
  EXPECT_LE(descriptors(), before + kMostKept);
  expectUsable();
  EXPECT_EQ(contentOf(other(0)), "new");
}

constexpr const char* kCopying = "zarn.fill.copying";
constexpr std::size_t kLarge = 3'000'000;
constexpr off_t kFarInside = 2'000'000;

/// While nothing comes from the store.
class WhileContentIsAway : public MountNames {
 protected:
  WhileContentIsAway() : MountNames({kCopying}) {}
};

TEST_F(WhileContentIsAway, ASecondNameIsRefusedAtOnce) {
  const std::string content = someContent(kLarge, 1);
  makeAway("report", content);
  std::ofstream(at("here")) << "here";
  const OpenedFile file(at("report"), O_RDONLY);
  std::string read;
  Aside reading([&] {
    read = file.read(1, kFarInside);
    return 0;
  });
  EXPECT_TRUE(eventually([&] { return mounted_.isReached(kCopying); }));
  EXPECT_EQ(link(at("report").c_str(), at("second").c_str()), -1);
  EXPECT_EQ(errno, EPERM);
  EXPECT_EQ(link(at("here").c_str(), at("there").c_str()), 0);
  EXPECT_EQ(contentOf(at("there")), "here");
  EXPECT_FALSE(fs::exists(at("second")));
  EXPECT_EQ(std::distance(fs::directory_iterator(at("")), fs::directory_iterator()), 4);
  EXPECT_FALSE(reading.isDone());
  mounted_.openGate(kCopying);
  EXPECT_EQ(reading.result(), 0);
  EXPECT_EQ(read, content.substr(kFarInside, 1));
  EXPECT_EQ(link(at("report").c_str(), at("second").c_str()), 0);
  EXPECT_EQ(contentOf(at("second")), content);
}

TEST_F(WhileContentIsAway, WhoReadsWhatIsReplacedThenGetsItAsItWas) {
  const std::string content = someContent(kLarge, 1);
  makeAway("report", content);
  const OpenedFile file(at("report"), O_RDONLY);
  std::string read;
  Aside reading([&] {
    read = file.read(1, kFarInside);
    return 0;
  });
  EXPECT_TRUE(eventually([&] { return mounted_.isReached(kCopying); }));
  std::ofstream(at("new")) << "new";
  ASSERT_EQ(rename(at("new").c_str(), at("report").c_str()), 0);
  EXPECT_FALSE(reading.isDone());
  mounted_.openGate(kCopying);
  EXPECT_EQ(reading.result(), 0);
  EXPECT_EQ(read, content.substr(kFarInside, 1));
  EXPECT_EQ(file.read(content.size(), 0), content);
}

TEST_F(MountNames, ASecondNameIsRefusedAlsoOfWhatIsShownUnderAnotherName) {
  constexpr const char* kComposed = "caf\u00e9";
  constexpr const char* kDecomposed = "cafe\u0301";
  const std::string shown = std::string(kDecomposed) + " 2";
  std::ofstream(at(kComposed)) << "first";
  ASSERT_TRUE(isConfirmed(kComposed));
  std::ofstream(onDisk(kDecomposed)) << someContent(50'000, 2);
  ASSERT_TRUE(eventually([&] { return fs::exists(at(shown)); }));
  // The daemon has it under the name that it is shown under.
  ASSERT_TRUE(isConfirmed(shown));
  ASSERT_TRUE(eventually([&] { return client_.evict(onDisk(shown)) == nullptr; }));
  ASSERT_TRUE(eventually([&] { return bytesOnDisk(onDisk(kDecomposed)) <= 8192; }));
  EXPECT_EQ(link(at(shown).c_str(), at("second").c_str()), -1);
  EXPECT_EQ(errno, EPERM);
  EXPECT_EQ(contentOf(at(shown)), someContent(50'000, 2));
}

/// Two names that are the same to a person: one is shown with a number.
class ShownUnderAnotherName : public MountNames {
 protected:
  static constexpr const char* kComposed = "caf\u00e9";
  static constexpr const char* kDecomposed = "cafe\u0301";
  const std::string shown_ = std::string(kDecomposed) + " 2";

  void SetUp() override {
    std::ofstream(at(kComposed)) << "first";
    ASSERT_TRUE(isConfirmed(kComposed));
    std::ofstream(onDisk(kDecomposed)) << "second";
    ASSERT_TRUE(eventually([&] { return fs::exists(at(shown_)); }));
    ASSERT_TRUE(fs::exists(at(kDecomposed))) << "it can be looked up by its name on the disk";
  }
  void expectGoneByBoth() {
    EXPECT_TRUE(eventually([&] { return !fs::exists(at(shown_)); }));
    EXPECT_TRUE(eventually([&] { return !fs::exists(at(kDecomposed)); }));
  }
};

TEST_F(ShownUnderAnotherName, WhatIsRemovedElsewhereIsGoneByBoth) {
  fs::remove(onDisk(kDecomposed));
  expectGoneByBoth();
}

TEST_F(ShownUnderAnotherName, WhatIsRemovedIsGoneByBoth) {
  ASSERT_EQ(unlink(at(shown_).c_str()), 0);
  expectGoneByBoth();
}

TEST_F(ShownUnderAnotherName, WhatGetsAnotherNameIsGoneByBoth) {
  ASSERT_EQ(rename(at(shown_).c_str(), at("other").c_str()), 0);
  expectGoneByBoth();
  EXPECT_EQ(contentOf(at("other")), "second");
}

/// A document that is away, which somebody has open while it goes.
class OpenedAway : public MountNames {
 protected:
  void openIt() {
    makeAway("report", content_);
    file_.emplace(at("report"), O_RDONLY);
    ASSERT_GE(file_->get(), 0);
  }
  /// As another program saves it.
  void replaceIt() {
    std::ofstream(at("report.new")) << "new";
    ASSERT_EQ(rename(at("report.new").c_str(), at("report").c_str()), 0);
    ASSERT_TRUE(isConfirmed("report"));
  }
  void expectAll() {
    EXPECT_EQ(file_->read(1, kFarInside), content_.substr(kFarInside, 1));
    EXPECT_EQ(file_->read(content_.size(), 0), content_);
    struct stat status{};
    EXPECT_EQ(fstat(file_->get(), &status), 0);
    EXPECT_EQ(status.st_nlink, 0U);
    EXPECT_EQ(status.st_size, static_cast<off_t>(content_.size()));
  }

  const std::string content_ = someContent(kLarge, 3);
  std::optional<OpenedFile> file_;
};

TEST_F(OpenedAway, ThatIsReplacedIsReadAsItWas) {
  openIt();
  replaceIt();
  expectAll();
  EXPECT_EQ(contentOf(at("report")), "new");
}

TEST_F(OpenedAway, ThatIsReplacedAroundTheMountIsReadAsItWas) {
  openIt();
  std::ofstream(onDisk("report.new")) << "new";
  ASSERT_EQ(rename(onDisk("report.new").c_str(), onDisk("report").c_str()), 0);
  ASSERT_TRUE(isConfirmed("report"));
  EXPECT_EQ(file_->read(content_.size(), 0), content_);
}

TEST_F(OpenedAway, ThatIsRemovedIsReadAsItWas) {
  openIt();
  ASSERT_EQ(chmod(at("report").c_str(), 0400), 0);
  ASSERT_EQ(unlink(at("report").c_str()), 0);
  EXPECT_TRUE(eventually([&] { return mounted_.drive().names().empty(); }));
  expectAll();
}

TEST_F(OpenedAway, ThatIsRemovedCanBeMapped) {
  openIt();
  ASSERT_EQ(unlink(at("report").c_str()), 0);
  void* const bytes = mmap(nullptr, content_.size(), PROT_READ, MAP_PRIVATE, file_->get(), 0);
  ASSERT_NE(bytes, MAP_FAILED);
  EXPECT_EQ(std::string(static_cast<char*>(bytes), content_.size()), content_);
  munmap(bytes, content_.size());
}

TEST_F(OpenedAway, ThatIsReplacedComesWhenTheStoreIsBack) {
  openIt();
  replaceIt();
  goOffline();
  char byte = 0;
  EXPECT_EQ(pread(file_->get(), &byte, 1, kFarInside), -1);
  EXPECT_EQ(errno, ENETUNREACH);
  goOnline();
  expectAll();
}

TEST_F(OpenedAway, ThatIsRemovedCanBeWrittenTo) {
  openIt();
  const OpenedFile writer(at("report"), O_RDWR);
  ASSERT_EQ(unlink(at("report").c_str()), 0);
  EXPECT_EQ(pwrite(writer.get(), "new", 3, kFarInside), 3);
  std::string expected = content_;
  EXPECT_EQ(writer.read(content_.size(), 0), expected.replace(kFarInside, 3, "new"));
}

/// Moves of documents that are away. What needs their content waits for it.
class MovesOfWhatIsAway : public MountNames {
 protected:
  using MountNames::MountNames;

  void makeNotes() {
    std::ofstream(fs::path(mounted_.drive().home()).parent_path() /
                  "data/applications/org.example.Notes.desktop")
        << "[Desktop Entry]\nType=Application\nExec=true\nName=Notes\n"
           "X-Yomber-Container=org.example.Notes\n";
    ASSERT_TRUE(eventually([&] { return fs::is_directory(at("Notes")); }));
  }
  void makeShared(const std::string& name) {
    fs::create_directory(at(name));
    ASSERT_TRUE(eventually(
        [&] { return mounted_.drive().yomber({"share", "add", name, "bob"}).exitCode == 0; }));
  }
  int move(const std::string& from, const std::string& to, unsigned flags = 0) {
    return renameat2(AT_FDCWD, at(from).c_str(), AT_FDCWD, at(to).c_str(), flags) == 0 ? 0 : errno;
  }
  /// Of what the daemon does not know by a location of this container, too.
  [[nodiscard]] static bool isAwayAt(const std::string& path) {
    return getxattr(path.c_str(), "user.yomber.fault", nullptr, 0) >= 0 &&
           getxattr(path.c_str(), "user.yomber.filled", nullptr, 0) < 0;
  }

  const std::string content_ = someContent(50'000, 4);
};

TEST_F(MovesOfWhatIsAway, IntoAShareNeedTheContent) {
  makeShared("shared");
  fs::create_directory(at("own"));
  makeAway("report", content_);
  makeAway("other", content_);
  makeAway("own/inside", content_);
  EXPECT_EQ(move("report", "own/report"), 0);
  EXPECT_TRUE(isAwayAt(onDisk("own/report")));
  EXPECT_EQ(move("other", "shared/other"), 0);
  EXPECT_FALSE(isAwayAt(onDisk("shared/other")));
  EXPECT_EQ(contentOf(at("shared/other")), content_);
}

TEST_F(MovesOfWhatIsAway, OutOfAShareNeedTheContent) {
  makeShared("shared");
  makeAway("shared/report", content_);
  EXPECT_EQ(move("shared/report", "shared/renamed"), 0);
  EXPECT_TRUE(isAwayAt(onDisk("shared/renamed")));
  EXPECT_EQ(move("shared/renamed", "report"), 0);
  EXPECT_FALSE(isAwayAt(onDisk("report")));
}

TEST_F(MovesOfWhatIsAway, OutOfTheDriveNeedTheContent) {
  makeAway("report", content_);
  EXPECT_EQ(move("report", "report.part"), 0);
  EXPECT_FALSE(isAwayAt(onDisk("report.part")));
  EXPECT_EQ(contentOf(at("report.part")), content_);
}

TEST_F(MovesOfWhatIsAway, WithTheirFolderOutOfTheDriveAreCopies) {
  fs::create_directories(at("photos/2026"));
  makeAway("photos/2026/report", content_);
  EXPECT_EQ(move("photos", "photos.nosync"), EXDEV);
  EXPECT_TRUE(isAwayAt(onDisk("photos/2026/report")));
  const ProcessResult moved = runProcess({"/usr/bin/mv", at("photos"), at("photos.nosync")});
  EXPECT_EQ(moved.exitCode, 0) << moved.errors;
  EXPECT_FALSE(isAwayAt(onDisk("photos.nosync/2026/report")));
  EXPECT_EQ(contentOf(at("photos.nosync/2026/report")), content_);
  EXPECT_FALSE(fs::exists(at("photos")));
  // With what is here nobody has to do anything.
  EXPECT_EQ(move("photos.nosync", "photos"), 0);
  EXPECT_EQ(move("photos", "other.nosync"), 0);
}

TEST_F(MovesOfWhatIsAway, OutOfTheTrashIntoAnotherContainerNeedTheContent) {
  makeNotes();
  const std::string trash = ".Trash-" + std::to_string(getuid()) + "/files/";
  for (const char* name : {"report", "other"}) {
    makeAway(name, content_);
    ASSERT_EQ(mounted_.drive().yomber({"trash", name}).exitCode, 0);
    ASSERT_TRUE(eventually([&] { return fs::exists(at(trash + name)); }));
  }
  EXPECT_EQ(move(trash + "report", "report"), 0);
  EXPECT_TRUE(isAwayAt(onDisk("report")));
  EXPECT_EQ(move(trash + "other", "Notes/other"), 0);
  EXPECT_FALSE(isAwayAt(mounted_.drive().home() + "/tree/org.example.Notes/Documents/other"));
  EXPECT_EQ(contentOf(at("Notes/other")), content_);
}

TEST_F(MovesOfWhatIsAway, OfWhichTwoChangePlacesNeedTheContentOfBoth) {
  makeNotes();
  makeAway("report", content_);
  ASSERT_EQ(move("report", "Notes/report"), 0);
  const std::string there = mounted_.drive().home() + "/tree/org.example.Notes/Documents/report";
  using Upload = ContentClient::Upload;
  ASSERT_TRUE(eventually([&] { return client_.state(there).upload == Upload::CONFIRMED; }));
  ASSERT_TRUE(eventually([&] { return client_.evict(there) == nullptr; }));
  std::ofstream(at("here")) << "here";
  ASSERT_TRUE(isConfirmed("here"));
  EXPECT_EQ(move("here", "Notes/report", RENAME_EXCHANGE), 0);
  EXPECT_FALSE(isAwayAt(onDisk("here")));
  EXPECT_EQ(contentOf(at("here")), content_);
  EXPECT_EQ(contentOf(at("Notes/report")), "here");
}

TEST_F(MovesOfWhatIsAway, ToWhereTheyCannotBeAreRefused) {
  makeNotes();
  fs::create_directories(at("folder"));
  fs::create_directories(at("Notes/folder/full"));
  std::ofstream(at("report")) << "report";
  std::ofstream(at("Notes/report")) << "taken";
  EXPECT_EQ(move("report", "Notes/report", RENAME_NOREPLACE), EEXIST);
  EXPECT_EQ(move("folder", "Notes/folder"), ENOTEMPTY);
  EXPECT_EQ(move("report", "Notes/folder"), EISDIR);
  EXPECT_EQ(move("folder", "Notes/report"), ENOTDIR);
  EXPECT_EQ(move("report", "Notes/none", RENAME_EXCHANGE), ENOENT);
  EXPECT_EQ(move("folder/none", "Notes/none"), ENOENT);
}

}  // namespace
}  // namespace yomber::testing
