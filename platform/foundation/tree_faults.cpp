#include "platform/foundation/tree_faults.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/foundation/directory_stream.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/file_descriptor.h"

namespace yomber {
namespace {

bool holdsFaultIn(int folder, const char* name);

bool isAnyBelow(int folder, const char* name) {
  constexpr int kOpening = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
  const auto names = readDirectory(FileDescriptor(openat(folder, name, kOpening)));
  if (names == nullptr) return true;
  while (const char* const next = nextName(names.get())) {
    if (holdsFaultIn(dirfd(names.get()), next)) return true;
  }
  return errno != 0;
}

bool holdsFaultIn(int folder, const char* name) {
  const FileDescriptor file(openat(folder, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0) return errno != ENOENT;
  if (S_ISDIR(status.st_mode)) return isAnyBelow(folder, name);
  return S_ISREG(status.st_mode) && isFault(file.get());
}

}  // namespace

bool holdsFault(const std::string& path) { return holdsFaultIn(AT_FDCWD, path.c_str()); }

}  // namespace yomber
