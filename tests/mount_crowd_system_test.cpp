// Many processes that make, rename, link, write and remove in one tree through the mount at once.
//
// YOMBER_CROWD_STEPS says how many operations each process does, YOMBER_SEED which; both are
// printed.
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <dirent.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/file_contents.h"
#include "tests/harness/mounted_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

constexpr int kProcesses = 8;
/// Of so many files that have lost a name, but not all, the mount keeps descriptors.
constexpr std::size_t kNamedKept = 128;

long numberFrom(const char* name, long otherwise) {
  const char* const text = std::getenv(name);
  return text != nullptr ? std::atol(text) : otherwise;
}

/// One of the crowd: a child process, which ends with the first answer that it should not get.
class Member {
 public:
  Member(std::string folder, unsigned seed) : folder_(std::move(folder)), random_(seed) {}

  [[noreturn]] void run(long steps) {
    for (long i = 0; i < steps; ++i) {
      const std::size_t which = random_() % operations().size();
      errno = 0;
      operations()[which].second(*this);
      if (isUnexpected(errno)) {
        (void)std::fprintf(stderr, "step %ld, %s %s %s: %s\n", i, operations()[which].first,
                           from_.c_str(), to_.c_str(), std::strerror(errno));
        _exit(1);
      }
    }
    _exit(0);
  }

 private:
  using Operation = std::pair<const char*, void (*)(Member&)>;

  /// What a crowd gets in each other's way with is no failure.
  static bool isUnexpected(int failure) {
    static const std::set<int> expected{0,      ENOENT, EEXIST,  ENOTDIR, EISDIR, ENOTEMPTY,
                                        EINVAL, ELOOP,  ENODATA, ENXIO,   EPERM,  EMLINK};
    return !expected.contains(failure);
  }

  /// Few names, so that all meet; some of them are folders now and then.
  std::string place() {
    std::string result = folder_;
    const std::size_t depth = 1 + random_() % 3;
    for (std::size_t i = 0; i < depth; ++i) result += "/" + std::to_string(random_() % 4);
    return result;
  }
  void open(int flags, void (*use)(Member&, int)) {
    from_ = place();
    const int file = ::open(from_.c_str(), flags | O_CLOEXEC | O_NONBLOCK, 0644);
    if (file < 0) return;
    use(*this, file);
    const int failure = errno;
    close(file);
    errno = failure;
  }
  void two(int (*use)(const char*, const char*)) {
    from_ = place();
    to_ = place();
    (void)use(from_.c_str(), to_.c_str());
  }
  void one(int (*use)(const char*)) {
    from_ = place();
    (void)use(from_.c_str());
  }

  static const std::vector<Operation>& operations() {
    static const std::vector<Operation> all{
        {"make and write",
         [](Member& m) {
           m.open(O_WRONLY | O_CREAT, [](Member& me, int file) {
             const std::string bytes(me.random_() % 5000,
                                     static_cast<char>('a' + me.random_() % 9));
             (void)!write(file, bytes.data(), bytes.size());
           });
         }},
        {"append",
         [](Member& m) {
           m.open(O_WRONLY | O_APPEND, [](Member&, int file) { (void)!write(file, "more", 4); });
         }},
        {"read",
         [](Member& m) {
           m.open(O_RDONLY, [](Member&, int file) {
             std::array<char, 3000> bytes{};
             while (read(file, bytes.data(), bytes.size()) > 0) {
             }
             if (errno == EISDIR) errno = 0;
           });
         }},
        {"write through a map",
         [](Member& m) {
           m.open(O_RDWR, [](Member&, int file) {
             struct stat status{};
             if (fstat(file, &status) != 0 || !S_ISREG(status.st_mode) || status.st_size == 0)
               return;
             void* const map = mmap(nullptr, 1, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
             if (map == MAP_FAILED) return;
             // Somebody may cut it short meanwhile: then this page has no file behind it.
             (void)madvise(map, 1, MADV_WILLNEED);
             munmap(map, 1);
           });
         }},
        {"truncate", [](Member& m) { m.one([](const char* p) { return truncate(p, 100); }); }},
        {"mkdir", [](Member& m) { m.one([](const char* p) { return mkdir(p, 0755); }); }},
        {"rmdir", [](Member& m) { m.one(rmdir); }},
        {"unlink", [](Member& m) { m.one(unlink); }},
        {"rename", [](Member& m) { m.two(rename); }},
        {"rename without replacing",
         [](Member& m) {
           m.two([](const char* a, const char* b) {
             return renameat2(AT_FDCWD, a, AT_FDCWD, b, RENAME_NOREPLACE);
           });
         }},
        {"exchange",
         [](Member& m) {
           m.two([](const char* a, const char* b) {
             return renameat2(AT_FDCWD, a, AT_FDCWD, b, RENAME_EXCHANGE);
           });
         }},
        {"link", [](Member& m) { m.two(link); }},
        {"symlink",
         [](Member& m) { m.two([](const char*, const char* b) { return symlink("../1", b); }); }},
        {"stat",
         [](Member& m) {
           m.one([](const char* p) {
             struct stat status{};
             return stat(p, &status);
           });
         }},
        {"chmod", [](Member& m) { m.one([](const char* p) { return chmod(p, 0755); }); }},
        {"dates",
         [](Member& m) {
           m.one(
               [](const char* p) { return utimensat(AT_FDCWD, p, nullptr, AT_SYMLINK_NOFOLLOW); });
         }},
        {"attribute",
         [](Member& m) {
           m.one([](const char* p) { return setxattr(p, "user.note", "text", 4, 0); });
         }},
        {"list",
         [](Member& m) {
           m.one([](const char* p) {
             DIR* const folder = opendir(p);
             if (folder == nullptr) return -1;
             while (readdir(folder) != nullptr) {
             }
             return closedir(folder);
           });
         }},
    };
    return all;
  }

  const std::string folder_;
  std::minstd_rand random_;
  std::string from_;
  std::string to_;
};

/// Everything below a folder, as text: one line for each entry.
std::map<std::string, std::string> describe(const std::string& folder) {
  std::map<std::string, std::string> result;
  std::error_code failure;
  for (fs::recursive_directory_iterator entry(folder, failure), end; entry != end;
       entry.increment(failure)) {
    const std::string path = entry->path();
    struct stat status{};
    if (lstat(path.c_str(), &status) != 0) continue;
    std::ostringstream line;
    line << std::oct << status.st_mode << std::dec << " " << status.st_mtim.tv_sec << "."
         << status.st_mtim.tv_nsec;
    if (!S_ISDIR(status.st_mode)) line << " " << status.st_nlink << " " << status.st_size;
    if (S_ISREG(status.st_mode)) {
      line << " " << std::hash<std::string>()(contentOf(path));
    }
    result[path.substr(folder.size())] = line.str();
  }
  return result;
}

std::size_t descriptorsOf(pid_t process) {
  std::size_t count = 0;
  for (const auto& entry : fs::directory_iterator("/proc/" + std::to_string(process) + "/fd")) {
    struct stat status{};
    // Folders are kept open for a while, a bounded number of them.
    if (stat(entry.path().c_str(), &status) == 0 && S_ISREG(status.st_mode)) ++count;
  }
  return count;
}

TEST(MountCrowd, LeavesATreeThatBothSidesSeeAlike) {
  const long steps = numberFrom("YOMBER_CROWD_STEPS", 1500);
  const long seed = numberFrom("YOMBER_SEED", 1);
  std::printf("seed %ld, %d processes, %ld steps each\n", seed, kProcesses, steps);
  MountedDrive mounted;
  const std::string crowd = mounted.at("crowd");
  fs::create_directory(crowd);
  const std::size_t before = descriptorsOf(mounted.pid());

  std::vector<pid_t> members;
  for (int i = 0; i < kProcesses; ++i) {
    const pid_t member = fork();
    ASSERT_GE(member, 0);
    if (member == 0) Member(crowd, static_cast<unsigned>(seed * kProcesses + i)).run(steps);
    members.push_back(member);
  }
  for (const pid_t member : members) {
    int status = 0;
    ASSERT_EQ(waitpid(member, &status, 0), member);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  }

  EXPECT_TRUE(eventually([&] { return describe(crowd) == describe(mounted.onDisk("crowd")); }));
  const auto seen = describe(crowd);
  const auto there = describe(mounted.onDisk("crowd"));
  for (const auto& [path, line] : there) {
    const auto found = seen.find(path);
    EXPECT_EQ(found == seen.end() ? "nothing" : found->second, line) << path;
  }
  EXPECT_EQ(seen.size(), there.size());
  EXPECT_TRUE(eventually([&] { return descriptorsOf(mounted.pid()) <= before + kNamedKept; }));

  std::error_code failure;
  fs::remove_all(crowd, failure);
  EXPECT_FALSE(failure) << failure.message();
  EXPECT_TRUE(eventually([&] { return !fs::exists(mounted.onDisk("crowd")); }));
  EXPECT_TRUE(eventually([&] { return descriptorsOf(mounted.pid()) <= before; }));
  // The drive has followed all that, and answers.
  std::ofstream(mounted.at("after")) << "it";
  EXPECT_TRUE(eventually([&] {
    const auto listed = mounted.drive().yomber({"ls", "--json"});
    return listed.output.find("\"after\"") != std::string::npos &&
           listed.output.find("\"crowd\"") == std::string::npos;
  }));
}

}  // namespace
}  // namespace yomber::testing
