// The mount beside the disk: whatever several users do at random with files of every kind, in a few
// names that they all use, gives the same answers and leaves the same tree behind.
//
// YOMBER_PARITY_STEPS says how many operations are done, YOMBER_SEED which; it is printed.
#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <filesystem>
#include <functional>
#include <initializer_list>
#include <iostream>
#include <map>
#include <random>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include <fcntl.h>
#include <grp.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/parity_fixture.h"

namespace yomber::testing {
namespace {

constexpr long kStepsToAnew = 300;

long numberFrom(const char* name, long otherwise) {
  const char* const text = std::getenv(name);
  return text != nullptr ? std::atol(text) : otherwise;
}

/// Who does something: a user, his group, and a second group.
struct Caller {
  const char* name;
  uid_t user;
  gid_t group;
  gid_t second;
};
constexpr std::array<Caller, 4> kCallers{{{"root", 0, 0, 0},
                                          {"ann", 65534, 65534, 65534},
                                          {"bob", 54321, 54321, 54321},
                                          {"eve", 54322, 54322, 65534}}};

void as(const Caller& caller, const std::function<void()>& work) {
  if (geteuid() != 0) return work();
  /// Root again, however the work ends.
  struct Return {
    Return() = default;
    ~Return() { EXPECT_TRUE(seteuid(0) == 0 && setegid(0) == 0); }
    Return(const Return&) = delete;
    Return& operator=(const Return&) = delete;
  };
  const Return back;
  ASSERT_EQ(setgroups(1, &caller.second), 0);
  ASSERT_EQ(setegid(caller.group), 0);
  ASSERT_EQ(seteuid(caller.user), 0);
  work();
}

/// An answer of the system: the error's name when it is one.
std::string told(long answer) {
  return answer < 0 ? strerrorname_np(errno) : std::to_string(answer);
}

/// What an operation does in a tree with that root, and what it is answered.
using Operation = std::function<std::string(const std::string& root)>;
struct Step {
  std::string text;
  Operation run;
};

/// Makes up operations.
class Choices {
 public:
  explicit Choices(unsigned long seed) : random_(seed) {}

  std::size_t upTo(std::size_t most) {
    return std::uniform_int_distribution<std::size_t>(0, most)(random_);
  }
  bool once(std::size_t in) { return upTo(in - 1) == 0; }
  template <typename Value>
  Value one(std::initializer_list<Value> values) {
    return *(values.begin() + upTo(values.size() - 1));
  }
  const Caller& caller() { return once(2) ? kCallers[0] : kCallers.at(upTo(kCallers.size() - 1)); }
  mode_t mask() { return one<mode_t>({022, 0, 027, 077}); }

  Step step() { return (this->*kinds().at(upTo(kinds().size() - 1)))(); }

 private:
  using Kind = Step (Choices::*)();
  static const std::vector<Kind>& kinds();

  std::string name() { return one<std::string>({"a", "b", "c", "d"}); }
  /// Mostly of one or two names; now and then one that is odd. None that leads upwards: with links
  /// it would lead out of the tree.
  std::string path() {
    std::string path = name();
    while (path.size() < 5 && once(2)) path += "/" + name();
    if (once(30)) path += one<std::string>({"/", "/.", "//", "/" + std::string(256, 'x')});
    return path;
  }
  /// In an ordinary user's mount the owner may always write and search. The drive lets him write
  /// for a moment what it is to mark, and nobody is to see that here. And of a file with several
  /// names the mount knows one, to which he could close the way.
  mode_t mode() {
    static const mode_t always = geteuid() == 0 ? 0 : S_IWUSR | S_IXUSR;
    return always | one<mode_t>({0777, 0755, 0750, 0700, 0666, 0644, 0640, 0600, 0444, 0111, 0}) |
           one<mode_t>({0, 0, 0, 01000, 02000, 04000, 06000, 07000});
  }
  static std::string octal(mode_t mode) {
    std::array<char, 16> text{};
    (void)std::snprintf(text.data(), text.size(), "%o", mode);
    return text.data();
  }

  Step open();
  Step mkdir();
  Step mknod();
  Step symlink();
  Step link();
  Step unlink();
  Step rmdir();
  Step rename();
  Step chmod();
  Step chown();
  Step truncate();
  Step dates();
  Step access();
  Step list();
  Step readlink();
  Step attribute();

  std::mt19937_64 random_;
};

const std::vector<Choices::Kind>& Choices::kinds() {
  static const std::vector<Kind> all{
      &Choices::open,   &Choices::open,   &Choices::open,     &Choices::mkdir,    &Choices::mkdir,
      &Choices::mkdir,  &Choices::mknod,  &Choices::symlink,  &Choices::link,     &Choices::unlink,
      &Choices::rmdir,  &Choices::rename, &Choices::rename,   &Choices::rename,   &Choices::chmod,
      &Choices::chmod,  &Choices::chown,  &Choices::chown,    &Choices::truncate, &Choices::dates,
      &Choices::access, &Choices::list,   &Choices::readlink, &Choices::attribute};
  return all;
}

/// A device is no business of the file system's, once it is open.
bool isDevice(const std::string& path) {
  struct stat status{};
  return stat(path.c_str(), &status) == 0 && (S_ISBLK(status.st_mode) || S_ISCHR(status.st_mode));
}

Step Choices::open() {
  const int flags = one({O_RDONLY, O_WRONLY, O_RDWR}) |
                    one({0, O_CREAT, O_CREAT, O_CREAT | O_EXCL}) | one({0, 0, O_TRUNC}) |
                    one({0, 0, 0, 0, O_NOFOLLOW, O_DIRECTORY, O_APPEND});
  const std::string text(upTo(1) * upTo(3'000), 'x');
  return {"open " + std::to_string(flags) + " and write " + std::to_string(text.size()),
          [flags, text, path = path(), mode = mode()](const std::string& root) -> std::string {
            const std::string file = root + "/" + path;
            if (isDevice(file)) return path + ": a device";
            const int descriptor = ::open(file.c_str(), flags | O_NONBLOCK | O_CLOEXEC, mode);
            if (descriptor < 0) return path + ": " + told(descriptor);
            struct stat status{};
            EXPECT_EQ(fstat(descriptor, &status), 0);
            std::string answer = path + ": " + octal(status.st_mode);
            // What a pipe has in it depends on who else has it open.
            if (S_ISREG(status.st_mode) && !text.empty())
              answer += " written " + told(write(descriptor, text.data(), text.size()));
            close(descriptor);
            return answer;
          }};
}

Step Choices::mkdir() {
  return {"mkdir", [path = path(), mode = mode()](const std::string& root) {
            return path + " " + octal(mode) + ": " +
                   told(::mkdir((root + "/" + path).c_str(), mode));
          }};
}

Step Choices::mknod() {
  constexpr unsigned kNoDriver = 3'000;
  const mode_t kind = one<mode_t>({S_IFIFO, S_IFSOCK, S_IFREG, S_IFBLK, S_IFCHR});
  return {"mknod", [kind, path = path(), mode = mode()](const std::string& root) {
            const dev_t device = makedev(kNoDriver, 7);
            return path + " " + octal(kind | mode) + ": " +
                   told(::mknod((root + "/" + path).c_str(), kind | mode, device));
          }};
}

Step Choices::symlink() {
  const std::string target = one<std::string>({name(), path(), path(), ".", "nowhere", ""});
  return {"symlink", [target, path = path()](const std::string& root) {
            return path + " to " + target + ": " +
                   told(::symlink(target.c_str(), (root + "/" + path).c_str()));
          }};
}

Step Choices::link() {
  return {"link", [from = path(), to = path(),
                   flags = one({0, AT_SYMLINK_FOLLOW})](const std::string& root) {
            return from + " as " + to + ": " +
                   told(linkat(AT_FDCWD, (root + "/" + from).c_str(), AT_FDCWD,
                               (root + "/" + to).c_str(), flags));
          }};
}

Step Choices::unlink() {
  return {"unlink", [path = path()](const std::string& root) {
            return path + ": " + told(::unlink((root + "/" + path).c_str()));
          }};
}

Step Choices::rmdir() {
  return {"rmdir", [path = path()](const std::string& root) {
            return path + ": " + told(::rmdir((root + "/" + path).c_str()));
          }};
}

Step Choices::rename() {
  return {"rename", [from = path(), to = path(),
                     flags = one<unsigned>({0, 0, 0, RENAME_NOREPLACE, RENAME_EXCHANGE})](
                        const std::string& root) {
            return from + " to " + to + " " + std::to_string(flags) + ": " +
                   told(renameat2(AT_FDCWD, (root + "/" + from).c_str(), AT_FDCWD,
                                  (root + "/" + to).c_str(), flags));
          }};
}

Step Choices::chmod() {
  return {"chmod", [path = path(), mode = mode()](const std::string& root) {
            return path + " " + octal(mode) + ": " +
                   told(::chmod((root + "/" + path).c_str(), mode));
          }};
}

Step Choices::chown() {
  constexpr uid_t kAsItIs = static_cast<uid_t>(-1);
  const auto id = [this] { return kCallers.at(upTo(kCallers.size() - 1)).user; };
  uid_t user = once(3) ? kAsItIs : id();
  // One of them at least: else the mount is asked what it is asked before every write, too, and has
  // to answer everybody alike.
  uid_t group = user != kAsItIs && once(3) ? kAsItIs : id();
  return {"chown", [path = path(), user, group,
                    flags = one({0, AT_SYMLINK_NOFOLLOW})](const std::string& root) {
            return path + " " + std::to_string(user) + ":" + std::to_string(group) + ": " +
                   told(fchownat(AT_FDCWD, (root + "/" + path).c_str(), user, group, flags));
          }};
}

Step Choices::truncate() {
  const auto size = one<off_t>({0, 0, 1, 4'096, static_cast<off_t>(upTo(10'000)), -1});
  return {"truncate", [size, path = path()](const std::string& root) {
            return path + " " + std::to_string(size) + ": " +
                   told(::truncate((root + "/" + path).c_str(), size));
          }};
}

Step Choices::dates() {
  const auto date = [this] {
    return timespec{.tv_sec = static_cast<time_t>(upTo(999'999)),
                    .tv_nsec = one<long>({UTIME_NOW, UTIME_OMIT, 0, 123'456'789, 1'000'000'000})};
  };
  return {"dates", [path = path(), accessed = date(), modified = date(),
                    flags = one({0, AT_SYMLINK_NOFOLLOW})](const std::string& root) {
            const timespec times[2] = {accessed, modified};
            return path + " " + std::to_string(accessed.tv_nsec) + " " +
                   std::to_string(modified.tv_sec) + "." + std::to_string(modified.tv_nsec) + ": " +
                   told(utimensat(AT_FDCWD, (root + "/" + path).c_str(), times, flags));
          }};
}

Step Choices::access() {
  return {"access", [path = path(), how = static_cast<int>(upTo(7))](const std::string& root) {
            return path + " " + std::to_string(how) + ": " +
                   told(faccessat(AT_FDCWD, (root + "/" + path).c_str(), how, AT_EACCESS));
          }};
}

Step Choices::list() {
  return {
      "list", [path = path()](const std::string& root) {
        std::error_code failure;
        std::vector<std::string> names;
        for (const auto& entry : std::filesystem::directory_iterator(root + "/" + path, failure))
          names.push_back(entry.path().filename());
        std::ranges::sort(names);
        std::string answer = path + ": " + (failure ? strerrorname_np(failure.value()) : "0");
        for (const std::string& each : names) answer += " " + each;
        return answer;
      }};
}

Step Choices::readlink() {
  return {"readlink", [path = path()](const std::string& root) {
            std::array<char, PATH_MAX> target{};
            const ssize_t length =
                ::readlink((root + "/" + path).c_str(), target.data(), target.size());
            return path + ": " + told(length) + " " + target.data();
          }};
}

Step Choices::attribute() {
  const std::string value(upTo(20), 'v');
  return {"attribute", [value, path = path(), flags = one<int>({0, XATTR_CREATE, XATTR_REPLACE}),
                        what = upTo(3)](const std::string& root) {
            const std::string file = root + "/" + path;
            std::array<char, 64> read{};
            switch (what) {
              case 0:
                return path + " removed: " + told(removexattr(file.c_str(), "user.x"));
              case 1:
                return path + ": " + told(getxattr(file.c_str(), "user.x", read.data(), 64)) + " " +
                       read.data();
              default:
                return path + " set " + std::to_string(flags) + ": " +
                       told(setxattr(file.c_str(), "user.x", value.data(), value.size(), flags));
            }
          }};
}

/// What whoever runs the test sees of a tree, and since when.
class Tree {
 public:
  explicit Tree(const std::string& root) { read(root, "."); }

  [[nodiscard]] const std::map<std::string, std::string>& entries() const { return entries_; }
  /// The names whose status has another date than it had before.
  [[nodiscard]] std::vector<std::string> changedSince(const Tree& before) const {
    std::vector<std::string> names;
    for (const auto& [name, date] : changes_) {
      const auto found = before.changes_.find(name);
      if (found != before.changes_.end() && found->second != date) names.push_back(name);
    }
    return names;
  }
  /// Until a change now is sure to get a date that is later than all there are.
  void waitForClock() const {
    timespec now{};
    do {
      clock_gettime(CLOCK_REALTIME_COARSE, &now);
    } while (std::pair(now.tv_sec, now.tv_nsec) <= latest_);
  }

 private:
  using Date = std::pair<time_t, long>;

  void read(const std::string& path, const std::string& name) {
    struct stat status{};
    if (lstat(path.c_str(), &status) != 0) {
      entries_[name] = told(-1);
      return;
    }
    entries_[name] = described(path, status);
    changes_[name] = {status.st_ctim.tv_sec, status.st_ctim.tv_nsec};
    latest_ = std::max(latest_, changes_[name]);
    if (!S_ISDIR(status.st_mode)) return;
    std::error_code failure;
    for (const auto& entry : std::filesystem::directory_iterator(path, failure))
      read(entry.path(), name + "/" + entry.path().filename().string());
    if (failure) entries_[name] += " " + failure.message();
  }
  static std::string described(const std::string& path, const struct stat& status) {
    const bool isSet = status.st_mtim.tv_sec < 1'000'000;
    std::string text =
        "mode " + std::to_string(status.st_mode) + " links " + std::to_string(status.st_nlink) +
        " owner " + std::to_string(status.st_uid) + ":" + std::to_string(status.st_gid) +
        " device " + std::to_string(status.st_rdev) + " modified " +
        (isSet
             ? std::to_string(status.st_mtim.tv_sec) + "." + std::to_string(status.st_mtim.tv_nsec)
             : "lately");
    if (!S_ISDIR(status.st_mode)) text += " size " + std::to_string(status.st_size);
    if (S_ISLNK(status.st_mode)) text += " to " + std::filesystem::read_symlink(path).string();
    std::array<char, 64> value{};
    const ssize_t length = lgetxattr(path.c_str(), "user.x", value.data(), value.size());
    if (length >= 0) text += " x " + std::string(value.data(), static_cast<std::size_t>(length));
    return text;
  }

  std::map<std::string, std::string> entries_;
  std::map<std::string, Date> changes_;
  Date latest_;
};

/// So that its owner can remove what is in it.
void openFolders(const std::string& root) {
  (void)::chmod(root.c_str(), 0700);
  std::error_code failure;
  for (const auto& entry : std::filesystem::directory_iterator(root, failure)) {
    if (!entry.is_symlink(failure) && entry.is_directory(failure)) openFolders(entry.path());
  }
}

class MountRandomParity : public MountParity {
 protected:
  void SetUp() override {
    ASSERT_NO_FATAL_FAILURE(MountParity::SetUp());
    for (const std::string& root : {mountedRoot(), nativeRoot()}) {
      ASSERT_EQ(mkdir(root.c_str(), 0777), 0);
    }
  }
  void TearDown() override {
    if (native_.empty()) return;
    for (const std::string& root : {mountedRoot(), nativeRoot()}) openFolders(root);
    MountParity::TearDown();
  }
  [[nodiscard]] std::string mountedRoot() const { return mounted_.at("tree"); }
  [[nodiscard]] std::string nativeRoot() const { return native_ + "/tree"; }

  /// What was done last, the latest at the end.
  [[nodiscard]] std::string story() const {
    std::string text;
    for (const std::string& line : story_) text += line + "\n";
    return text;
  }
  /// Both trees are empty again: at length nobody may do anything any more.
  void beginAnew() {
    remember("anew");
    for (const std::string& root : {mountedRoot(), nativeRoot()}) {
      openFolders(root);
      for (const auto& entry : std::filesystem::directory_iterator(root))
        std::filesystem::remove_all(entry);
      ASSERT_EQ(::chmod(root.c_str(), 0777), 0);
    }
  }
  /// How many operations did not end in an error.
  [[nodiscard]] long succeeded() const { return succeeded_; }
  void remember(std::string line) {
    constexpr std::size_t kLines = 30;
    story_.push_back(std::move(line));
    if (story_.size() > kLines) story_.pop_front();
  }

  /// The same on both sides.
  void take(const Step& step, const Caller& caller, mode_t mask) {
    std::string onMount;
    std::string onDisk;
    as(caller, [&] {
      umask(mask);
      onDisk = step.run(nativeRoot());
      onMount = step.run(mountedRoot());
      umask(022);
    });
    if (onDisk.find(" E") == std::string::npos) ++succeeded_;
    remember(std::string(caller.name) + ": " + step.text + " " + onDisk);
    ASSERT_EQ(onMount, onDisk) << story();
  }

 private:
  std::deque<std::string> story_;
  long succeeded_ = 0;
};

TEST_F(MountRandomParity, WhateverIsDoneGivesTheSameAnswersAndLeavesTheSameTree) {
  const long steps = numberFrom("YOMBER_PARITY_STEPS", 1'500);
  const auto seed = static_cast<unsigned long>(numberFrom("YOMBER_SEED", 7));
  std::cout << "YOMBER_SEED=" << seed << " YOMBER_PARITY_STEPS=" << steps << "\n";
  Choices choices(seed);
  Tree diskBefore(nativeRoot());
  Tree mountBefore(mountedRoot());
  for (long i = 0; i < steps; ++i) {
    if (i % kStepsToAnew == 0) {
      ASSERT_NO_FATAL_FAILURE(beginAnew());
    }
    diskBefore.waitForClock();
    mountBefore.waitForClock();
    const Caller& caller = choices.caller();
    ASSERT_NO_FATAL_FAILURE(take(choices.step(), caller, choices.mask())) << "step " << i;
    Tree disk(nativeRoot());
    Tree mount(mountedRoot());
    ASSERT_EQ(mount.entries(), disk.entries()) << "step " << i << "\n" << story();
    // The drive's own marks change that date too, at any time.
    const auto changed = mount.changedSince(mountBefore);
    for (const std::string& name : disk.changedSince(diskBefore)) {
      ASSERT_TRUE(std::ranges::find(changed, name) != changed.end())
          << "the date of " << name << " stays, step " << i << "\n"
          << story();
    }
    diskBefore = std::move(disk);
    mountBefore = std::move(mount);
  }
  std::cout << succeeded() << " operations succeeded\n";
  EXPECT_GT(succeeded(), steps / 10);
}

}  // namespace
}  // namespace yomber::testing
