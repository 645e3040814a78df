#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/foundation/error.h"

namespace yomber {

/// The desktop's own store of thumbnails (`~/.cache/thumbnails`), from which file managers take
/// pictures of files without opening them.
///
/// An entry belongs to a file's location and modification date; an entry of another date does not
/// count. Nothing is ever written of files that cannot be drawn: others may be able to.
/// Thread-safety: every operation may be called on any thread, and other programs use the same
/// folders at the same time.
class ThumbnailCache {
 public:
  /// What a picture is of.
  struct File {
    std::string path;        ///< absolute, as applications see it
    std::int64_t mtime = 0;  ///< seconds since the epoch
    std::uint64_t size = 0;  ///< bytes
  };
  /// Folders by the largest side that their pictures may have, in pixels.
  enum class Flavour : std::uint16_t { Normal = 128, Large = 256, ExtraLarge = 512, Double = 1024 };

  /// `directory`: where the folders of the flavours are; made when something is stored.
  explicit ThumbnailCache(std::string directory) : directory_(std::move(directory)) {}
  /// This user's.
  static ThumbnailCache system();

  [[nodiscard]] bool has(const File& file, Flavour flavour) const;
  /// `png` is no larger than the flavour's side. Replaces what is there; readers see the old or the
  /// new one.
  [[nodiscard]] NSErrorRef store(const File& file, Flavour flavour, std::string_view png) const;

  [[nodiscard]] std::string entryPath(const std::string& path, Flavour flavour) const;

 private:
  const std::string directory_;
};

/// "file:///…", escaped as desktops do it, byte for byte: the names of entries depend on it.
[[nodiscard]] std::string fileURI(std::string_view path);

}  // namespace yomber
