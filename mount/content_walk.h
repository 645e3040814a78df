#pragma once

#include <cstdint>
#include <functional>
#include <string>

namespace yomber {

/// A file that takes blocks of this disk which it would not take if its content were away.
struct ContentFile {
  std::string path;
  std::uint64_t inode = 0;
  std::uint64_t bytes = 0;    ///< of disk blocks
  std::int64_t accessed = 0;  ///< ns since the epoch
};

/// What the content of the file there takes, in bytes of disk blocks: 0 when it is away, or fits
/// into what every file keeps, or there is no file.
[[nodiscard]] std::uint64_t contentBytesAt(const std::string& path);

/// Every such file below a folder, on its file system, until `visit` answers false. What cannot be
/// read is left out. The memory for it grows with the folders that wait, not with the files.
void walkContent(const std::string& folder, const std::function<bool(ContentFile&& file)>& visit);

}  // namespace yomber
