#include "platform/foundation/directory_stream.h"

#include <cerrno>
#include <string_view>

namespace yomber {

DirectoryStream readDirectory(FileDescriptor directory) {
  if (!directory) return nullptr;
  DirectoryStream stream(fdopendir(directory.get()));
  if (stream != nullptr) (void)directory.release();
  return stream;
}

const char* nextName(DIR* directory) {
  while (true) {
    errno = 0;
    const dirent* const entry = readdir(directory);
    if (entry == nullptr) return nullptr;
    const std::string_view name(entry->d_name);
    if (name != "." && name != "..") return entry->d_name;
  }
}

}  // namespace yomber
