#include <gtest/gtest.h>
#include <sys/xattr.h>

#include <cerrno>
#include <csignal>
#include <set>
#include <vector>

#include "platform/fileprovider/file_operations.h"
#include "platform/fileprovider/file_operations_fixture.h"
#include "platform/foundation/fault_attributes.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

TEST_F(FileOperationsTest, RenamesInPlaceAndKeepsTheFile) {
  put("tree/old", "content");
  struct stat before{};
  stat(at("tree/old").c_str(), &before);
  const auto answer = rename(url("tree/old"), "new");
  EXPECT_EQ(answer.error, nullptr);
  EXPECT_EQ(answer.path(), at("tree/new"));
  EXPECT_FALSE(exists("tree/old"));
  struct stat after{};
  stat(at("tree/new").c_str(), &after);
  EXPECT_EQ(after.st_ino, before.st_ino);
}

TEST_F(FileOperationsTest, ItsOwnNameIsNoClash) {
  put("tree/file", "content");
  EXPECT_EQ(rename(url("tree/file"), "file").path(), at("tree/file"));
  EXPECT_EQ(move(url("tree/file"), url("tree")).path(), at("tree/file"));
  EXPECT_EQ(move(url("tree/file"), url("tree"), Bouncing::Allowed).path(), at("tree/file"));
  EXPECT_EQ(get("tree/file"), "content");
  EXPECT_TRUE(rename(url("tree/nothing"), "nothing").is(NSFileNoSuchFileError));
}

TEST_F(FileOperationsTest, ARenameNeverReplaces) {
  put("tree/one", "1");
  put("tree/two", "2");
  fs::create_directory(at("tree/empty"));
  const auto answer = rename(url("tree/one"), "two");
  EXPECT_TRUE(answer.is(NSFileWriteFileExistsError));
  EXPECT_EQ(fp_collidingURL(answer.error)->path(), at("tree/two"));
  EXPECT_TRUE(rename(url("tree/folder"), "empty").is(NSFileWriteFileExistsError));
  EXPECT_EQ(get("tree/one") + get("tree/two"), "12");
  EXPECT_TRUE(rename(url("tree/nothing"), "new").is(NSFileNoSuchFileError));
}

TEST_F(FileOperationsTest, OfManyRenamesToOneNameExactlyOneWins) {
  constexpr int kMany = 32;
  std::vector<std::future<OperationAnswer>> answers;
  for (int i = 0; i < kMany; ++i) {
    const std::string name = "tree/" + std::to_string(i);
    put(name, std::to_string(i));
    auto promise = std::make_shared<std::promise<OperationAnswer>>();
    answers.push_back(promise->get_future());
    fp_renameWithNewName(url(name), "wanted", [promise](NSURLRef placed, NSErrorRef error) {
      promise->set_value({std::move(placed), std::move(error), {}});
    });
  }
  int clashes = 0;
  for (auto& future : answers) {
    const auto answer = future.get();
    if (answer.error == nullptr) continue;
    EXPECT_TRUE(answer.is(NSFileWriteFileExistsError));
    ++clashes;
  }
  EXPECT_EQ(clashes, kMany - 1);
  EXPECT_EQ(count("tree"), static_cast<std::size_t>(kMany) + 1) << "nothing was lost";
}

TEST_F(FileOperationsTest, MovesUnderAFolderWithOrWithoutANewName) {
  put("tree/file", "content");
  EXPECT_EQ(move(url("tree/file"), url("tree/folder")).path(), at("tree/folder/file"));
  EXPECT_EQ(move(url("tree/folder/file"), url("tree"), "other").path(), at("tree/other"));
  EXPECT_EQ(get("tree/other"), "content");
  EXPECT_TRUE(move(url("tree/other"), url("tree/nowhere")).is(NSFileNoSuchFileError));
  EXPECT_TRUE(move(url("tree/nothing"), url("tree/folder")).is(NSFileNoSuchFileError));
}

TEST_F(FileOperationsTest, RefusesToMoveAFolderIntoItself) {
  fs::create_directory(at("tree/folder/inner"));
  const auto answer = move(url("tree/folder"), url("tree/folder/inner"));
  EXPECT_EQ(answer.number(), EINVAL);
  EXPECT_EQ(answer.error->localizedDescription(),
            at("tree/folder") + " cannot be moved into itself");
}

TEST_F(FileOperationsTest, BouncesToAFreeNameOnlyWhenAllowed) {
  put("tree/report.pdf", "third");
  put("tree/folder/report.pdf");
  put("tree/folder/report 2.pdf");
  const auto clash = move(url("tree/report.pdf"), url("tree/folder"), Bouncing::Forbidden);
  EXPECT_TRUE(clash.is(NSFileWriteFileExistsError));
  EXPECT_EQ(fp_collidingURL(clash.error)->path(), at("tree/folder/report.pdf"));
  const auto answer = move(url("tree/report.pdf"), url("tree/folder"), Bouncing::Allowed);
  EXPECT_EQ(answer.path(), at("tree/folder/report 3.pdf"));
  EXPECT_EQ(get("tree/folder/report 3.pdf"), "third");
}

TEST_F(FileOperationsTest, WhatLeavesATrashGetsBackTheNameThatItHad) {
  setFormerNameResolver([](const std::string& onDisk) {
    return std::optional(onDisk.ends_with("/odd") ? std::string("a/b") : std::string("report"));
  });
  put("tree/report 2", "first");
  put("tree/report 3", "second");
  put("tree/report 4", "third");
  put("tree/odd", "fourth");
  const auto to = [&](const std::string& name, Bouncing bouncing) {
    return move(url("tree/" + name), url("tree/folder"), bouncing).path();
  };
  EXPECT_EQ(to("report 2", Bouncing::Allowed), at("tree/folder/report"));
  EXPECT_EQ(to("report 3", Bouncing::Allowed), at("tree/folder/report 2"));
  EXPECT_EQ(to("report 4", Bouncing::Forbidden), at("tree/folder/report 4"));
  EXPECT_EQ(to("odd", Bouncing::Allowed), at("tree/folder/odd"));
  EXPECT_EQ(get("tree/folder/report"), "first");
}

TEST_F(FileOperationsTest, WhatIsAwayDoesNotLeaveTheDrive) {
  setDepartureRule([](const std::string& from, const std::string& to) {
    return !from.ends_with(".out") && to.ends_with(".out");
  });
  put("tree/here", "content");
  put("tree/away", "content");
  fs::create_directory(at("tree/both"));
  put("tree/both/away", "content");
  for (const char* const name : {"tree/away", "tree/both/away"}) {
    ASSERT_EQ(setxattr(at(name).c_str(), kFaultAttribute, "1", 1, 0), 0);
  }
  for (const std::string name : {"away", "both"}) {
    EXPECT_TRUE(rename(url("tree/" + name), name + ".out").is(NSUbiquitousFileUnavailableError));
    EXPECT_TRUE(exists("tree/" + name)) << name;
    EXPECT_FALSE(exists("tree/" + name + ".out")) << name;
    EXPECT_EQ(rename(url("tree/" + name), name + " new").path(), at("tree/" + name + " new"));
  }
  EXPECT_EQ(rename(url("tree/here"), "here.out").path(), at("tree/here.out"));
  EXPECT_TRUE(rename(url("tree/none"), "none.out").is(NSFileNoSuchFileError));
  setDepartureRule({});
}

TEST_F(FileOperationsTest, BouncesManyAtOnceEachToANameOfItsOwn) {
  constexpr int kMany = 16;
  std::vector<std::future<OperationAnswer>> answers;
  for (int i = 0; i < kMany; ++i) {
    const std::string folder = "tree/" + std::to_string(i);
    fs::create_directory(at(folder));
    put(folder + "/file", std::to_string(i));
    auto promise = std::make_shared<std::promise<OperationAnswer>>();
    answers.push_back(promise->get_future());
    fp_reparentUnderFolder(url(folder + "/file"), url("tree/folder"), Bouncing::Allowed,
                           [promise](NSURLRef placed, NSErrorRef error) {
                             promise->set_value({std::move(placed), std::move(error), {}});
                           });
  }
  std::set<std::string> places;
  for (auto& future : answers) places.insert(future.get().path());
  EXPECT_EQ(places.size(), static_cast<std::size_t>(kMany));
  EXPECT_EQ(count("tree/folder"), static_cast<std::size_t>(kMany));
}

TEST_F(FileOperationsTest, ActsOnThePhysicalFileAndAnswersTheLogicalLocation) {
  put("tree/on-disk", "content");
  setPhysicalLocationResolver([this](const NSURLRef& logical) {
    return logical->lastPathComponent() == "as shown" ? url("tree/on-disk") : nullptr;
  });
  EXPECT_TRUE(rename(url("tree/as shown"), "new").is(NSFileNoSuchFileError))
      << "without the mark the logical name counts";
  const auto marked = url("tree/as shown");
  marked->setMark(NSURL::Mark::Physical);
  EXPECT_EQ(rename(marked, "as shown").path(), at("tree/as shown"));
  EXPECT_TRUE(exists("tree/on-disk"));
  const auto moved = move(marked, url("tree/folder"));
  EXPECT_EQ(moved.path(), at("tree/folder/as shown"));
  EXPECT_FALSE(moved.url->hasMark(NSURL::Mark::Physical));
  EXPECT_EQ(get("tree/folder/as shown"), "content");
}

TEST_F(FileOperationsTest, DeletesThePhysicalFile) {
  put("tree/on-disk");
  put("tree/as shown", "somebody else's");
  setPhysicalLocationResolver([this](const NSURLRef&) { return url("tree/on-disk"); });
  const auto marked = url("tree/as shown");
  marked->setMark(NSURL::Mark::Physical);
  EXPECT_EQ(remove(marked).error, nullptr);
  EXPECT_FALSE(exists("tree/on-disk"));
  EXPECT_TRUE(exists("tree/as shown"));
}

TEST_F(FileOperationsTest, FindsAFolderThatHasAnotherNameOnThisDisk) {
  put("tree/file");
  setPhysicalLocationResolver([this](const NSURLRef& logical) {
    return logical->lastPathComponent() == "as shown" ? url("tree/folder") : nullptr;
  });
  EXPECT_EQ(move(url("tree/file"), url("tree/as shown")).path(), at("tree/as shown/file"));
  EXPECT_TRUE(exists("tree/folder/file"));
  EXPECT_EQ(makeFolder(url("tree/as shown"), "new").path(), at("tree/as shown/new"));
  EXPECT_TRUE(exists("tree/folder/new"));
}

TEST_F(FileOperationsTest, KeepsANameThatTheDiskCannotSay) {
  put("tree/on-disk", "content");
  setPhysicalLocationResolver([this](const NSURLRef& logical) {
    return logical->path().ends_with("shown") ? url("tree/on-disk") : nullptr;
  });
  // As long as a name may be, in a folder whose path leaves no room for it.
  std::string deep = "tree";
  while (at(deep).size() < 3'990) {
    deep += "/" + std::string(100, 'd');
    fs::create_directory(at(deep));
  }
  const auto marked = url("tree/" + std::string(200, 'x') + "shown");
  marked->setMark(NSURL::Mark::Physical);
  const auto moved = move(marked, url(deep));
  EXPECT_EQ(moved.error, nullptr);
  EXPECT_EQ(moved.path(), at(deep + "/" + std::string(200, 'x') + "shown"));
  EXPECT_EQ(get(deep + "/on-disk"), "content");
}

/// A second file system, where the machine has one that this user may write to.
class OtherFileSystem {
 public:
  OtherFileSystem() {
    std::string pattern = "/dev/shm/yomber-test.XXXXXX";
    if (mkdtemp(pattern.data()) != nullptr) path_ = pattern;
  }
  ~OtherFileSystem() {
    std::error_code ignored;
    if (!path_.empty()) fs::remove_all(path_, ignored);
  }
  OtherFileSystem(const OtherFileSystem&) = delete;
  OtherFileSystem& operator=(const OtherFileSystem&) = delete;

  [[nodiscard]] bool isAnother(const std::string& than) const {
    struct stat mine{};
    struct stat theirs{};
    return !path_.empty() && stat(path_.c_str(), &mine) == 0 && stat(than.c_str(), &theirs) == 0 &&
           mine.st_dev != theirs.st_dev;
  }
  [[nodiscard]] NSURLRef url(const std::string& name) const {
    return NSURL::fileURLWithPath(path_ + "/" + name);
  }

 private:
  std::string path_;
};

class FileOperationsAcrossTest : public FileOperationsTest {
 protected:
  void SetUp() override {
    if (!other_.isAnother(directory_.path())) {
      GTEST_SKIP() << "/dev/shm is no file system of its own here";
    }
  }
  /// False where that file system has no attributes of the user's.
  [[nodiscard]] static bool giveIdentity(const NSURLRef& file, const std::string& identity) {
    return setxattr(file->path().c_str(), "user.yomber.id", identity.data(), identity.size(), 0) ==
           0;
  }
  /// Of what lies in the tree.
  [[nodiscard]] std::optional<std::string> identityOf(const std::string& name) const {
    return NSFileManager::defaultManager().extendedAttribute(at(name), "user.yomber.id");
  }
  [[nodiscard]] static std::string getFrom(const NSURLRef& file) {
    std::ifstream stream(file->path(), std::ios::binary);
    return {std::istreambuf_iterator<char>(stream), {}};
  }
  OtherFileSystem other_;
};

TEST_F(FileOperationsAcrossTest, MovesByCopyingWithTheIdentity) {
  fs::create_directories(other_.url("folder/inner")->path());
  std::ofstream(other_.url("folder/inner/file")->path()) << "content";
  const bool isPossible =
      giveIdentity(other_.url("folder"), "7") && giveIdentity(other_.url("folder/inner/file"), "8");
  if (!isPossible) GTEST_SKIP() << "/dev/shm keeps no attributes here";
  const auto answer = move(other_.url("folder"), url("tree"), "moved");
  EXPECT_EQ(answer.error, nullptr) << answer.error->description();
  EXPECT_EQ(get("tree/moved/inner/file"), "content");
  EXPECT_EQ(identityOf("tree/moved"), "7");
  EXPECT_EQ(identityOf("tree/moved/inner/file"), "8");
  EXPECT_FALSE(fs::exists(other_.url("folder")->path()));
  EXPECT_EQ(count("staging"), 0U);
}

TEST_F(FileOperationsAcrossTest, AMoveThatCannotFinishLeavesTheSource) {
  std::ofstream(other_.url("file")->path()) << "content";
  ASSERT_EQ(FaultPoint::arm("fileprovider.move.copy-in-place=error"), nullptr);
  EXPECT_EQ(move(other_.url("file"), url("tree")).number(), EIO);
  EXPECT_TRUE(fs::exists(other_.url("file")->path()));
  EXPECT_FALSE(exists("tree/file"));
}

TEST_F(FileOperationsAcrossTest, WhatDiesBetweenTheCopyAndTheRemovalLosesNothing) {
  std::ofstream(other_.url("file")->path()) << "content";
  EXPECT_EXIT(
      {
        (void)FaultPoint::arm("fileprovider.move.copy-in-place=abort");
        const NSURLRef source = other_.url("file");
        (void)moveFile({source, source->path()}, {{url("tree"), at("tree")}, "file"});
      },
      testing::KilledBySignal(SIGABRT), "");
  EXPECT_EQ(getFrom(other_.url("file")), "content");
  EXPECT_EQ(get("tree/file"), "content");
  EXPECT_EQ(count("tree"), 2U) << "the copy, and the folder that was there";
  EXPECT_EQ(count("staging"), 0U);
  // Who tries again is told of the copy, and may move it under another name.
  EXPECT_TRUE(move(other_.url("file"), url("tree")).is(NSFileWriteFileExistsError));
  EXPECT_EQ(getFrom(other_.url("file")), "content");
  EXPECT_EQ(move(other_.url("file"), url("tree"), "again").path(), at("tree/again"));
  EXPECT_EQ(get("tree/file") + get("tree/again"), "contentcontent");
}

TEST_F(FileOperationsAcrossTest, StagesBesideTheDestinationWhenTheStagingFolderIsElsewhere) {
  setStagingFolder(other_.url("staging")->path());
  put("source", "content");
  EXPECT_EQ(import(url("source"), url("tree/folder")).error, nullptr);
  EXPECT_EQ(get("tree/folder/source"), "content");
  EXPECT_EQ(count("tree/folder"), 1U);
}

TEST_F(FileOperationsAcrossTest, BouncesAndClashesAsAnyOtherMove) {
  std::ofstream(other_.url("report.pdf")->path()) << "content";
  put("tree/report.pdf", "first");
  EXPECT_TRUE(move(other_.url("report.pdf"), url("tree")).is(NSFileWriteFileExistsError));
  EXPECT_EQ(move(other_.url("report.pdf"), url("tree"), Bouncing::Allowed).path(),
            at("tree/report 2.pdf"));
}

}  // namespace
}  // namespace yomber
