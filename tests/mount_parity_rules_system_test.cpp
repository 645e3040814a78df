// The mount beside the disk: who may do what, what is too long or too large, and which dates
// whatever is done changes.
#include <csignal>
#include <cstring>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include <dirent.h>
#include <fcntl.h>
#include <linux/falloc.h>
#include <linux/fs.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/parity_fixture.h"

namespace yomber::testing {
namespace {

constexpr uid_t kNobody = 65534;
constexpr uid_t kSomebody = 54321;

/// Does something as another user, with no group but the one given.
void as(uid_t user, gid_t group, const std::function<void()>& work) {
  EXPECT_EQ(setgroups(0, nullptr), 0);
  EXPECT_EQ(setegid(group), 0);
  EXPECT_EQ(seteuid(user), 0);
  work();
  EXPECT_EQ(seteuid(0), 0);
  EXPECT_EQ(setegid(0), 0);
}
void as(uid_t user, const std::function<void()>& work) { as(user, user, work); }

/// A child's end: its exit code, or the negative of its errno as it says it.
long endOf(pid_t child) {
  int status = -1;
  return waitpid(child, &status, 0) == child && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

/// What a path may be given to.
using Call = std::pair<const char*, std::function<long(const char* path, const char* other)>>;

const std::vector<Call>& callsWithPaths() {
  static const std::vector<Call> all{
      {"open", [](auto* p, auto*) { return close(open(p, O_RDONLY)); }},
      {"create", [](auto* p, auto*) { return close(open(p, O_WRONLY | O_CREAT, 0644)); }},
      {"create anew",
       [](auto* p, auto*) { return close(open(p, O_WRONLY | O_CREAT | O_EXCL, 0644)); }},
      {"stat",
       [](auto* p, auto*) {
         struct stat status{};
         return stat(p, &status);
       }},
      {"lstat",
       [](auto* p, auto*) {
         struct stat status{};
         return lstat(p, &status);
       }},
      {"access", [](auto* p, auto*) { return access(p, F_OK); }},
      {"mkdir", [](auto* p, auto*) { return mkdir(p, 0755); }},
      {"rmdir", [](auto* p, auto*) { return rmdir(p); }},
      {"mkfifo", [](auto* p, auto*) { return mkfifo(p, 0644); }},
      {"unlink", [](auto* p, auto*) { return unlink(p); }},
      {"rename from", [](auto* p, auto* other) { return rename(p, other); }},
      {"rename to", [](auto* p, auto* other) { return rename(other, p); }},
      {"link from", [](auto* p, auto* other) { return link(p, other); }},
      {"link to", [](auto* p, auto* other) { return link(other, p); }},
      {"symlink", [](auto* p, auto*) { return symlink("x", p); }},
      {"readlink",
       [](auto* p, auto*) {
         char target[16];
         return readlink(p, target, sizeof target);
       }},
      {"chmod", [](auto* p, auto*) { return chmod(p, 0600); }},
      {"chown", [](auto* p, auto*) { return chown(p, getuid(), getgid()); }},
      {"lchown", [](auto* p, auto*) { return lchown(p, getuid(), getgid()); }},
      {"truncate", [](auto* p, auto*) { return truncate(p, 0); }},
      {"utimens", [](auto* p, auto*) { return utimensat(AT_FDCWD, p, nullptr, 0); }},
      {"setxattr", [](auto* p, auto*) { return setxattr(p, "user.x", "y", 1, 0); }},
      {"getxattr", [](auto* p, auto*) { return getxattr(p, "user.x", nullptr, 0); }},
      {"listxattr", [](auto* p, auto*) { return listxattr(p, nullptr, 0); }},
      {"removexattr", [](auto* p, auto*) { return removexattr(p, "user.x"); }},
      {"statvfs",
       [](auto* p, auto*) {
         struct statvfs status{};
         return statvfs(p, &status);
       }},
      {"chdir", [](auto* p, auto*) { return chdir(p); }},
      {"opendir",
       [](auto* p, auto*) {
         DIR* const folder = opendir(p);
         return folder != nullptr ? closedir(folder) : -1;
       }},
  };
  return all;
}

void callAll(Bench& b, const std::string& what, const std::string& path) {
  for (const auto& [name, call] : callsWithPaths()) {
    b.note((what + ", " + name).c_str(), call(path.c_str(), b.at("other").c_str()));
  }
}

const std::vector<Case>& limits() {
  static const std::vector<Case> all{
      {"names that are too long",
       [](Bench& b) {
         b.made("other", "x");
         callAll(b, "a name", b.at(std::string(256, 'n')));
         callAll(b, "a folder's", b.at(std::string(256, 'n')) + "/x");
         callAll(b, "a path", b.at(std::string(PATH_MAX, '/') + "x"));
         b.names(".");
       }},
      {"links that lead nowhere",
       [](Bench& b) {
         b.made("other", "x");
         b.note("loop", symlink("round", b.at("loop").c_str()));
         b.note("round", symlink("loop", b.at("round").c_str()));
         callAll(b, "through a loop", b.at("loop/x"));
         for (const auto& [name, call] : callsWithPaths()) {
           // These take the link itself.
           const bool isOfTheLink = std::strncmp(name, "rename", 6) == 0 ||
                                    std::strncmp(name, "link", 4) == 0 ||
                                    std::strcmp(name, "unlink") == 0;
           if (!isOfTheLink) {
             b.note((std::string("a loop, ") + name).c_str(),
                    call(b.at("loop").c_str(), b.at("other").c_str()));
           }
         }
         b.names(".");
       }},
      {"files that are too large",
       [](Bench& b) {
         const int file = b.file("a", "0123456789");
         constexpr off_t kFar = 1L << 62;
         b.note("write far behind", pwrite(file, "x", 1, kFar));
         b.note("truncate", ftruncate(file, kFar));
         b.note("by name", truncate(b.at("a").c_str(), kFar));
         b.note("allocate", fallocate(file, 0, kFar, 10));
         b.note("allocate beyond all", fallocate(file, 0, INT64_MAX - 1, 10));
         rlimit before{};
         getrlimit(RLIMIT_FSIZE, &before);
         const rlimit small{.rlim_cur = 8192, .rlim_max = before.rlim_max};
         auto* const handler = std::signal(SIGXFSZ, SIG_IGN);
         setrlimit(RLIMIT_FSIZE, &small);
         const std::string bytes(3000, 'b');
         b.note("within the limit", pwrite(file, bytes.data(), bytes.size(), 1000));
         b.note("over its end", pwrite(file, bytes.data(), bytes.size(), 7000));
         b.note("behind it", pwrite(file, bytes.data(), bytes.size(), 8192));
         b.note("truncate to it", ftruncate(file, 8192));
         b.note("truncate behind it", ftruncate(file, 8193));
         b.note("by name", truncate(b.at("a").c_str(), 8193));
         b.note("allocate behind it", fallocate(file, 0, 8000, 200));
         setrlimit(RLIMIT_FSIZE, &before);
         (void)std::signal(SIGXFSZ, handler);
         close(file);
         b.look("a");
         b.content("a");
       }},
      {"space by the book",
       [](Bench& b) {
         const int file = b.file("a", "x");
         const auto note = [&](const char* what, int failure) {
           errno = failure;
           b.note(what, failure == 0 ? 0 : -1);
         };
         note("allocate", posix_fallocate(file, 0, 50'000));
         b.look("a");
         note("within", posix_fallocate(file, 10, 10));
         note("nothing", posix_fallocate(file, 0, 0));
         note("negative", posix_fallocate(file, -1, 10));
         close(file);
         const int reader = open(b.at("a").c_str(), O_RDONLY);
         note("of a reader", posix_fallocate(reader, 0, 10));
         close(reader);
         b.content("a");
       }},
      {"locks between processes",
       [](Bench& b) {
         const int file = b.file("a", "0123456789");
         struct flock range{};
         range.l_type = F_WRLCK;
         range.l_len = 4;
         b.note("lock", fcntl(file, F_SETLK, &range));
         const auto inAnotherProcess = [&](const char* what, short type, off_t start) {
           const pid_t child = fork();
           if (child == 0) {
             const int other = open(b.at("a").c_str(), O_RDWR);
             struct flock wanted{};
             wanted.l_type = type;
             wanted.l_start = start;
             wanted.l_len = 2;
             _exit(fcntl(other, F_SETLK, &wanted) == 0 ? 0 : errno);
           }
           b.note(what, endOf(child));
         };
         inAnotherProcess("the same", F_WRLCK, 2);
         inAnotherProcess("to read", F_RDLCK, 0);
         inAnotherProcess("beside", F_WRLCK, 4);
         range.l_type = F_RDLCK;
         b.note("share", fcntl(file, F_SETLK, &range));
         inAnotherProcess("to read", F_RDLCK, 0);
         inAnotherProcess("to write", F_WRLCK, 0);
         close(open(b.at("a").c_str(), O_RDONLY));  // any close lets go of them all
         inAnotherProcess("to write", F_WRLCK, 0);
         close(file);
       }},
      {"programs",
       [](Bench& b) {
         std::error_code failure;
         std::filesystem::copy_file("/bin/cat", b.at("cat"), failure);
         b.say(failure.message());
         b.note("chmod", chmod(b.at("cat").c_str(), 0755));
         int input[2];
         int output[2];
         EXPECT_TRUE(pipe2(input, O_CLOEXEC) == 0 && pipe2(output, O_CLOEXEC) == 0);
         b.settle("cat");
         const pid_t child = fork();
         if (child == 0) {
           dup2(input[0], STDIN_FILENO);
           dup2(output[1], STDOUT_FILENO);
           execl(b.at("cat").c_str(), "cat", nullptr);
           _exit(errno);
         }
         char byte = 0;
         b.note("asked", write(input[1], "x", 1));
         b.note("answered", read(output[0], &byte, 1));
         b.note("write to what runs", open(b.at("cat").c_str(), O_WRONLY));
         b.note("truncate it", truncate(b.at("cat").c_str(), 10));
         b.note("remove it", unlink(b.at("cat").c_str()));
         close(input[1]);
         b.note("it ends", endOf(child));
         for (const int end : {input[0], output[0], output[1]}) close(end);
         const int script = b.file("script", "#!/bin/sh\nexit 7\n", 0755);
         const auto run = [&](const char* what) {
           const pid_t runner = fork();
           if (runner == 0) {
             execl(b.at("script").c_str(), "script", nullptr);
             _exit(errno);
           }
           b.note(what, endOf(runner));
         };
         run("while it is written");
         close(script);
         b.settle("script");
         run("afterwards");
         b.note("chmod", chmod(b.at("script").c_str(), 0644));
         run("no program");
       }},
  };
  return all;
}

/// Root makes things, others try themselves at them.
const std::vector<Case>& permissions() {
  static const std::vector<Case> all{
      {"a sticky folder",
       [](Bench& b) {
         b.note("mkdir", mkdir(b.at("d").c_str(), 0777));
         b.note("sticky", chmod(b.at("d").c_str(), 01777));
         b.note("mkdir", mkdir(b.at("free").c_str(), 0777));
         b.note("free", chmod(b.at("free").c_str(), 0777));
         as(kNobody, [&] {
           b.made("d/a", "nobody's");
           b.note("mkdir", mkdir(b.at("d/sub").c_str(), 0777));
           b.made("d/victim");
         });
         as(kSomebody, [&] {
           b.made("d/mine");
           b.note("unlink", unlink(b.at("d/a").c_str()));
           b.note("rmdir", rmdir(b.at("d/sub").c_str()));
           b.note("rename", rename(b.at("d/a").c_str(), b.at("d/b").c_str()));
           b.note("out of it", rename(b.at("d/a").c_str(), b.at("free/a").c_str()));
           b.note("over it", rename(b.at("d/mine").c_str(), b.at("d/victim").c_str()));
           b.note("exchange", renameat2(AT_FDCWD, b.at("d/mine").c_str(), AT_FDCWD,
                                        b.at("d/a").c_str(), RENAME_EXCHANGE));
           b.note("one's own", rename(b.at("d/mine").c_str(), b.at("d/mine 2").c_str()));
           b.note("one's own", unlink(b.at("d/mine 2").c_str()));
         });
         as(kNobody, [&] { b.note("its owner", unlink(b.at("d/a").c_str())); });
         b.names("d");
       }},
      {"folders that may not be searched",
       [](Bench& b) {
         b.note("mkdir", mkdir(b.at("d").c_str(), 0700));
         b.made("d/other", "x");
         b.made("other", "x", 0666);
         as(kNobody, [&] {
           callAll(b, "in it", b.at("d/x"));
           callAll(b, "there", b.at("d/other"));
         });
         b.note("to list only", chmod(b.at("d").c_str(), 0744));
         as(kNobody, [&] {
           b.names("d");
           b.look("d/other");
         });
         b.note("to search only", chmod(b.at("d").c_str(), 0711));
         as(kNobody, [&] {
           b.names("d");
           b.look("d/other");
           b.note("make", open(b.at("d/new").c_str(), O_WRONLY | O_CREAT, 0644));
           b.note("unlink", unlink(b.at("d/other").c_str()));
         });
       }},
      {"what is not one's own",
       [](Bench& b) {
         b.made("a", "root's", 0666);
         b.note("writable", chmod(b.at("a").c_str(), 0666));
         b.made("closed", "root's", 0644);
         const timespec times[2]{{1, 2}, {3, 4}};
         as(kNobody, [&] {
           b.note("chmod", chmod(b.at("a").c_str(), 0600));
           b.note("chown", chown(b.at("a").c_str(), kNobody, static_cast<gid_t>(-1)));
           b.note("chgrp", chown(b.at("a").c_str(), static_cast<uid_t>(-1), kNobody));
           b.note("dates", utimensat(AT_FDCWD, b.at("a").c_str(), times, 0));
           b.note("now", utimensat(AT_FDCWD, b.at("a").c_str(), nullptr, 0));
           b.note("now, closed", utimensat(AT_FDCWD, b.at("closed").c_str(), nullptr, 0));
           b.note("attribute", setxattr(b.at("a").c_str(), "user.x", "y", 1, 0));
           b.note("attribute, closed", setxattr(b.at("closed").c_str(), "user.x", "y", 1, 0));
           b.note("truncate, closed", truncate(b.at("closed").c_str(), 0));
           b.note("link, closed", link(b.at("closed").c_str(), b.at("l").c_str()));
         });
         b.look("a");
         b.look("closed");
       }},
      {"set-id bits of a file whose group may not execute it",
       [](Bench& b) {
         b.made("a", "x", 0666);
         b.note("to somebody", chown(b.at("a").c_str(), kSomebody, kSomebody));
         b.settle("a");
         const auto change = [&b] {
           const int file = open(b.at("a").c_str(), O_WRONLY | O_CLOEXEC);
           b.note("write", write(file, "y", 1));
           close(file);
         };
         b.note("chmod", chmod(b.at("a").c_str(), 06666));
         as(kNobody, [&] {
           b.note("chown to nobody else",
                  chown(b.at("a").c_str(), static_cast<uid_t>(-1), static_cast<gid_t>(-1)));
         });
         b.look("a");
         for (const uid_t user : {kNobody, kSomebody}) {
           b.note("chmod", chmod(b.at("a").c_str(), 06666));
           as(user, change);
           b.look("a");
         }
         b.note("chmod", chmod(b.at("a").c_str(), 06666));
         as(kNobody, kSomebody, change);
         b.look("a");
         b.note("chmod", chmod(b.at("a").c_str(), 06666));
         as(kSomebody, kNobody,
            [&] { b.note("chgrp", chown(b.at("a").c_str(), kSomebody, kNobody)); });
         b.look("a");
       }},
      {"groups",
       [](Bench& b) {
         b.made("a", "x");
         b.note("of another group", chown(b.at("a").c_str(), kNobody, kSomebody));
         as(kNobody, [&] { b.note("set-gid", chmod(b.at("a").c_str(), 02755)); });
         b.look("a");
         b.made("own", "x");
         b.note("of its group", chown(b.at("own").c_str(), kNobody, kNobody));
         as(kNobody, [&] { b.note("set-gid", chmod(b.at("own").c_str(), 02755)); });
         b.look("own");
         as(kNobody, [&] {
           b.note("away", chown(b.at("own").c_str(), static_cast<uid_t>(-1), kSomebody));
           b.note("to oneself", chown(b.at("own").c_str(), kNobody, kNobody));
         });
         b.look("own");
         b.note("mkdir", mkdir(b.at("d").c_str(), 0755));
         b.note("of another group", chown(b.at("d").c_str(), kNobody, kSomebody));
         b.note("inherited", chmod(b.at("d").c_str(), 02777));
         as(kNobody, [&] {
           b.made("d/new", "x", 02755);
           b.note("mkdir", mkdir(b.at("d/sub").c_str(), 0755));
         });
         b.look("d/new");
         b.look("d/sub");
       }},
  };
  return all;
}

/// Which dates each operation changes, of the entry and of the folder around it.
const std::vector<Case>& dates() {
  static const std::vector<Case> all{
      {"dates of files",
       [](Bench& b) {
         const int file = b.file("a", "0123456789");
         const std::string path = b.at("a");
         b.dates("write", {"a", "."}, [&] { return pwrite(file, "x", 1, 0); });
         b.dates("write nothing", {"a", "."}, [&] { return pwrite(file, "x", 0, 0); });
         b.dates("append", {"a", "."}, [&] { return pwrite(file, "x", 1, 10); });
         b.dates("shorter", {"a", "."}, [&] { return ftruncate(file, 5); });
         b.dates("longer", {"a", "."}, [&] { return truncate(path.c_str(), 500); });
         b.dates("as long as it is", {"a"}, [&] { return truncate(path.c_str(), 500); });
         b.dates("as long as it is", {"a"}, [&] { return ftruncate(file, 500); });
         b.dates("allocate", {"a", "."}, [&] { return fallocate(file, 0, 0, 10'000); });
         b.dates("punch", {"a"}, [&] {
           return fallocate(file, FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE, 0, 4096);
         });
         b.dates("chmod", {"a", "."}, [&] { return chmod(path.c_str(), 0600); });
         b.dates("chown", {"a", "."}, [&] { return chown(path.c_str(), getuid(), getgid()); });
         b.dates("set", {"a", "."}, [&] { return setxattr(path.c_str(), "user.x", "y", 1, 0); });
         b.dates("remove", {"a", "."}, [&] { return removexattr(path.c_str(), "user.x"); });
         b.dates("touch", {"a", "."},
                 [&] { return utimensat(AT_FDCWD, path.c_str(), nullptr, 0); });
         b.dates("open", {"a", "."}, [&] { return close(open(path.c_str(), O_RDWR)); });
         b.dates("empty", {"a", "."}, [&] { return close(open(path.c_str(), O_RDWR | O_TRUNC)); });
         b.dates("empty again", {"a"}, [&] { return close(open(path.c_str(), O_RDWR | O_TRUNC)); });
         b.dates("there", {"a", "."},
                 [&] { return close(open(path.c_str(), O_RDWR | O_CREAT, 0644)); });
         b.made("source", std::string(1000, 'q'));
         const int source = open(b.at("source").c_str(), O_RDONLY);
         b.dates("copy", {"a", "."},
                 [&] { return copy_file_range(source, nullptr, file, nullptr, 500, 0); });
         close(source);
         b.dates("sync", {"a"}, [&] { return fsync(file); });
         b.dates("close", {"a"}, [&] { return close(file); });
         b.dates("look", {"a", "."}, [&] { return access(path.c_str(), R_OK); });
       }},
      {"dates of names",
       [](Bench& b) {
         const auto path = [&](const char* name) { return b.at(name); };
         mkdir(path("d").c_str(), 0755);
         mkdir(path("e").c_str(), 0755);
         b.dates("make", {"d", "d/a"}, [&] { return close(b.file("d/a")); });
         b.dates("mkdir", {"d"}, [&] { return mkdir(path("d/sub").c_str(), 0755); });
         b.dates("fifo", {"d"}, [&] { return mkfifo(path("d/p").c_str(), 0600); });
         b.dates("symlink", {"d"}, [&] { return symlink("a", path("d/l").c_str()); });
         b.dates("link", {"d", "e", "d/a"},
                 [&] { return link(path("d/a").c_str(), path("e/b").c_str()); });
         b.dates("link that is there", {"e", "d/a"},
                 [&] { return link(path("d/a").c_str(), path("e/b").c_str()); });
         b.dates("unlink one", {"d", "e", "d/a"}, [&] { return unlink(path("e/b").c_str()); });
         b.dates("rename", {"d", "d/a", "d/z"},
                 [&] { return rename(path("d/a").c_str(), path("d/z").c_str()); });
         b.dates("rename elsewhere", {"d", "e", "d/z", "e/a"},
                 [&] { return rename(path("d/z").c_str(), path("e/a").c_str()); });
         b.dates("a folder elsewhere", {"d", "e", "d/sub", "e/sub"},
                 [&] { return rename(path("d/sub").c_str(), path("e/sub").c_str()); });
         b.made("e/b");
         b.dates("exchange", {"e", "e/a", "e/b"}, [&] {
           return renameat2(AT_FDCWD, path("e/a").c_str(), AT_FDCWD, path("e/b").c_str(),
                            RENAME_EXCHANGE);
         });
         b.dates("over it", {"e", "e/a", "e/b"},
                 [&] { return rename(path("e/a").c_str(), path("e/b").c_str()); });
         b.dates("refused", {"d", "e"},
                 [&] { return rename(path("none").c_str(), path("e/x").c_str()); });
         b.dates("refused", {"e"}, [&] { return rmdir(path("e").c_str()); });
         b.dates("mode of a folder", {".", "d"}, [&] { return chmod(path("d").c_str(), 0700); });
         b.dates("unlink", {"d"}, [&] { return unlink(path("d/p").c_str()); });
         b.dates("unlink", {"d"}, [&] { return unlink(path("d/l").c_str()); });
         b.dates("rmdir", {"e"}, [&] { return rmdir(path("e/sub").c_str()); });
       }},
      {"links of folders",
       [](Bench& b) {
         b.note("mkdir", mkdir(b.at("d").c_str(), 0755));
         b.look("d");
         for (const char* const name : {"d/a", "d/b", "d/b/c"}) {
           b.note("mkdir", mkdir(b.at(name).c_str(), 0755));
         }
         b.look("d");
         b.look("d/b");
         b.note("rename", rename(b.at("d/b/c").c_str(), b.at("d/c").c_str()));
         b.look("d");
         b.look("d/b");
         b.note("rmdir", rmdir(b.at("d/a").c_str()));
         b.look("d");
       }},
  };
  return all;
}

TEST_F(MountParity, WhatIsTooLongOrTooLargeIsAnsweredAsOnTheDiskForRoot) {
  compareAsRoot(limits());
}
TEST_F(MountParity, WhatIsTooLongOrTooLargeIsAnsweredAsOnTheDiskForAnOrdinaryUser) {
  compareAsUser(limits());
}
TEST_F(MountParity, OthersMayDoWhatTheyMayOnTheDisk) { compareAsRoot(permissions()); }
TEST_F(MountParity, WhatIsDoneChangesTheDatesThatItChangesOnTheDiskForRoot) {
  compareAsRoot(dates());
}
TEST_F(MountParity, WhatIsDoneChangesTheDatesThatItChangesOnTheDiskForAnOrdinaryUser) {
  compareAsUser(dates());
}

}  // namespace
}  // namespace yomber::testing
