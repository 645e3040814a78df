#include "zarn/staged_removal.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <string_view>
#include <utility>
#include <vector>

#include "zarn/file_descriptor.h"

namespace yomber {
namespace {

constexpr mode_t kPrivate = 0700;
constexpr int kOpenFolder = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

struct CloseStream {
  void operator()(DIR* stream) const { closedir(stream); }
};
using Stream = std::unique_ptr<DIR, CloseStream>;

class StagedRemoval {
 public:
  explicit StagedRemoval(int base) : base_(base) {}

  RemovedItems run() {
    // What is moved up while a round is under way is the next round's.
    for (std::vector<std::string> names = namesIn(base_); !names.empty();
         names = std::exchange(movedUp_, {})) {
      for (const std::string& name : names) removeTop(name);
    }
    return result_;
  }

 private:
  void fail(int number) {
    if (result_.failure == 0) result_.failure = number;
  }
  void count(int outcome) {
    if (outcome == 0) {
      ++result_.count;
    } else if (errno != ENOENT) {
      fail(errno);
    }
  }

  std::vector<std::string> namesIn(int folder) {
    std::vector<std::string> names;
    const int again = openat(folder, ".", kOpenFolder);
    const Stream stream(again < 0 ? nullptr : fdopendir(again));
    if (!stream) {
      fail(errno);
      if (again >= 0) close(again);
      return names;
    }
    while (const dirent* const entry = readdir(stream.get())) {
      const std::string_view name = entry->d_name;
      if (name != "." && name != "..") names.emplace_back(name);
    }
    return names;
  }

  static bool isFolder(int folder, const char* name) {
    struct stat status{};
    return fstatat(folder, name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(status.st_mode);
  }

  void removeTop(const std::string& name) {
    if (!isFolder(base_, name.c_str())) return count(unlinkat(base_, name.c_str(), 0));
    // What is in a folder that may not be written could not go.
    (void)fchmodat(base_, name.c_str(), kPrivate, 0);
    const FileDescriptor opened(openat(base_, name.c_str(), kOpenFolder));
    if (!opened) return fail(errno);
    for (const std::string& child : namesIn(opened.get())) removeChild(opened.get(), child);
    count(unlinkat(base_, name.c_str(), AT_REMOVEDIR));
  }

  void removeChild(int folder, const std::string& name) {
    if (!isFolder(folder, name.c_str())) return count(unlinkat(folder, name.c_str(), 0));
    if (unlinkat(folder, name.c_str(), AT_REMOVEDIR) == 0) return count(0);
    (void)fchmodat(folder, name.c_str(), kPrivate, 0);
    // Names that are taken are those that this has given, or that were there when it began.
    for (;;) {
      std::string above = ".moved-up-" + std::to_string(++last_);
      if (renameat2(folder, name.c_str(), base_, above.c_str(), RENAME_NOREPLACE) == 0) {
        movedUp_.push_back(std::move(above));
        return;
      }
      if (errno != EEXIST) return fail(errno);
    }
  }

  const int base_;
  std::uint64_t last_ = 0;
  std::vector<std::string> movedUp_;
  RemovedItems result_;
};

}  // namespace

RemovedItems removeStaged(int folder) { return StagedRemoval(folder).run(); }

}  // namespace yomber
