#include "platform/fileprovider/file_operations.h"

#include <gtest/gtest.h>
#include <sys/resource.h>

#include <cerrno>
#include <csignal>

#include "platform/fileprovider/file_operations_fixture.h"
#include "platform/foundation/fault_attributes.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

TEST_F(FileOperationsTest, AnswersNilOnceOnAThreadOfThePool) {
  const auto caller = std::this_thread::get_id();
  for (const auto& answer : {import(nullptr, url("tree")), import(url("tree/folder"), nullptr),
                             makeFolder(nullptr, "name"), rename(nullptr, "name"),
                             move(nullptr, url("tree")), move(url("tree/folder"), nullptr),
                             move(nullptr, url("tree"), Bouncing::Allowed), remove(nullptr)}) {
    EXPECT_TRUE(answer.is(NSFileNoSuchFileError));
    EXPECT_EQ(answer.url, nullptr);
    EXPECT_NE(answer.thread, caller);
  }
  const auto done = makeFolder(url("tree"), "new");
  EXPECT_EQ(done.error, nullptr);
  EXPECT_NE(done.thread, caller);
}

TEST_F(FileOperationsTest, TakesEmptyHandlers) {
  put("source");
  fp_importUnderFolder(nullptr, nullptr, nullptr);
  fp_createSubFolder(nullptr, "", nullptr);
  fp_renameWithNewName(nullptr, "", nullptr);
  fp_reparentUnderFolder(nullptr, nullptr, std::nullopt, nullptr);
  fp_reparentUnderFolder(nullptr, nullptr, Bouncing::Allowed, nullptr);
  fp_deleteWithCompletionHandler(nullptr, nullptr);
  fp_coordinatedDeleteWithHandler(nullptr, nullptr);
  EXPECT_EQ(import(url("source"), url("tree")).error, nullptr);
}

TEST_F(FileOperationsTest, ImportsACopyAndLeavesTheSource) {
  put("source", "content");
  setxattr(at("source").c_str(), "user.xdg.tags", "red", 3, 0);
  setxattr(at("source").c_str(), "user.yomber.id", "7", 1, 0);
  const auto answer = import(url("source"), url("tree/folder"));
  EXPECT_EQ(answer.error, nullptr);
  EXPECT_EQ(answer.path(), at("tree/folder/source"));
  EXPECT_EQ(get("tree/folder/source"), "content");
  EXPECT_EQ(get("source"), "content");
  const auto& files = NSFileManager::defaultManager();
  EXPECT_EQ(files.extendedAttribute(at("tree/folder/source"), "user.xdg.tags"), "red");
  EXPECT_EQ(files.extendedAttribute(at("tree/folder/source"), "user.yomber.id"), std::nullopt);
  EXPECT_EQ(count("staging"), 0U);
}

TEST_F(FileOperationsTest, ImportsFoldersAndLinksAsTheyAre) {
  fs::create_directories(at("source/inner"));
  put("source/inner/file", "deep");
  fs::create_symlink("inner/file", at("source/link"));
  fs::create_symlink("/nowhere", at("dangling"));
  EXPECT_EQ(import(url("source"), url("tree")).error, nullptr);
  EXPECT_EQ(get("tree/source/inner/file"), "deep");
  EXPECT_EQ(fs::read_symlink(at("tree/source/link")), "inner/file");
  EXPECT_EQ(import(url("dangling"), url("tree")).error, nullptr);
  EXPECT_EQ(fs::read_symlink(at("tree/dangling")), "/nowhere");
}

TEST_F(FileOperationsTest, ImportsAFolderThatMayNotBeWritten) {
  chmod(directory_.path().c_str(), 0777);
  const WithoutPrivileges ordinary;
  fs::create_directories(at("own/shut"));
  put("own/shut/file", "x");
  fs::create_directories(at("own/tree"));
  chmod(at("own/shut").c_str(), 0555);
  EXPECT_EQ(import(url("own/shut"), url("own/tree")).error, nullptr);
  struct stat status{};
  ASSERT_EQ(stat(at("own/tree/shut").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777U, 0555U);
  chmod(at("own/shut").c_str(), 0755);
  chmod(at("own/tree/shut").c_str(), 0755);
}

TEST_F(FileOperationsTest, ReportsAClashWithTheLocationInTheWay) {
  put("source", "new");
  put("tree/source", "old");
  const auto answer = import(url("source"), url("tree"));
  EXPECT_TRUE(answer.is(NSFileWriteFileExistsError));
  ASSERT_NE(fp_collidingURL(answer.error), nullptr);
  EXPECT_EQ(fp_collidingURL(answer.error)->path(), at("tree/source"));
  EXPECT_EQ(get("tree/source"), "old");
  EXPECT_EQ(count("staging"), 0U);
  EXPECT_EQ(fp_collidingURL(nullptr), nullptr);
  EXPECT_EQ(fp_collidingURL(NSError::errorWithDomain(NSCocoaErrorDomain, 516)), nullptr);
}

TEST_F(FileOperationsTest, NeverReplacesWhatAppearedWhileACopyWasMade) {
  put("source", "new");
  const std::string gate = at("gate");
  ASSERT_EQ(FaultPoint::arm("fileprovider.copy.staged=pause-until-file:" + gate), nullptr);
  std::promise<OperationAnswer> answered;
  fp_importUnderFolder(url("source"), url("tree"), [&](NSURLRef placed, NSErrorRef error) {
    answered.set_value({std::move(placed), std::move(error), {}});
  });
  while (!exists("gate.reached")) std::this_thread::yield();
  EXPECT_FALSE(exists("tree/source")) << "nothing half-made ever shows";
  put("tree/source", "other");
  put("gate");
  const auto answer = answered.get_future().get();
  EXPECT_TRUE(answer.is(NSFileWriteFileExistsError));
  EXPECT_EQ(get("tree/source"), "other");
}

TEST_F(FileOperationsTest, CleansUpAfterAnImportThatFailed) {
  fs::create_directory(at("source"));
  put("source/file", "x");
  ASSERT_EQ(FaultPoint::arm("fileprovider.copy.staged=error"), nullptr);
  EXPECT_EQ(import(url("source"), url("tree")).number(), EIO);
  EXPECT_FALSE(exists("tree/source"));
  EXPECT_EQ(count("staging"), 0U);
}

TEST_F(FileOperationsTest, CleansUpWhenTheNameDoesNotReachTheDisk) {
  put("file");
  fs::create_directories(at("source/below"));
  put("source/below/file");
  ASSERT_EQ(FaultPoint::arm("fileprovider.copy.name-synced=error"), nullptr);
  for (const char* name : {"file", "source"}) {
    EXPECT_EQ(import(url(name), url("tree/folder")).number(), EIO) << name;
    EXPECT_EQ(count("tree/folder"), 0U) << name;
    EXPECT_TRUE(fs::exists(at(name)));
  }
  FaultPoint::disarmAll();
  for (const char* name : {"file", "source"}) {
    EXPECT_TRUE(import(url(name), url("tree/folder")).url) << name;
  }
}

TEST_F(FileOperationsTest, CleansUpWhatACrashLeft) {
  put("source", "content");
  EXPECT_EXIT(
      {
        (void)FaultPoint::arm("fileprovider.copy.staged=abort");
        (void)importHere("source", "tree");
      },
      testing::KilledBySignal(SIGABRT), "");
  EXPECT_EQ(count("staging"), 1U) << "the crash left its copy";
  EXPECT_FALSE(exists("tree/source"));
  EXPECT_EQ(import(url("source"), url("tree")).error, nullptr);
  EXPECT_EQ(count("staging"), 0U);
  EXPECT_EQ(get("tree/source"), "content");
}

TEST_F(FileOperationsTest, StagesInTheFolderItselfWithoutAStagingFolder) {
  setStagingFolder({});
  put("source", "content");
  EXPECT_EQ(import(url("source"), url("tree/folder")).error, nullptr);
  EXPECT_EQ(get("tree/folder/source"), "content");
  EXPECT_EQ(count("tree/folder"), 1U);
}

TEST_F(FileOperationsTest, SaysWhatCannotBeImported) {
  EXPECT_TRUE(import(url("nothing"), url("tree")).is(NSFileNoSuchFileError));
  put("source");
  EXPECT_TRUE(import(url("source"), url("nowhere")).is(NSFileNoSuchFileError));
  EXPECT_EQ(import(url("source"), url("source")).number(), ENOTDIR);
  setxattr(at("source").c_str(), kFaultAttribute, "x", 1, 0);
  EXPECT_TRUE(import(url("source"), url("tree")).is(NSUbiquitousFileUnavailableError));
  EXPECT_EQ(count("tree"), 1U);
}

TEST_F(FileOperationsTest, CleansUpWhenTheDiskTakesNoMore) {
  put("source", std::string(100'000, 'x'));
  const auto importWithLittleRoom = [this] {
    rlimit small{};
    small.rlim_cur = small.rlim_max = 4'096;
    (void)std::signal(SIGXFSZ, SIG_IGN);
    (void)setrlimit(RLIMIT_FSIZE, &small);
    const NSErrorRef error = importHere("source", "tree").error;
    const bool isTooLarge = error != nullptr && error->code() == NSFileWriteUnknownError &&
                            error->underlyingError()->code() == EFBIG;
    _exit(isTooLarge ? 0 : 1);
  };
  EXPECT_EXIT(importWithLittleRoom(), testing::ExitedWithCode(0), "");
  EXPECT_FALSE(exists("tree/source"));
  EXPECT_EQ(count("staging"), 0U);
}

TEST_F(FileOperationsTest, CreatesAFolderOnce) {
  const auto first = makeFolder(url("tree"), "new");
  EXPECT_EQ(first.error, nullptr);
  EXPECT_EQ(first.path(), at("tree/new"));
  put("tree/new/file", "kept");
  const auto second = makeFolder(url("tree"), "new");
  EXPECT_EQ(second.error, nullptr) << "a folder that exists is the answer";
  EXPECT_EQ(second.path(), at("tree/new"));
  EXPECT_EQ(get("tree/new/file"), "kept");
}

TEST_F(FileOperationsTest, OnlyWhatIsNoFolderIsInTheWayOfOne) {
  put("tree/file");
  fs::create_directory_symlink(at("tree/folder"), at("tree/link"));
  for (const char* const name : {"file", "link"}) {
    const auto answer = makeFolder(url("tree"), name);
    EXPECT_TRUE(answer.is(NSFileWriteFileExistsError)) << name;
    EXPECT_EQ(fp_collidingURL(answer.error)->path(), at(std::string("tree/") + name));
  }
  EXPECT_TRUE(makeFolder(url("nowhere"), "new").is(NSFileNoSuchFileError));
}

TEST_F(FileOperationsTest, RefusesNamesThatNoFileCanHave) {
  put("tree/file");
  for (const auto& name : {std::string(), std::string("."), std::string(".."), std::string("a/b"),
                           std::string("a\0b", 3), std::string(256, 'n')}) {
    EXPECT_TRUE(makeFolder(url("tree"), name).is(NSFileWriteInvalidFileNameError)) << name;
    EXPECT_TRUE(rename(url("tree/file"), name).is(NSFileWriteInvalidFileNameError)) << name;
    EXPECT_TRUE(
        move(url("tree/file"), url("tree/folder"), name).is(NSFileWriteInvalidFileNameError))
        << name;
  }
  EXPECT_TRUE(import(NSURL::fileURLWithPath("/"), url("tree")).is(NSFileWriteInvalidFileNameError));
  EXPECT_TRUE(exists("tree/file"));
}

TEST_F(FileOperationsTest, TakesOddNamesAsTheyAre) {
  for (const std::string& name : {std::string(255, 'n'), std::string("\xff\xfe"),
                                  std::string("line\nbreak"), std::string(".~lock.x#")}) {
    EXPECT_EQ(makeFolder(url("tree"), name).path(), at("tree/" + name));
    EXPECT_TRUE(exists("tree/" + name));
  }
}

TEST_F(FileOperationsTest, RefusesWhereTheUserMayNotWrite) {
  chmod(directory_.path().c_str(), 0777);
  const WithoutPrivileges ordinary;
  fs::create_directories(at("own/shut"));
  chmod(at("own/shut").c_str(), 0555);
  const auto answer = makeFolder(url("own/shut"), "new");
  EXPECT_TRUE(answer.is(NSFileWriteNoPermissionError));
  EXPECT_EQ(answer.number(), EACCES);
}

TEST_F(FileOperationsTest, DeletesFilesLinksAndTrees) {
  put("tree/file");
  fs::create_directory_symlink(at("tree/folder"), at("tree/link"));
  fs::create_directories(at("tree/many/in/ner"));
  put("tree/many/in/ner/file");
  put("tree/folder/kept");
  for (const char* const name : {"tree/file", "tree/link", "tree/many"}) {
    EXPECT_EQ(remove(url(name)).error, nullptr);
    EXPECT_FALSE(exists(name));
  }
  EXPECT_TRUE(exists("tree/folder/kept")) << "a link's target is not the link";
  EXPECT_EQ(count("staging"), 0U);
  EXPECT_TRUE(remove(url("tree/file")).is(NSFileNoSuchFileError));
  EXPECT_EQ(remove(NSURL::fileURLWithPath("/")).number(), EBUSY);
}

TEST_F(FileOperationsTest, ATreeThatIsDeletedDisappearsAtOnceAlsoInACrash) {
  fs::create_directories(at("tree/many/inner"));
  put("tree/many/inner/file");
  EXPECT_EXIT(
      {
        (void)FaultPoint::arm("fileprovider.delete.taken-away=abort");
        (void)removeHere("tree/many");
      },
      testing::KilledBySignal(SIGABRT), "");
  EXPECT_FALSE(exists("tree/many"));
  EXPECT_EQ(count("staging"), 1U);
  put("source");
  EXPECT_EQ(import(url("source"), url("tree")).error, nullptr);
  EXPECT_EQ(count("staging"), 0U) << "the next operation finishes it";
}

TEST_F(FileOperationsTest, DeletesATreeInPlaceWithoutAStagingFolder) {
  setStagingFolder({});
  fs::create_directories(at("tree/many/inner"));
  EXPECT_EQ(remove(url("tree/many")).error, nullptr);
  EXPECT_FALSE(exists("tree/many"));
}

TEST_F(FileOperationsTest, CoordinatesADeletionBeforeItReturns) {
  put("tree/file");
  const auto file = url("tree/file");
  file->setMark(NSURL::Mark::Physical);
  int calls = 0;
  fp_coordinatedDeleteWithHandler(file, [&](const NSURLRef& acted, const NSErrorRef& error) {
    ++calls;
    EXPECT_EQ(acted, file) << "the very location, marks and all";
    EXPECT_EQ(error, nullptr);
  });
  EXPECT_EQ(calls, 1);
  for (const auto& nothing : {NSURLRef(), url("tree/nothing")}) {
    fp_coordinatedDeleteWithHandler(nothing, [&](const NSURLRef& acted, const NSErrorRef& error) {
      ++calls;
      EXPECT_EQ(acted, nullptr);
      EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFileNoSuchFileError));
    });
  }
  EXPECT_EQ(calls, 3);
  EXPECT_TRUE(exists("tree/file"));
}

}  // namespace
}  // namespace yomber
