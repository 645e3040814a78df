// The drive as a folder: content that comes when it is read, changes that show, and processes that
// end.
#include <array>
#include <atomic>
#include <csignal>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <optional>
#include <thread>

#include <fcntl.h>
#include <linux/magic.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/utsname.h>
#include <sys/vfs.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/foundation/stopped_process.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"
#include "tests/harness/mount_kind.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kKept = 4096;

/// A shell command's output; the test fails when it does.
std::string shell(const std::string& command) {
  const ProcessResult result = runProcess({"/bin/sh", "-c", command});
  EXPECT_EQ(result.exitCode, 0) << command << "\n" << result.errors;
  return result.output;
}

/// Since Linux 6.9.
bool canPassThrough() {
  utsname machine{};
  EXPECT_EQ(uname(&machine), 0);
  int major = 0;
  int minor = 0;
  EXPECT_EQ(std::sscanf(machine.release, "%d.%d", &major, &minor), 2);
  return major > 6 || (major == 6 && minor >= 9);
}

class Mount : public MountFixture {};

TEST_F(Mount, ContentThatIsAwayComesWithTheFirstRead) {
  const std::string content = someContent(3'000'000, 1);
  makeAway("report", content);
  EXPECT_LE(bytesOnDisk(onDisk("report")), 2 * kKept);
  EXPECT_TRUE(eventually([&] { return bytesOnDisk(at("report")) <= 2 * kKept; }));
  EXPECT_EQ(fs::file_size(at("report")), content.size());
  EXPECT_EQ(contentOf(at("report")), content);
  EXPECT_GE(bytesOnDisk(onDisk("report")), content.size());
  EXPECT_TRUE(eventually([&] { return bytesOnDisk(at("report")) >= content.size(); }));
}

TEST_F(Mount, TheKernelReadsByItselfWhereItIsToAndNowhereElse) {
  const auto bytesReadByTheMount = [&] {
    std::ifstream counters("/proc/" + std::to_string(mounted_.pid()) + "/io");
    std::string name;
    long value = -1;
    for (counters >> name >> value; counters && name != "rchar:";) counters >> name >> value;
    return value;
  };
  constexpr long kBytes = 3'000'000;
  std::ofstream(onDisk("report")) << someContent(kBytes, 16);
  ASSERT_TRUE(eventually([&] { return fs::exists(at("report")); }));
  const long before = bytesReadByTheMount();
  ASSERT_GE(before, 0);
  EXPECT_EQ(contentOf(at("report")).size(), static_cast<std::size_t>(kBytes));
  const bool isItself = mountKind() == MountKind::Best && geteuid() == 0 && canPassThrough();
  if (isItself) {
    EXPECT_LT(bytesReadByTheMount() - before, kBytes);
  } else {
    EXPECT_GE(bytesReadByTheMount() - before, kBytes);
  }
}

TEST_F(Mount, LookingAtAFileFetchesNothing) {
  makeAway("report", someContent(100'000, 2));
  shell("ls -la '" + mounted_.folder() + "'; find '" + mounted_.folder() +
        "' -printf '%p %s %T@ %b\\n'");
  {
    const OpenedFile reader(at("report"), O_RDONLY);
    const OpenedFile writer(at("report"), O_RDWR);
    ASSERT_GE(writer.get(), 0);
    struct stat status{};
    EXPECT_EQ(fstat(writer.get(), &status), 0);
    EXPECT_EQ(fsync(writer.get()), 0);
    EXPECT_EQ(fchmod(writer.get(), 0600), 0);
    EXPECT_EQ(lseek(reader.get(), 0, SEEK_END), 100'000);
  }
  EXPECT_EQ(rename(at("report").c_str(), at("renamed").c_str()), 0);
  EXPECT_EQ(setxattr(at("renamed").c_str(), "user.comment", "x", 1, 0), 0);
  EXPECT_TRUE(eventually([&] { return isAway("renamed"); }));
}

TEST_F(Mount, WhoOnlyWantsToKnowWhatItIsGetsThatFromWhatIsKept) {
  const std::string content = someContent(100'000, 3);
  makeAway("report", content);
  {
    const OpenedFile file(at("report"), O_RDONLY);
    EXPECT_EQ(file.read(kKept, 0), content.substr(0, kKept));
    EXPECT_EQ(file.read(100, 1000), content.substr(1000, 100));
    EXPECT_EQ(file.read(100, 200'000), "");
    EXPECT_TRUE(isAway("report"));
    EXPECT_EQ(file.read(kKept, 1), content.substr(1, kKept));
  }
  EXPECT_FALSE(isAway("report"));
}

TEST_F(Mount, AThousandDocumentsThatAreAwayAreShownWithoutADownload) {
  constexpr int kDocuments = 1000;
  fs::create_directory(at("many"));
  for (int i = 0; i < kDocuments; ++i) {
    std::ofstream(at("many/" + std::to_string(i))) << someContent(6000, 7);
  }
  for (int i = 0; i < kDocuments; ++i) ASSERT_TRUE(isConfirmed("many/" + std::to_string(i))) << i;
  ASSERT_EQ(mounted_.drive().yomber({"evict", "many"}, std::chrono::minutes(5)).exitCode, 0);
  // As a file manager does: list, look at each, and read the beginning.
  int shown = 0;
  for (const auto& entry : fs::directory_iterator(at("many"))) {
    EXPECT_EQ(entry.file_size(), 6000U);
    const OpenedFile file(entry.path(), O_RDONLY);
    EXPECT_EQ(file.read(kKept, 0).size(), kKept);
    ++shown;
  }
  EXPECT_EQ(shown, kDocuments);
  int away = 0;
  for (int i = 0; i < kDocuments; ++i) away += isAway("many/" + std::to_string(i)) ? 1 : 0;
  EXPECT_EQ(away, kDocuments);
}

TEST_F(Mount, WritingIntoWhatIsAwayKeepsTheRestOfIt) {
  std::string content = someContent(50'000, 4);
  makeAway("report", content);
  {
    const OpenedFile file(at("report"), O_WRONLY);
    EXPECT_EQ(pwrite(file.get(), "new", 3, 20'000), 3);
  }
  content.replace(20'000, 3, "new");
  EXPECT_EQ(contentOf(at("report")), content);
  ASSERT_TRUE(isConfirmed("report"));
  evict("report");
  EXPECT_EQ(contentOf(at("report")), content);
}

TEST_F(Mount, AMapOfWhatIsAwayHasTheContent) {
  const std::string content = someContent(50'000, 5);
  makeAway("report", content);
  const OpenedFile file(at("report"), O_RDONLY);
  void* const bytes = mmap(nullptr, content.size(), PROT_READ, MAP_PRIVATE, file.get(), 0);
  ASSERT_NE(bytes, MAP_FAILED);
  EXPECT_EQ(std::string(static_cast<char*>(bytes), content.size()), content);
  munmap(bytes, content.size());
}

TEST_F(Mount, EmptyingWhatIsAwayFetchesNothing) {
  makeAway("opened", someContent(50'000, 6));
  makeAway("truncated", someContent(50'000, 6));
  goOffline();
  {
    const OpenedFile file(at("opened"), O_WRONLY | O_TRUNC);
  }
  EXPECT_EQ(truncate(at("truncated").c_str(), 0), 0);
  for (const char* name : {"opened", "truncated"}) {
    EXPECT_EQ(fs::file_size(at(name)), 0U) << name;
    std::ofstream(at(name)) << "anew";
    EXPECT_EQ(contentOf(at(name)), "anew") << name;
  }
  goOnline();
  EXPECT_TRUE(isConfirmed("opened"));
  EXPECT_TRUE(isConfirmed("truncated"));
  EXPECT_EQ(contentOf(onDisk("opened")), "anew");
}

TEST_F(Mount, CuttingShortWhatIsAwayKeepsItsBeginning) {
  const std::string content = someContent(50'000, 7);
  makeAway("report", content);
  EXPECT_EQ(truncate(at("report").c_str(), 30'000), 0);
  EXPECT_EQ(contentOf(at("report")), content.substr(0, 30'000));
}

TEST_F(Mount, WhatSomebodyWritesToAroundTheMountCannotBeCutShort) {
  makeAway("report", someContent(50'000, 7));
  const OpenedFile writer(onDisk("report"), O_WRONLY);
  EXPECT_EQ(truncate(at("report").c_str(), 30'000), -1);
  EXPECT_EQ(errno, EBUSY);
}

TEST_F(Mount, WhatSomebodyWritesIntoTheKeptBytesAroundTheMountIsNotTakenForTheContent) {
  const std::string content = someContent(50'000, 7);
  makeAway("report", content);
  struct stat before{};
  ASSERT_EQ(stat(onDisk("report").c_str(), &before), 0);
  {
    const OpenedFile writer(onDisk("report"), O_WRONLY);
    ASSERT_EQ(pwrite(writer.get(), "written", 7, 10), 7);
    const std::array<timespec, 2> dates{before.st_atim, before.st_mtim};
    ASSERT_EQ(futimens(writer.get(), dates.data()), 0);
  }
  EXPECT_EQ(OpenedFile(at("report"), O_RDONLY).read(100, 0), content.substr(0, 100));
  EXPECT_EQ(contentOf(at("report 2")).substr(10, 7), "written");
}

TEST_F(Mount, WhatIsAwayIsAllData) {
  const std::string content = someContent(50'000, 8);
  makeAway("report", content);
  {
    const OpenedFile file(at("report"), O_RDONLY);
    EXPECT_EQ(lseek(file.get(), 0, SEEK_DATA), 0);
    EXPECT_EQ(lseek(file.get(), 20'000, SEEK_DATA), 20'000);
    EXPECT_EQ(lseek(file.get(), 0, SEEK_HOLE), 50'000);
    EXPECT_EQ(lseek(file.get(), 50'000, SEEK_DATA), -1);
    EXPECT_EQ(errno, ENXIO);
    EXPECT_TRUE(isAway("report"));
  }
  shell("cp --sparse=always '" + at("report") + "' '" + at("copy") + "'");
  EXPECT_EQ(contentOf(at("copy")), content);
}

TEST_F(Mount, WithoutTheStoreAReadFailsSoonAndTheRestGoesOn) {
  const std::string content = someContent(50'000, 9);
  makeAway("away", content);
  std::ofstream(at("here")) << "here";
  goOffline();
  const OpenedFile file(at("away"), O_RDONLY);
  char byte = 0;
  EXPECT_EQ(pread(file.get(), &byte, 1, 40'000), -1);
  EXPECT_EQ(errno, ENETUNREACH);
  EXPECT_EQ(contentOf(at("here")), "here");
  EXPECT_EQ(file.read(100, 0), content.substr(0, 100));
  goOnline();
  EXPECT_TRUE(eventually([&] { return file.read(1, 40'000) == content.substr(40'000, 1); }));
}

TEST_F(Mount, TheDrivesOwnAttributesAreNobodyElsesBusiness) {
  std::ofstream(at("report")) << "content";
  ASSERT_TRUE(isConfirmed("report"));
  ASSERT_GT(getxattr(onDisk("report").c_str(), "user.yomber.id", nullptr, 0), 0);
  std::array<char, 256> names{};
  EXPECT_EQ(listxattr(at("report").c_str(), names.data(), names.size()), 0);
  EXPECT_EQ(getxattr(at("report").c_str(), "user.yomber.id", names.data(), names.size()), -1);
  EXPECT_EQ(errno, ENODATA);
  EXPECT_EQ(setxattr(at("report").c_str(), "user.yomber.id", "1", 1, 0), -1);
  EXPECT_EQ(errno, EPERM);
  EXPECT_EQ(removexattr(at("report").c_str(), "user.yomber.id"), -1);
}

TEST_F(Mount, TagsAreTheDrives) {
  std::ofstream(at("report")) << "content";
  ASSERT_EQ(setxattr(at("report").c_str(), "user.xdg.tags", "red", 3, 0), 0);
  EXPECT_TRUE(eventually([&] {
    return mounted_.drive().json({"stat", "report"}).at(0).dump().find("red") != std::string::npos;
  }));
  ASSERT_EQ(mounted_.drive().yomber({"tag", "report", "blue"}).exitCode, 0);
  EXPECT_TRUE(eventually([&] {
    std::array<char, 64> tags{};
    return getxattr(at("report").c_str(), "user.xdg.tags", tags.data(), tags.size()) > 0 &&
           std::string(tags.data()).find("blue") != std::string::npos;
  }));
}

TEST_F(Mount, ChangesMadeElsewhereShowAlthoughTheKernelKeepsWhatItKnows) {
  fs::create_directory(at("d"));
  std::ofstream(at("d/changed")) << "before";
  std::ofstream(at("d/gone")) << "x";
  std::ofstream(at("d/moved")) << "x";
  ASSERT_TRUE(isConfirmed("d/moved"));
  shell("ls -la '" + at("d") + "'");
  EXPECT_FALSE(fs::exists(at("d/new")));

  std::ofstream(onDisk("d/changed")) << "and after";
  fs::remove(onDisk("d/gone"));
  fs::rename(onDisk("d/moved"), onDisk("elsewhere"));
  std::ofstream(onDisk("d/new")) << "x";
  fs::permissions(onDisk("d"), fs::perms(0750));

  EXPECT_TRUE(eventually([&] { return contentOf(at("d/changed")) == "and after"; }));
  EXPECT_TRUE(eventually([&] { return fs::file_size(at("d/changed")) == 9; }));
  EXPECT_TRUE(eventually([&] { return !fs::exists(at("d/gone")); }));
  EXPECT_TRUE(eventually([&] { return fs::exists(at("elsewhere")); }));
  EXPECT_TRUE(eventually([&] { return !fs::exists(at("d/moved")); }));
  EXPECT_TRUE(eventually([&] { return fs::exists(at("d/new")); }));
  EXPECT_TRUE(eventually(
      [&] { return (fs::status(at("d")).permissions() & fs::perms::all) == fs::perms(0750); }));
  EXPECT_TRUE(eventually([&] { return shell("ls '" + at("d") + "'") == "changed\nnew\n"; }));
}

TEST_F(Mount, WhatOthersAppendMeanwhileIsNotOverwritten) {
  std::ofstream(at("log")) << "one ";
  const OpenedFile ours(at("log"), O_WRONLY | O_APPEND);
  for (int i = 0; i < 20; ++i) {
    std::ofstream(onDisk("log"), std::ios::app) << "theirs ";
    ASSERT_EQ(write(ours.get(), "ours ", 5), 5);
  }
  std::string expected = "one ";
  for (int i = 0; i < 20; ++i) expected += "theirs ours ";
  EXPECT_EQ(contentOf(onDisk("log")), expected);
}

TEST_F(Mount, WhatWasJustMadeByAnotherIsNotOpenedForWhoeverWouldHaveMadeIt) {
  if (geteuid() != 0) GTEST_SKIP() << "needs a second user";
  chmod(mounted_.folder().c_str(), 0755);
  fs::create_directory(at("open"));
  fs::permissions(at("open"), fs::perms(0777));
  for (int i = 0; i < 20; ++i) {
    const std::string name = "open/" + std::to_string(i);
    EXPECT_FALSE(fs::exists(at(name)));  // which the kernel keeps
    std::ofstream(onDisk(name)) << "secret";
    ASSERT_EQ(chmod(onDisk(name).c_str(), 0600), 0);
    const pid_t child = fork();
    if (child == 0) {
      if (setresuid(65534, 65534, 65534) != 0) _exit(3);
      _exit(open(at(name).c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644) < 0 ? 0 : 1);
    }
    int status = -1;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
    EXPECT_EQ(contentOf(onDisk(name)), "secret");
  }
}

TEST_F(Mount, WhatTheDriveDoesShows) {
  const std::string content = someContent(20'000, 10);
  std::ofstream(at("report")) << content;
  ASSERT_TRUE(isConfirmed("report"));
  ASSERT_EQ(mounted_.drive().yomber({"rename", "report", "final"}).exitCode, 0);
  EXPECT_TRUE(eventually([&] { return fs::exists(at("final")) && !fs::exists(at("report")); }));
  evict("final");
  EXPECT_TRUE(eventually([&] { return bytesOnDisk(at("final")) <= 2 * kKept; }));
  ASSERT_EQ(mounted_.drive().yomber({"trash", "final"}).exitCode, 0);
  EXPECT_TRUE(eventually([&] { return !fs::exists(at("final")); }));
  const std::string trash = at(".Trash-" + std::to_string(getuid()));
  EXPECT_EQ(contentOf(trash + "/files/final"), content);
  EXPECT_TRUE(eventually([&] { return fs::exists(trash + "/info/final.trashinfo"); }));
}

TEST_F(Mount, AFileManagersTrashIsTheDrives) {
  std::ofstream(at("report")) << "content";
  ASSERT_TRUE(isConfirmed("report"));
  const std::string trash = at(".Trash-" + std::to_string(getuid()));
  std::ofstream(trash + "/info/report.trashinfo")
      << "[Trash Info]\nPath=report\nDeletionDate=2026-11-21T12:00:00\n";
  ASSERT_EQ(rename(at("report").c_str(), (trash + "/files/report").c_str()), 0);
  EXPECT_TRUE(eventually([&] {
    const auto listed = mounted_.drive().json({"trash", "--list"});
    return listed.size() == 1 && listed[0].dump().find("report") != std::string::npos;
  }));
  EXPECT_EQ(rmdir(trash.c_str()), -1);
  EXPECT_EQ(errno, EBUSY);
}

TEST_F(Mount, AnApplicationsFolderIsShownByItsName) {
  std::ofstream(fs::path(mounted_.drive().home()).parent_path() /
                "data/applications/org.example.Notes.desktop")
      << "[Desktop Entry]\nType=Application\nExec=true\nName=Notes\n"
         "X-Yomber-Container=org.example.Notes\n";
  ASSERT_TRUE(eventually([&] { return fs::is_directory(at("Notes")); }));
  std::ofstream(at("Notes/page")) << "text";
  EXPECT_EQ(contentOf(mounted_.drive().home() + "/tree/org.example.Notes/Documents/page"), "text");
  EXPECT_NE(shell("ls '" + mounted_.folder() + "'").find("Notes\n"), std::string::npos);
  EXPECT_EQ(rename(at("Notes").c_str(), at("Other").c_str()), -1);
  EXPECT_EQ(errno, EBUSY);
  EXPECT_EQ(mkdir(at("Notes").c_str(), 0755), -1);
  EXPECT_EQ(errno, EEXIST);
  // Across folders of applications, what is here and what is away.
  std::ofstream(at("here")) << "here";
  EXPECT_EQ(rename(at("here").c_str(), at("Notes/here").c_str()), 0);
  EXPECT_EQ(contentOf(at("Notes/here")), "here");
  const std::string content = someContent(20'000, 11);
  makeAway("away", content);
  EXPECT_EQ(rename(at("away").c_str(), at("Notes/away").c_str()), 0);
  EXPECT_EQ(contentOf(at("Notes/away")), content);
}

TEST_F(Mount, AReaderThatIsInterruptedWaitsNoLonger) {
  makeAway("report", someContent(50'000, 12));
  // The daemon stops, as if its network were slow.
  std::optional<StoppedProcess> zarn(mounted_.drive().pidOf(TestDrive::Process::Zarn));
  const pid_t reader = fork();
  if (reader == 0) {
    const int file = open(at("report").c_str(), O_RDONLY);
    char byte = 0;
    _exit(pread(file, &byte, 1, 30'000) == 1 ? 0 : 1);
  }
  ASSERT_TRUE(eventually([&] {
    std::ifstream stack("/proc/" + std::to_string(reader) + "/wchan");
    std::string where;
    stack >> where;
    return where.find("fuse") != std::string::npos || where.find("request") != std::string::npos;
  }));
  ::kill(reader, SIGKILL);
  int status = 0;
  EXPECT_EQ(waitpid(reader, &status, 0), reader);
  EXPECT_TRUE(WIFSIGNALED(status));
  zarn.reset();
  EXPECT_EQ(contentOf(at("report")).size(), 50'000U);
}

TEST_F(Mount, WhoHadAFileOpenBeforeItGotSetIDBitsTakesThemAwayWithAWrite) {
  std::ofstream(at("program")) << "harmless";
  const OpenedFile writer(at("program"), O_WRONLY);
  ASSERT_EQ(chmod(at("program").c_str(), 04755), 0);
  // Root may leave them.
  const pid_t child = fork();
  if (child == 0) {
    if (geteuid() == 0 && setresuid(65534, 65534, 65534) != 0) _exit(3);
    _exit(pwrite(writer.get(), "x", 1, 0) == 1 ? 0 : 1);
  }
  int ended = -1;
  ASSERT_EQ(waitpid(child, &ended, 0), child);
  ASSERT_EQ(ended, 0);
  EXPECT_TRUE(eventually([&] {
    struct stat status{};
    return stat(at("program").c_str(), &status) == 0 && (status.st_mode & S_ISUID) == 0;
  }));
}

TEST_F(Mount, AHostThatIsStuckIsNoticedByWhoWaitsForContent) {
  makeAway("report", someContent(50'000, 15));
  std::optional<StoppedProcess> host(mounted_.drive().pidOf(TestDrive::Process::Host));
  const OpenedFile file(at("report"), O_RDONLY);
  char byte = 0;
  EXPECT_EQ(pread(file.get(), &byte, 1, 30'000), -1);
  EXPECT_EQ(errno, EIO);
  host.reset();
  EXPECT_TRUE(eventually([&] { return file.read(1, 30'000).size() == 1; }));
}

TEST_F(Mount, WhatIsOpenAndWhatIsHereStayUsableWhoeverDies) {
  const std::string content = someContent(50'000, 13);
  makeAway("away", content);
  std::ofstream(at("here")) << "here";
  const OpenedFile open(at("here"), O_RDWR);
  using Process = TestDrive::Process;
  for (const Process process : {Process::Extension, Process::Host, Process::Zarn}) {
    mounted_.drive().kill(process);
    EXPECT_EQ(open.read(4, 0), "here");
    EXPECT_EQ(pwrite(open.get(), "HERE", 4, 0), 4);
    EXPECT_EQ(pwrite(open.get(), "here", 4, 0), 4);
    EXPECT_EQ(contentOf(at("here")), "here");
    std::ofstream(at("new")) << "new";
    EXPECT_EQ(contentOf(at("new")), "new");
    fs::remove(at("new"));
  }
  // And the rest comes back by itself.
  EXPECT_TRUE(eventually([&] { return contentOf(at("away")) == content; }));
}

TEST_F(Mount, AKilledMountIsMountedAgain) {
  std::ofstream(at("report")) << "content";
  ASSERT_EQ(::kill(mounted_.pid(), SIGKILL), 0);
  EXPECT_TRUE(eventually([&] { return contentOf(at("report")) == "content"; }));
}

TEST_F(Mount, AMountThatItsUserTookAwayStaysAway) {
  std::ofstream(at("report")) << "content";
  EXPECT_EQ(mounted_.drive().status().value("mount", ""), mounted_.folder());
  ASSERT_TRUE(mounted_.takeAway());
  EXPECT_TRUE(eventually(
      [&] { return mounted_.drive().json({"unmount"}).at(0).at("was_mounted") == false; }));
  struct statfs status{};
  ASSERT_EQ(statfs(mounted_.folder().c_str(), &status), 0);
  EXPECT_NE(status.f_type, FUSE_SUPER_MAGIC);
  mounted_.mount();
  EXPECT_EQ(contentOf(at("report")), "content");
}

TEST_F(Mount, KeepsNoDescriptorForWhatItMerelyKnows) {
  const auto descriptors = [&] {
    const fs::path folder = "/proc/" + std::to_string(mounted_.pid()) + "/fd";
    return std::distance(fs::directory_iterator(folder), fs::directory_iterator());
  };
  fs::create_directory(at("d"));
  const auto before = descriptors();
  for (int i = 0; i < 1000; ++i) {
    std::ofstream(at("d/" + std::to_string(i))) << i;
    fs::create_directory(at("d/f" + std::to_string(i)));
  }
  shell("find '" + mounted_.folder() + "' -type f -exec cat {} + | wc -c");
  constexpr int kFoldersKept = 128;
  EXPECT_TRUE(eventually([&] { return descriptors() <= before + kFoldersKept + 16; }));
}

TEST_F(Mount, ContentBeyondWhatIsToBeKeptIsGivenUpTheLongestUnusedFirst) {
  mounted_.unmount();
  mounted_.mount({"--keep", "1M"});
  const std::string content = someContent(400'000, 14);
  const std::vector<std::string> names{"pinned", "old", "older", "used", "new"};
  std::ofstream(at("pinned")) << content;
  ASSERT_EQ(mounted_.drive().yomber({"pin", "pinned"}).exitCode, 0);
  for (const std::string& name : names) std::ofstream(at(name)) << content;
  for (const std::string& name : names) ASSERT_TRUE(isConfirmed(name)) << name;
  EXPECT_EQ(contentOf(at("used")), content);
  std::ofstream(at("new"), std::ios::app) << "more";
  const auto bytesHere = [&] {
    std::uint64_t sum = 0;
    for (const std::string& name : names) sum += bytesOnDisk(onDisk(name));
    return sum;
  };
  EXPECT_TRUE(eventually([&] { return bytesHere() <= (1U << 20U) + 2 * kKept; }));
  EXPECT_FALSE(isAway("pinned"));
  EXPECT_FALSE(isAway("new"));
  EXPECT_TRUE(isAway("old"));
  EXPECT_TRUE(isAway("older"));
  EXPECT_EQ(contentOf(at("old")), content);
}

TEST_F(Mount, IsRefusedWhereItCannotBe) {
  const auto refused = [&](const std::string& folder) {
    mounted_.unmount();
    const ProcessResult result = mounted_.drive().yomber({"mount", folder});
    EXPECT_NE(result.exitCode, 0) << folder;
    EXPECT_FALSE(result.errors.empty()) << folder;
  };
  refused("/none/such");
  refused("/etc");
  refused("/etc/passwd");
  refused(mounted_.drive().home() + "/private");
}

}  // namespace
}  // namespace yomber::testing
