#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>

#include <sys/types.h>

namespace yomber::testing {

/// Fills an empty folder with `count` files as people and programs leave them: from nothing to
/// `largest` bytes, most of them small; odd names, holes, attributes, tags, modes and dates; in
/// folders of folders. The same for the same numbers. Throws where the disk refuses.
void makeOddFiles(const std::string& folder, std::size_t count, std::uint64_t largest);

/// All about a file that its owner would miss.
struct FileLook {
  std::uint64_t size = 0;
  std::string hash;                               ///< SHA-256 of the content; empty: not read
  std::map<std::string, std::string> attributes;  ///< the user's, tags among them
  ino_t inode = 0;
  mode_t mode = 0;
  timespec modified{};
  timespec created{};
};

/// What differs, in words; empty when nothing does. A hash that was not read differs from none.
[[nodiscard]] std::string difference(const FileLook& before, const FileLook& after);

/// The same but for what every copy has of its own: the inode and the date of its making.
[[nodiscard]] std::string differenceOfCopy(const FileLook& original, const FileLook& copy);

/// Looks at a file; throws when it cannot.
[[nodiscard]] FileLook lookAt(const std::string& path, bool withContent = true);

/// Bytes of the blocks that a file has.
[[nodiscard]] std::uint64_t bytesOnDisk(const std::string& path);

/// The files below a folder, by their paths from it. Links are not followed.
[[nodiscard]] std::map<std::string, FileLook> looksBelow(const std::string& folder,
                                                         bool withContent = true);

}  // namespace yomber::testing
