#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <unordered_map>

#include "platform/foundation/error.h"

namespace yomber {

/// Thumbnails as files of a folder of this machine, one for each item, named after it.
///
/// Thread-safety: one thread at a time.
class ThumbnailFiles {
 public:
  explicit ThumbnailFiles(std::string folder) : folder_(std::move(folder)) {}

  /// Makes the folder where it is missing.
  [[nodiscard]] NSErrorRef open() const;
  /// Writes the picture into a file of its own; `path` says which. Nothing is ever replaced: a
  /// name that is taken is counted on ("photo.jpg 2.png"). Leaves nothing when it fails.
  [[nodiscard]] NSErrorRef write(const std::string& itemName, std::string_view picture,
                                 std::string& path);

 private:
  const std::string folder_;
  /// The number that is tried next for a name that was given out before: of a million equal names
  /// none is tried twice.
  std::unordered_map<std::string, std::uint64_t> nextNumbers_;
};

/// What a picture's file ends with, told by its first bytes: ".png", ".jpg" …; ".img" for others.
[[nodiscard]] std::string_view pictureSuffix(std::string_view picture);

}  // namespace yomber
