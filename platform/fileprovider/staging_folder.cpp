#include "platform/fileprovider/staging_folder.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/foundation/directory_stream.h"
#include "platform/foundation/error.h"
#include "platform/foundation/log.h"
#include "platform/foundation/tree_removal.h"

namespace yomber {
namespace {

constexpr std::string_view kPrefix = ".yomber-staging-";
constexpr std::string_view kSuffix = ".nosync";

std::string randomName() {
  std::uint64_t number = 0;
  (void)getrandom(&number, sizeof number, 0);
  std::array<char, 17> digits{};
  (void)std::snprintf(digits.data(), digits.size(), "%016llx",
                      static_cast<unsigned long long>(number));
  std::string name(kPrefix);
  return name.append(digits.data()).append(kSuffix);
}

void removeTree(const std::string& path) {
  TreeRemoval removal(TreeRemoval::Protection::Lift);
  if (removal.run(path) || errno == ENOENT) return;
  const NSErrorRef error = NSError::errorWithErrno(errno, removal.failedPath());
  log_error(defaultLog(), "[ERROR] can't remove what was staged at %s: %@", path.c_str(), error);
}

/// The folder, locked; none when somebody else uses it, or when it has just been removed.
FileDescriptor lockFolder(const std::string& path) {
  FileDescriptor folder(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!folder || flock(folder.get(), LOCK_EX | LOCK_NB) != 0) return {};
  struct stat status{};
  const bool isOurs =
      fstat(folder.get(), &status) == 0 && status.st_nlink > 0 && status.st_uid == geteuid();
  return isOurs ? std::move(folder) : FileDescriptor();
}

/// Removes what nobody uses any more.
void sweep(const std::string& parent) {
  const auto stream = readDirectory(
      FileDescriptor(open(parent.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC)));
  if (stream == nullptr) return;
  while (const char* const name = nextName(stream.get())) {
    const std::string_view view(name);
    if (!view.starts_with(kPrefix) || !view.ends_with(kSuffix)) continue;
    const std::string path = parent + "/" + name;
    const FileDescriptor lock = lockFolder(path);
    if (lock) removeTree(path);
  }
}

}  // namespace

StagingFolder::StagingFolder(std::string path, FileDescriptor lock, dev_t device)
    : path_(std::move(path)), lock_(std::move(lock)), device_(device) {}

StagingFolder::~StagingFolder() { removeTree(path_); }

std::unique_ptr<StagingFolder> StagingFolder::make(const std::string& parent) {
  sweep(parent);
  constexpr int kAttempts = 16;  // a sweeper may come between the making and the locking
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    std::string path = parent + "/" + randomName();
    if (mkdir(path.c_str(), S_IRWXU) != 0) {
      if (errno == EEXIST) continue;
      return nullptr;
    }
    FileDescriptor lock = lockFolder(path);
    struct stat status{};
    if (!lock || fstat(lock.get(), &status) != 0) continue;
    return std::unique_ptr<StagingFolder>(
        new StagingFolder(std::move(path), std::move(lock), status.st_dev));
  }
  errno = EBUSY;
  return nullptr;
}

}  // namespace yomber
