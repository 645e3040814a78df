#include "mount/content_walk.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <memory>
#include <string_view>
#include <utility>
#include <vector>

#include "mount/file_identity.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/file_time.h"
#include "platform/foundation/unnoticed_reads.h"

namespace yomber {
namespace {

/// What is away takes its first block, and one for its attributes at most.
std::uint64_t contentBytes(const std::string& path, const struct stat& status) {
  const auto size = static_cast<std::uint64_t>(status.st_size);
  const std::uint64_t bytes = static_cast<std::uint64_t>(status.st_blocks) * kBlockBytes;
  if (!S_ISREG(status.st_mode) || size <= kKeptBytes) return 0;
  const bool mayBeAway = bytes < size || bytes <= 2 * kKeptBytes;
  return mayBeAway && isFaultAtPath(path) ? 0 : bytes;
}

using Stream = std::unique_ptr<DIR, int (*)(DIR*)>;

Stream openFolder(const std::string& path) {
  FileDescriptor folder(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (folder) readUnnoticed(folder.get());
  Stream stream(folder ? fdopendir(folder.get()) : nullptr, closedir);
  if (stream) (void)folder.release();
  return stream;
}

bool isAnEntry(const dirent& entry) {
  const std::string_view name(entry.d_name);
  const bool mayCount =
      entry.d_type == DT_REG || entry.d_type == DT_DIR || entry.d_type == DT_UNKNOWN;
  return mayCount && name != "." && name != "..";
}

}  // namespace

std::uint64_t contentBytesAt(const std::string& path) {
  struct stat status{};
  return lstat(path.c_str(), &status) == 0 ? contentBytes(path, status) : 0;
}

void walkContent(const std::string& folder, const std::function<bool(ContentFile&& file)>& visit) {
  struct stat top{};
  if (lstat(folder.c_str(), &top) != 0) return;
  std::vector<std::string> waiting{folder};
  while (!waiting.empty()) {
    const std::string path = std::move(waiting.back());
    waiting.pop_back();
    const Stream stream = openFolder(path);
    if (!stream) continue;
    for (const dirent* entry = readdir(stream.get()); entry != nullptr;
         entry = readdir(stream.get())) {
      struct stat status{};
      if (!isAnEntry(*entry) ||
          fstatat(dirfd(stream.get()), entry->d_name, &status, AT_SYMLINK_NOFOLLOW) != 0 ||
          status.st_dev != top.st_dev) {
        continue;
      }
      std::string found = path + "/" + entry->d_name;
      if (S_ISDIR(status.st_mode)) {
        waiting.push_back(std::move(found));
        continue;
      }
      const std::uint64_t bytes = contentBytes(found, status);
      if (bytes > 0 &&
          !visit({std::move(found), status.st_ino, bytes, nanosecondsOf(status.st_atim)})) {
        return;
      }
    }
  }
}

}  // namespace yomber
