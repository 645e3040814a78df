// The mount beside the disk: each operation, and each of its errors, does and answers the same.
#include <algorithm>
#include <cstring>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <fcntl.h>
#include <linux/falloc.h>
#include <linux/fs.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/sysmacros.h>
#include <sys/un.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/parity_fixture.h"

namespace yomber::testing {
namespace {

void rename2(Bench& b, const std::string& from, const std::string& to, unsigned flags) {
  b.note(("rename " + from + " " + to).c_str(),
         renameat2(AT_FDCWD, b.at(from).c_str(), AT_FDCWD, b.at(to).c_str(), flags));
}

const std::vector<Case>& namesAndFolders() {
  static const std::vector<Case> all{
      {"a file is made once",
       [](Bench& b) {
         b.made("a", "one");
         b.note("again", open(b.at("a").c_str(), O_CREAT | O_EXCL | O_WRONLY, 0600));
         b.look("a");
       }},
      {"folders",
       [](Bench& b) {
         b.note("mkdir", mkdir(b.at("d").c_str(), 0755));
         b.note("again", mkdir(b.at("d").c_str(), 0755));
         b.made("d/a");
         b.note("rmdir full", rmdir(b.at("d").c_str()));
         b.note("unlink folder", unlink(b.at("d").c_str()));
         b.note("rmdir file", rmdir(b.at("d/a").c_str()));
         b.note("unlink", unlink(b.at("d/a").c_str()));
         b.note("rmdir", rmdir(b.at("d").c_str()));
         b.note("rmdir gone", rmdir(b.at("d").c_str()));
         b.note("below a file", (b.made("f"), mkdir(b.at("f/x").c_str(), 0755)));
       }},
      {"a folder that may be read and not searched",
       [](Bench& b) {
         b.note("mkdir", mkdir(b.at("d").c_str(), 0755));
         b.made("d/a");
         b.note("mkdir", mkdir(b.at("d/sub").c_str(), 0755));
         b.note("chmod", chmod(b.at("d").c_str(), 0600));
         b.names("d");
         b.look("d/a");
         b.note("chmod", chmod(b.at("d").c_str(), 0755));
         b.look("d/a");
       }},
      {"names of every length",
       [](Bench& b) {
         b.made(std::string(255, 'n'), "x");
         b.note("too long", open(b.at(std::string(256, 'n')).c_str(), O_CREAT | O_WRONLY, 0600));
         b.made("new\nline");
         b.made("\xff\xfe");
         b.names(".");
         b.note("empty", open((b.at("") + "/").c_str(), O_CREAT | O_WRONLY, 0600));
       }},
      {"renaming",
       [](Bench& b) {
         b.made("a", "one");
         b.made("b", "two");
         mkdir(b.at("d").c_str(), 0755);
         mkdir(b.at("e").c_str(), 0755);
         b.made("e/x");
         rename2(b, "a", "b", RENAME_NOREPLACE);
         rename2(b, "a", "b", RENAME_EXCHANGE);
         b.content("a");
         rename2(b, "a", "b", 0);
         b.content("b");
         b.look("a");
         rename2(b, "gone", "b", 0);
         rename2(b, "b", "d", 0);
         rename2(b, "d", "b", 0);
         rename2(b, "d", "e", 0);
         rename2(b, "d", "d/inside", 0);
         rename2(b, "e", "d", 0);
         rename2(b, "b", "d/b", RENAME_NOREPLACE);
         rename2(b, "b", "b2", RENAME_NOREPLACE);
         rename2(b, "d/b", "b2", RENAME_EXCHANGE | RENAME_NOREPLACE);
         b.names("d");
       }},
      {"hard links",
       [](Bench& b) {
         b.made("a", "one");
         b.note("link", link(b.at("a").c_str(), b.at("b").c_str()));
         b.note("again", link(b.at("a").c_str(), b.at("b").c_str()));
         b.look("a");
         b.note("unlink the newer", unlink(b.at("b").c_str()));
         b.look("a");
         b.note("link", link(b.at("a").c_str(), b.at("c").c_str()));
         b.note("unlink the older", unlink(b.at("a").c_str()));
         b.note("chmod", chmod(b.at("c").c_str(), 0600));
         b.look("c");
         b.content("c");
         b.note("link of none", link(b.at("none").c_str(), b.at("d").c_str()));
         mkdir(b.at("dir").c_str(), 0755);
         b.note("link of a folder", link(b.at("dir").c_str(), b.at("d").c_str()));
         b.note("both names", (link(b.at("c").c_str(), b.at("c2").c_str()),
                               rename(b.at("c").c_str(), b.at("c2").c_str())));
         b.look("c");
       }},
      {"symbolic links",
       [](Bench& b) {
         b.made("a", "one");
         b.note("symlink", symlink("a", b.at("l").c_str()));
         b.note("again", symlink("b", b.at("l").c_str()));
         b.content("l");
         b.look("l");
         char target[64] = {};
         b.note("readlink", readlink(b.at("l").c_str(), target, sizeof target));
         b.say(target);
         b.note("readlink of a file", readlink(b.at("a").c_str(), target, sizeof target));
         b.note("to itself", symlink("loop", b.at("loop").c_str()));
         b.note("loop", open(b.at("loop").c_str(), O_RDONLY));
         b.note("nofollow", open(b.at("l").c_str(), O_RDONLY | O_NOFOLLOW));
         b.note("long", symlink(std::string(4095, 'x').c_str(), b.at("long").c_str()));
         b.note("empty", symlink("", b.at("empty").c_str()));
         b.note("chown link", lchown(b.at("l").c_str(), getuid(), getgid()));
         const timespec times[2]{{1, 2}, {3, 4}};
         b.note("its dates", utimensat(AT_FDCWD, b.at("l").c_str(), times, AT_SYMLINK_NOFOLLOW));
         b.note("unlink", unlink(b.at("l").c_str()));
         b.look("a");
       }},
      {"pipes, sockets and devices",
       [](Bench& b) {
         b.note("fifo", mkfifo(b.at("p").c_str(), 0640));
         b.look("p");
         const int reader = open(b.at("p").c_str(), O_RDONLY | O_NONBLOCK);
         const int writer = open(b.at("p").c_str(), O_WRONLY | O_NONBLOCK);
         b.note("through it", write(writer, "x", 1));
         char byte = 0;
         b.note("out of it", read(reader, &byte, 1));
         close(reader);
         close(writer);
         b.note("block device", mknod(b.at("dev").c_str(), S_IFBLK | 0600, makedev(7, 200)));
         b.look("dev");
         b.note("socket", mknod(b.at("s").c_str(), S_IFSOCK | 0600, 0));
         b.look("s");
         b.note("open socket", open(b.at("s").c_str(), O_RDONLY));
       }},
      {"paths that are none",
       [](Bench& b) {
         b.note("gone", open(b.at("none/x").c_str(), O_RDONLY));
         b.made("f");
         b.note("below a file", open(b.at("f/x").c_str(), O_RDONLY));
         b.note("a file as a folder", open(b.at("f").c_str(), O_RDONLY | O_DIRECTORY));
         b.note("write to a folder", open(b.at(".").c_str(), O_WRONLY));
         b.note("too long a path",
                open(b.at(std::string(5000, '/')).c_str(), O_RDONLY) < 0 ? -1 : 0);
         b.note("trailing slash", open(b.at("f/").c_str(), O_RDONLY));
       }},
  };
  return all;
}

const std::vector<Case>& attributesAndContent() {
  static const std::vector<Case> all{
      {"modes and owners",
       [](Bench& b) {
         b.made("a", "x", 0777);
         b.look("a");
         b.note("chmod", chmod(b.at("a").c_str(), 04755));
         b.look("a");
         b.note("chown away", chown(b.at("a").c_str(), 12345, 23456));
         b.look("a");
         b.note("chown to us", chown(b.at("a").c_str(), getuid(), getgid()));
         b.note("sticky", mkdir(b.at("d").c_str(), 0777));
         b.note("sticky", chmod(b.at("d").c_str(), 03777));
         b.look("d");
         b.made("d/a");
         b.note("mkdir", mkdir(b.at("d/sub").c_str(), 0755));
         b.look("d/sub");
         b.made("locked", "x", 0);
         b.note("open locked", open(b.at("locked").c_str(), O_RDONLY) < 0 ? -1 : 0);
         b.note("access", access(b.at("locked").c_str(), R_OK));
         b.note("made read-only, written", close(b.file("readonly", "bytes", 0400)));
         b.content("readonly");
       }},
      {"what was removed while somebody holds it",
       [](Bench& b) {
         b.made("held", "content");
         const int held = open(b.at("held").c_str(), O_PATH);
         b.note("mkdir", mkdir(b.at("d").c_str(), 0755));
         const int folder = open(b.at("d").c_str(), O_RDONLY | O_DIRECTORY);
         b.note("mkdir", mkdir(b.at("empty").c_str(), 0755));
         b.note("mkdir", mkdir(b.at("other").c_str(), 0755));
         const int replaced = open(b.at("empty").c_str(), O_PATH);
         b.note("unlink", unlink(b.at("held").c_str()));
         b.note("rmdir", rmdir(b.at("d").c_str()));
         rename2(b, "other", "empty", 0);
         for (const int gone : {held, folder, replaced}) {
           struct stat status{};
           b.note("look", fstat(gone, &status));
           b.say("mode " + std::to_string(status.st_mode) + " links " +
                 std::to_string(status.st_nlink));
         }
         b.note("open again",
                close(open(("/proc/self/fd/" + std::to_string(held)).c_str(), O_RDONLY)));
         b.note("make in it", openat(folder, "new", O_WRONLY | O_CREAT, 0644));
         b.note("look in it", faccessat(folder, "new", F_OK, 0));
         for (const int gone : {held, folder, replaced}) close(gone);
       }},
      {"set-id bits go with a write",
       [](Bench& b) {
         b.made("a", "x", 0755);
         b.settle("a");
         b.note("chmod", chmod(b.at("a").c_str(), 06755));
         const int file = open(b.at("a").c_str(), O_WRONLY);
         b.note("write", write(file, "y", 1));
         close(file);
         b.look("a");
         b.note("chmod", chmod(b.at("a").c_str(), 06755));
         b.note("truncate", truncate(b.at("a").c_str(), 0));
         b.look("a");
         b.note("chmod", chmod(b.at("a").c_str(), 06755));
         close(open(b.at("a").c_str(), O_WRONLY | O_TRUNC));
         b.look("a");
         b.note("chmod", chmod(b.at("a").c_str(), 06755));
         const int other = open(b.at("a").c_str(), O_RDWR);
         b.note("fallocate", fallocate(other, 0, 0, 100));
         b.look("a");
         b.note("chmod", chmod(b.at("a").c_str(), 06745));
         b.note("ftruncate", ftruncate(other, 10));
         b.look("a");
         b.note("chmod", chmod(b.at("a").c_str(), 06755));
         b.made("source", "bytes");
         const int source = open(b.at("source").c_str(), O_RDONLY);
         b.note("copy", copy_file_range(source, nullptr, other, nullptr, 5, 0));
         b.look("a");
         close(source);
         close(other);
         b.note("chmod", chmod(b.at("a").c_str(), 06755));
         b.note("chown", chown(b.at("a").c_str(), getuid(), getgid()));
         b.look("a");
       }},
      {"a change of owner that leaves both as they are is one",
       [](Bench& b) {
         b.made("a", "x");
         const auto changed = [&b] {
           struct stat status{};
           EXPECT_EQ(stat(b.at("a").c_str(), &status), 0);
           return status.st_ctim.tv_sec * 1'000'000'000 + status.st_ctim.tv_nsec;
         };
         const auto before = changed();
         EXPECT_TRUE(eventually([&] {
           return chown(b.at("a").c_str(), static_cast<uid_t>(-1), static_cast<gid_t>(-1)) == 0 &&
                  changed() > before;
         }));
         b.look("a");
       }},
      {"dates to the nanosecond",
       [](Bench& b) {
         b.made("a");
         for (const timespec date :
              {timespec{1, 123456789}, timespec{-5, 999999999}, timespec{4'000'000'000, 1}}) {
           const timespec times[2]{date, date};
           b.note("set", utimensat(AT_FDCWD, b.at("a").c_str(), times, 0));
           struct stat status{};
           stat(b.at("a").c_str(), &status);
           b.say(std::to_string(status.st_mtim.tv_sec) + "." +
                 std::to_string(status.st_mtim.tv_nsec));
         }
         const timespec partly[2]{{0, UTIME_OMIT}, {7, 8}};
         b.note("one of them", utimensat(AT_FDCWD, b.at("a").c_str(), partly, 0));
         const timespec bad[2]{{0, 2'000'000'000}, {0, 0}};
         b.note("senseless", utimensat(AT_FDCWD, b.at("a").c_str(), bad, 0));
       }},
      {"extended attributes",
       [](Bench& b) {
         b.made("a");
         const std::string path = b.at("a");
         char value[64] = {};
         b.note("set", setxattr(path.c_str(), "user.xdg.tags", "red,blue", 8, 0));
         b.note("once", setxattr(path.c_str(), "user.xdg.tags", "x", 1, XATTR_CREATE));
         b.note("other", setxattr(path.c_str(), "user.other", "x", 1, XATTR_REPLACE));
         b.note("get", getxattr(path.c_str(), "user.xdg.tags", value, sizeof value));
         b.say(value);
         b.note("size", getxattr(path.c_str(), "user.xdg.tags", nullptr, 0));
         b.note("small", getxattr(path.c_str(), "user.xdg.tags", value, 2));
         b.note("none", getxattr(path.c_str(), "user.none", value, sizeof value));
         b.note("list", listxattr(path.c_str(), value, sizeof value));
         b.note("remove", removexattr(path.c_str(), "user.xdg.tags"));
         b.note("again", removexattr(path.c_str(), "user.xdg.tags"));
         b.note("no space of names", setxattr(path.c_str(), "nothing", "x", 1, 0));
         b.note("empty", setxattr(path.c_str(), "user.empty", "", 0, 0));
         b.note("get empty", getxattr(path.c_str(), "user.empty", value, sizeof value));
         mkdir(b.at("d").c_str(), 0755);
         b.note("of a folder", setxattr(b.at("d").c_str(), "user.x", "y", 1, 0));
         b.note("of a link", (symlink("a", b.at("l").c_str()),
                              lsetxattr(b.at("l").c_str(), "user.x", "y", 1, 0)));
       }},
      {"reading and writing",
       [](Bench& b) {
         const int file = b.file("a", "0123456789");
         char bytes[32] = {};
         b.note("at", pread(file, bytes, 4, 3));
         b.say(std::string(bytes, 4));
         b.note("at the end", pread(file, bytes, 4, 10));
         b.note("behind", pread(file, bytes, 4, 100));
         b.note("write behind", pwrite(file, "x", 1, 100));
         b.look("a");
         b.content("a");
         b.note("negative", pread(file, bytes, 1, -1));
         b.note("shorter", ftruncate(file, 5));
         b.note("longer", ftruncate(file, 50));
         b.note("negative", ftruncate(file, -1));
         b.content("a");
         b.note("sync", fsync(file));
         b.note("data", fdatasync(file));
         close(file);
         const int reader = open(b.at("a").c_str(), O_RDONLY);
         b.note("write to a reader", write(reader, "x", 1));
         b.note("truncate a reader", ftruncate(reader, 1));
         close(reader);
         const int appender = open(b.at("a").c_str(), O_WRONLY | O_APPEND);
         const int other = open(b.at("a").c_str(), O_WRONLY | O_APPEND);
         b.note("append", write(appender, "one", 3));
         b.note("append", write(other, "two", 3));
         b.note("append", write(appender, "three", 5));
         close(appender);
         close(other);
         b.content("a");
         b.note("emptied", open(b.at("a").c_str(), O_WRONLY | O_TRUNC) < 0 ? -1 : 0);
         b.look("a");
       }},
      {"a file that was removed while it is open",
       [](Bench& b) {
         const int file = b.file("a", "still here");
         b.note("unlink", unlink(b.at("a").c_str()));
         char bytes[32] = {};
         b.note("read", pread(file, bytes, 5, 0));
         b.note("write", pwrite(file, "S", 1, 0));
         struct stat status{};
         b.note("stat", fstat(file, &status));
         b.say(std::to_string(status.st_nlink) + " " + std::to_string(status.st_size));
         b.note("chmod", fchmod(file, 0600));
         b.note("truncate", ftruncate(file, 3));
         b.note("dates", futimens(file, nullptr));
         b.note("attribute", fsetxattr(file, "user.x", "y", 1, 0));
         b.made("a", "another one");
         b.note("read", pread(file, bytes, 5, 0));
         close(file);
         b.content("a");
       }},
      {"a file that is replaced while it is open",
       [](Bench& b) {
         const int file = b.file("a", "old");
         b.made("b", "new");
         rename2(b, "b", "a", 0);
         char bytes[8] = {};
         b.note("read", pread(file, bytes, 8, 0));
         b.say(bytes);
         close(file);
         b.content("a");
       }},
      {"maps",
       [](Bench& b) {
         const int file = b.file("a", std::string(10000, 'a'));
         auto* bytes =
             static_cast<char*>(mmap(nullptr, 10000, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0));
         b.say(bytes == MAP_FAILED ? "no map" : "a map");
         if (bytes != MAP_FAILED) {
           std::memset(bytes + 5000, 'b', 100);
           b.note("msync", msync(bytes, 10000, MS_SYNC));
           b.content("a");
           b.note("write beside", pwrite(file, "ccc", 3, 7000));
           b.say(std::string(bytes + 6998, 6));
           munmap(bytes, 10000);
         }
         close(file);
         b.content("a");
       }},
      {"space and holes",
       [](Bench& b) {
         const int file = b.file("a", "x");
         b.note("allocate", fallocate(file, 0, 0, 100000));
         b.look("a");
         b.note("keep size", fallocate(file, FALLOC_FL_KEEP_SIZE, 0, 200000));
         b.look("a");
         b.note("punch", fallocate(file, FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE, 0, 50000));
         b.note("senseless", fallocate(file, FALLOC_FL_PUNCH_HOLE, 0, 10));
         b.note("negative", fallocate(file, 0, -1, 10));
         close(file);
         const int holes = b.file("h");
         b.note("write", pwrite(holes, "x", 1, 1 << 20));
         b.note("data", lseek(holes, 0, SEEK_DATA));
         b.note("hole", lseek(holes, 0, SEEK_HOLE));
         b.note("hole at the end", lseek(holes, 1 << 20, SEEK_HOLE));
         b.note("behind", lseek(holes, 2 << 20, SEEK_DATA));
         close(holes);
       }},
      {"copying in the kernel",
       [](Bench& b) {
         const int from = b.file("a", std::string(100000, 'q'));
         const int to = b.file("b");
         off_t read = 10;
         off_t written = 20;
         b.note("copy", copy_file_range(from, &read, to, &written, 50000, 0));
         b.say(std::to_string(read) + " " + std::to_string(written));
         b.note("at the end", (read = 100000, copy_file_range(from, &read, to, &written, 5, 0)));
         close(from);
         close(to);
         b.content("b");
       }},
      {"locks",
       [](Bench& b) {
         const int one = b.file("a", "x");
         const int other = open(b.at("a").c_str(), O_RDWR);
         b.note("flock", flock(one, LOCK_EX));
         b.note("of another", flock(other, LOCK_EX | LOCK_NB));
         b.note("unlock", flock(one, LOCK_UN));
         b.note("now", flock(other, LOCK_EX | LOCK_NB));
         struct flock range{};
         range.l_type = F_WRLCK;
         range.l_len = 10;
         b.note("range", fcntl(one, F_OFD_SETLK, &range));
         b.note("of another", fcntl(other, F_OFD_SETLK, &range));
         range.l_start = 10;
         b.note("beside", fcntl(other, F_OFD_SETLK, &range));
         close(one);
         close(other);
       }},
      {"the disk",
       [](Bench& b) {
         struct statvfs status{};
         b.note("statvfs", statvfs(b.at(".").c_str(), &status));
         b.say(std::to_string(status.f_bsize) + " " + std::to_string(status.f_namemax) + " " +
               std::to_string(status.f_blocks));
       }},
  };
  return all;
}

TEST_F(MountParity, NamesAndFoldersAreAsOnTheDiskForRoot) { compareAsRoot(namesAndFolders()); }
TEST_F(MountParity, AttributesAndContentAreAsOnTheDiskForRoot) {
  compareAsRoot(attributesAndContent());
}
TEST_F(MountParity, NamesAndFoldersAreAsOnTheDiskForAnOrdinaryUser) {
  compareAsUser(namesAndFolders());
}
TEST_F(MountParity, AttributesAndContentAreAsOnTheDiskForAnOrdinaryUser) {
  compareAsUser(attributesAndContent());
}

}  // namespace
}  // namespace yomber::testing
