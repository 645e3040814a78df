// What meets in the mount: applications, and whoever fills a file that they use.
#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <string>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/foundation/file_time.h"
#include "platform/ostrell/constants.h"
#include "tests/harness/aside.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"
#include "tests/harness/stored_thumbnails.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kLarge = 3'000'000;
constexpr off_t kFarInside = 2'000'000;

constexpr const char* kCopying = "zarn.fill.copying";
/// Whoever fills a file comes there when somebody else wants to open it.
constexpr const char* kWanted = "zarn.fill.waited";

/// A file of which a reader wants the content, which is about to be copied into it.
class FilledFile : public MountFixture {
 protected:
  FilledFile(const std::vector<std::string>& gates, const std::vector<std::string>& failing)
      : MountFixture(gates, failing) {}

  void beginFilling() {
    makeAway("report", content_);
    reader_.emplace([this] {
      const OpenedFile file(at("report"), O_RDONLY);
      read_ = file.read(1, kFarInside);
      return 0;
    });
    EXPECT_TRUE(eventually([&] { return mounted_.isReached(kCopying); }));
  }
  void finishFilling() { mounted_.openGate(kCopying); }
  [[nodiscard]] std::string whatWasRead() {
    (void)reader_->result();
    return read_;
  }

  const std::string content_ = someContent(kLarge, 1);

 private:
  std::string read_;
  std::optional<Aside> reader_;
};

class WhileAFileIsFilled : public FilledFile {
 protected:
  WhileAFileIsFilled() : FilledFile({kCopying, kWanted}, {}) { mounted_.openGate(kWanted); }

  /// Of yomber-mount.
  [[nodiscard]] std::ptrdiff_t threads() const {
    const fs::path folder = "/proc/" + std::to_string(mounted_.pid()) + "/task";
    return std::distance(fs::directory_iterator(folder), fs::directory_iterator());
  }
  /// `change` waits for the content, and whoever fills the file is alone with it.
  void expectUndisturbed(const std::function<int()>& change) {
    beginFilling();
    Aside changing(change);
    EXPECT_TRUE(eventually([&] { return changing.isAsked(); }));
    finishFilling();
    EXPECT_EQ(changing.result(), 0);
    EXPECT_EQ(whatWasRead(), content_.substr(kFarInside, 1));
    EXPECT_FALSE(mounted_.isReached(kWanted));
  }
};

TEST_F(WhileAFileIsFilled, WhoEmptiesItWaits) {
  expectUndisturbed([this] { return truncate(at("report").c_str(), 0); });
  EXPECT_EQ(fs::file_size(onDisk("report")), 0U);
  EXPECT_TRUE(isConfirmed("report"));
}

TEST_F(WhileAFileIsFilled, WhoOpensItToWriteItAnewWaits) {
  expectUndisturbed([this] {
    const OpenedFile file(at("report"), O_WRONLY | O_TRUNC);
    return file.get() < 0 ? -1 : static_cast<int>(write(file.get(), "anew", 4));
  });
  EXPECT_EQ(contentOf(onDisk("report")), "anew");
}

TEST_F(WhileAFileIsFilled, WhoWritesIntoItWaits) {
  expectUndisturbed([this] {
    const OpenedFile file(at("report"), O_WRONLY);
    return static_cast<int>(pwrite(file.get(), "new", 3, kFarInside + 10));
  });
  EXPECT_EQ(contentOf(onDisk("report")), std::string(content_).replace(kFarInside + 10, 3, "new"));
}

TEST_F(WhileAFileIsFilled, WhatIsMappedHoldsUpNoNewsHoweverOftenItChanges) {
  constexpr std::ptrdiff_t kChanges = 20;
  std::ofstream(at("other")) << "before";
  EXPECT_TRUE(isConfirmed("other"));
  beginFilling();
  const OpenedFile file(at("report"), O_RDONLY);
  void* const bytes = mmap(nullptr, content_.size(), PROT_READ, MAP_SHARED, file.get(), 0);
  ASSERT_NE(bytes, MAP_FAILED);
  char byte = 0;
  Aside reading([&] {
    byte = static_cast<const char*>(bytes)[kFarInside];
    return 0;
  });
  EXPECT_TRUE(eventually([&] { return reading.isAsked(); }));
  EXPECT_EQ(fs::file_size(at("other")), 6U);
  // The kernel holds the page that is read until its content comes.
  const auto before = threads();
  for (int i = 0; i < kChanges; ++i) {
    const auto mode = static_cast<mode_t>(0600 + i);
    EXPECT_EQ(chmod(onDisk("report").c_str(), mode), 0);
    EXPECT_TRUE(eventually([&] {
      return (fs::status(at("report")).permissions() & fs::perms::all) == fs::perms(mode);
    }));
  }
  EXPECT_LT(threads(), before + kChanges / 2) << "each change keeps a thread";
  std::ofstream(onDisk("other")) << "and after";
  EXPECT_TRUE(eventually([&] { return fs::file_size(at("other")) == 9U; }));
  EXPECT_FALSE(reading.isDone());
  finishFilling();
  EXPECT_EQ(reading.result(), 0);
  EXPECT_EQ(byte, content_[kFarInside]);
  munmap(bytes, content_.size());
  EXPECT_EQ(whatWasRead(), content_.substr(kFarInside, 1));
}

TEST_F(WhileAFileIsFilled, WhoCutsItShortWaits) {
  expectUndisturbed([this] { return truncate(at("report").c_str(), kFarInside + 10); });
  EXPECT_EQ(contentOf(onDisk("report")), content_.substr(0, kFarInside + 10));
}

TEST_F(WhileAFileIsFilled, WhoOnlyWantsToKnowWhatItIsWaits) {
  expectUndisturbed([this] {
    const OpenedFile file(at("report"), O_RDONLY);
    return file.read(100, 0) == content_.substr(0, 100) ? 0 : -1;
  });
}

TEST_F(WhileAFileIsFilled, WhoSyncsItHasNothingToDo) {
  expectUndisturbed([this] {
    const OpenedFile file(at("report"), O_RDWR);
    return fsync(file.get());
  });
}

/// The dates of a file that is filled belong to whoever sets them.
class WhileDatesArePutBack : public FilledFile, public ::testing::WithParamInterface<const char*> {
 protected:
  WhileDatesArePutBack() : FilledFile({kCopying, GetParam()}, {}) {}

  [[nodiscard]] static std::int64_t dateOf(const std::string& path) {
    struct stat status{};
    EXPECT_EQ(stat(path.c_str(), &status), 0) << path;
    return nanosecondsOf(status.st_mtim);
  }
  [[nodiscard]] std::int64_t dateInStore() {
    const StoredThumbnails store(mounted_.drive());
    const auto record = store.recordOf(client_.identifierAt(onDisk("report")));
    const auto* const date = record->valueForKey<NSDate>(kQSRecordKeyModified);
    return date != nullptr ? date->nanoseconds() : 0;
  }
};

TEST_P(WhileDatesArePutBack, ADateThatIsSetStays) {
  constexpr std::int64_t kDate = 981'173'106'123'456'789;  // 2001
  if (GetParam() != std::string(kCopying)) mounted_.openGate(kCopying);
  beginFilling();
  EXPECT_TRUE(eventually([&] { return mounted_.isReached(GetParam()); }));
  const std::array<timespec, 2> times{timespecOf(kDate), timespecOf(kDate)};
  EXPECT_EQ(utimensat(AT_FDCWD, at("report").c_str(), times.data(), 0), 0);
  EXPECT_EQ(dateOf(at("report")), kDate);
  mounted_.openGate(GetParam());
  EXPECT_EQ(whatWasRead(), content_.substr(kFarInside, 1));
  EXPECT_EQ(dateOf(onDisk("report")), kDate);
  EXPECT_EQ(dateOf(at("report")), kDate);
  EXPECT_TRUE(isConfirmed("report"));
  EXPECT_EQ(dateInStore(), kDate);
}

INSTANTIATE_TEST_SUITE_P(Filling, WhileDatesArePutBack,
                         ::testing::Values(kCopying, "zarn.fill.verified", "zarn.fill.dated"),
                         [](const auto& point) {
                           const std::string name(point.param);
                           return name.substr(name.rfind('.') + 1);
                         });

/// Whoever fills gives way at once when somebody around the mount wants to write.
class WhileAFillingIsGivenUp : public FilledFile {
 protected:
  WhileAFillingIsGivenUp() : FilledFile({kCopying}, {kWanted}) {}

  [[nodiscard]] int afterIt(const std::function<int()>& change) {
    beginFilling();
    Aside changing(change);
    EXPECT_TRUE(eventually([&] { return changing.isAsked(); }));
    const OpenedFile writer(onDisk("report"), O_WRONLY | O_NONBLOCK);
    EXPECT_LT(writer.get(), 0);
    finishFilling();
    return changing.result();
  }
};

TEST_F(WhileAFillingIsGivenUp, WhoCutsTheFileShortTriesAgain) {
  EXPECT_EQ(afterIt([this] { return truncate(at("report").c_str(), kFarInside + 10); }), 0);
  EXPECT_EQ(contentOf(onDisk("report")), content_.substr(0, kFarInside + 10));
}

TEST_F(WhileAFillingIsGivenUp, WhoEmptiesTheFileNeedsNoContent) {
  EXPECT_EQ(afterIt([this] { return truncate(at("report").c_str(), 0); }), 0);
  EXPECT_EQ(fs::file_size(onDisk("report")), 0U);
  EXPECT_TRUE(isConfirmed("report"));
}

constexpr const char* kLooked = "mount.lookup.looked";
constexpr const char* kTold = "mount.lookup.told";
constexpr const char* kMoved = "mount.move.done";

/// A file that is moved over another one where the kernel looks every name up anew, which for those
/// that it has it does beside moves.
class WhileAFileIsMoved : public MountFixture {
 protected:
  WhileAFileIsMoved() : MountFixture({}, {}, {}, {kLooked, kTold, kMoved}) {
    fs::create_directory(at("w.nosync"));
    std::ofstream(at("w.nosync/a")) << "it";
    std::ofstream(at("w.nosync/b")) << "other";
    folder_.emplace(at("w.nosync"), O_PATH | O_DIRECTORY);
    // Nobody looks a name up for who has this.
    place_.emplace(at("w.nosync/a"), O_PATH);
  }

  /// Until the kernel has forgotten what it was told, and somebody comes to the gate for it.
  [[nodiscard]] int lookUntilReached(const char* name, const char* gate) const {
    int result = 0;
    (void)eventually([&] {
      // Which asks for nothing but the entry.
      result = openat(folder_->get(), name, O_PATH | O_CLOEXEC);
      if (result >= 0) close(result);
      return mounted_.isReached(gate);
    });
    return result;
  }
  [[nodiscard]] int move() const { return renameat(folder_->get(), "a", folder_->get(), "b"); }
  bool isReached(const char* gate) {
    return eventually([&] { return mounted_.isReached(gate); });
  }
  void expectThatItIsTheOneThatWasMoved() {
    const std::string path = "/proc/self/fd/" + std::to_string(place_->get());
    EXPECT_EQ(chmod(path.c_str(), 0610), 0) << std::strerror(errno);
    EXPECT_EQ(contentOf(path), "it");
    struct stat status{};
    ASSERT_EQ(stat(onDisk("w.nosync/b").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & ALLPERMS, 0610U);
    EXPECT_EQ(contentOf(at("w.nosync/b")), "it");
    EXPECT_FALSE(fs::exists(at("w.nosync/a")));
  }

  std::optional<OpenedFile> folder_;
  std::optional<OpenedFile> place_;
};

TEST_F(WhileAFileIsMoved, WhoHasLookedWhereItWasDoesNotTakeItBack) {
  mounted_.closeGate(kLooked);
  Aside looking([this] { return lookUntilReached("a", kLooked); });
  ASSERT_TRUE(isReached(kLooked));
  EXPECT_EQ(move(), 0);
  mounted_.openGate(kLooked);
  (void)looking.result();
  expectThatItIsTheOneThatWasMoved();
}

TEST_F(WhileAFileIsMoved, WhoLooksWhereItWillBeDoesNotTakeItForWhatWasThere) {
  mounted_.closeGate(kMoved);
  Aside moving([this] { return move(); });
  ASSERT_TRUE(isReached(kMoved));
  mounted_.closeGate(kTold);
  Aside looking([this] { return lookUntilReached("b", kTold); });
  ASSERT_TRUE(isReached(kTold));
  // Nor does it look again before that matters.
  mounted_.closeGate(kLooked);
  mounted_.openGate(kMoved);
  EXPECT_EQ(moving.result(), 0);
  expectThatItIsTheOneThatWasMoved();
  mounted_.openGate(kLooked);
  mounted_.openGate(kTold);
  EXPECT_EQ(looking.result(), 0);
}

TEST_F(WhileAFileIsMoved, WhoHasLookedWhereItWasRemovedDoesNotBringItBack) {
  mounted_.closeGate(kLooked);
  Aside looking([this] { return lookUntilReached("a", kLooked); });
  ASSERT_TRUE(isReached(kLooked));
  EXPECT_EQ(unlinkat(folder_->get(), "a", 0), 0);
  mounted_.openGate(kLooked);
  (void)looking.result();
  struct stat status{};
  EXPECT_EQ(fstat(place_->get(), &status), 0) << std::strerror(errno);
  EXPECT_EQ(contentOf("/proc/self/fd/" + std::to_string(place_->get())), "it");
}

/// Of two entries that change places one is seen where the other one is for us still.
class WhilePlacesAreChanged : public WhileAFileIsMoved {
 protected:
  /// `use` gets the location of what was in the place that is looked at.
  void expectUsable(const OpenedFile& place, const std::function<int(const std::string&)>& use) {
    mounted_.closeGate(kMoved);
    Aside moving(
        [this] { return renameat2(folder_->get(), "a", folder_->get(), "b", RENAME_EXCHANGE); });
    ASSERT_TRUE(isReached(kMoved));
    mounted_.closeGate(kTold);
    Aside looking([this] { return lookUntilReached("b", kTold); });
    ASSERT_TRUE(isReached(kTold));
    const std::string path = "/proc/self/fd/" + std::to_string(place.get());
    Aside using_([&] { return use(path); });
    EXPECT_TRUE(eventually([&] { return using_.isAsked(); }));
    mounted_.openGate(kMoved);
    EXPECT_EQ(using_.result(), 0);
    EXPECT_EQ(moving.result(), 0);
    mounted_.openGate(kTold);
    EXPECT_EQ(looking.result(), 0);
  }
};

TEST_F(WhilePlacesAreChanged, AFileIsOpenedOnceThatIsTold) {
  const OpenedFile other(at("w.nosync/b"), O_PATH);
  std::string read;
  expectUsable(other, [&](const std::string& path) {
    const OpenedFile file(path, O_RDONLY);
    read = file.read(100, 0);
    return file.get();
  });
  EXPECT_EQ(read, "other");
}

TEST_F(WhilePlacesAreChanged, AFolderIsListedOnceThatIsTold) {
  ASSERT_EQ(unlink(at("w.nosync/b").c_str()), 0);
  ASSERT_EQ(mkdir(at("w.nosync/b").c_str(), 0755), 0);
  const OpenedFile other(at("w.nosync/b"), O_PATH);
  expectUsable(other, [](const std::string& path) {
    std::error_code failure;
    const fs::directory_iterator entries(path, failure);
    errno = failure.value();
    return failure ? -1 : 0;
  });
}

}  // namespace
}  // namespace yomber::testing
