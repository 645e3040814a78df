// What meets in the mount: applications, and whoever fills a file that they use.
#include <array>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>

#include <fcntl.h>
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

TEST_F(WhileAFileIsFilled, WhatIsMappedHoldsUpNoNewsOfOtherFiles) {
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
  EXPECT_EQ(chmod(onDisk("report").c_str(), 0600), 0);
  EXPECT_TRUE(eventually([&] {
    return (fs::status(at("report")).permissions() & fs::perms::all) == fs::perms(0600);
  }));
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

}  // namespace
}  // namespace yomber::testing
