#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/foundation/date.h"
#include "platform/foundation/error.h"
#include "platform/foundation/object.h"

namespace yomber {

/// What a location is on disk, read without following a final symbolic link.
struct NSURLResourceValues {
  bool isDirectory = false;
  bool isRegularFile = false;
  bool isSymbolicLink = false;
  std::uint64_t fileSize = 0;                ///< bytes
  std::uint64_t fileResourceIdentifier = 0;  ///< the disk's inode number
  std::uint64_t volumeIdentifier = 0;        ///< the disk's device number
  NSDate contentModificationDate;
  NSDate attributeModificationDate;
};

/// A location on disk: an absolute path of bytes, plus marks that are set on the object in place.
/// Or, where it is no file URL, a text that leads elsewhere, such as a share's link; its path is
/// empty then, and there is nothing at it on disk.
///
/// `path` is always the logical path. A mark (see `setMark`) is carried by this very object and by
/// nothing made from it.
///
/// Ownership: shared and not to const, since marks change it.
/// Thread-safety: the path is immutable; marks are atomic.
class NSURL final : public NSObject {
 public:
  /// Marks of the location object. Bits, so that several may stand.
  enum class Mark : std::uint32_t {
    Physical = 1U << 0U,  ///< file operations act on the name on this disk, not the logical name
  };

  /// `path` is normalised: absolute, no "." or empty components, no trailing slash. ".." is kept
  /// out by the callers that take paths from outside.
  explicit NSURL(std::string path);

  /// Nil when `path` is empty, relative or holds a NUL byte.
  static NSURLRef fileURLWithPath(std::string_view path);

  /// Nil for what is no URL ("scheme:rest", plain ASCII without spaces, at most 4096 bytes), and
  /// for file URLs.
  static NSURLRef URLWithString(std::string_view text);
  [[nodiscard]] bool isFileURL() const { return text_.empty(); }

  [[nodiscard]] const std::string& path() const { return path_; }
  [[nodiscard]] std::string lastPathComponent() const;
  [[nodiscard]] NSURLRef URLByAppendingPathComponent(std::string_view component) const;
  [[nodiscard]] NSURLRef URLByDeletingLastPathComponent() const;
  /// Percent-encoded "file://" form; what is no file URL, as it is.
  [[nodiscard]] std::string absoluteString() const;

  void setMark(Mark mark);
  [[nodiscard]] bool hasMark(Mark mark) const;

  /// Reads the values; on failure answers nothing and stores a POSIX-domain error.
  [[nodiscard]] std::optional<NSURLResourceValues> resourceValues(
      NSErrorRef* error = nullptr) const;
  /// Whether something exists here whose content can be read now.
  [[nodiscard]] bool checkResourceIsReachableAndReturnError(NSErrorRef* error = nullptr) const;

  [[nodiscard]] std::string description() const override { return absoluteString(); }

 private:
  struct Elsewhere {
    std::string text;
  };
  explicit NSURL(Elsewhere elsewhere) : text_(std::move(elsewhere.text)) {}

  const std::string path_;
  const std::string text_;
  std::atomic<std::uint32_t> marks_{0};
};

/// Whether `path` lies below `ancestor` (both absolute and normalised); equal paths do not.
[[nodiscard]] bool isPathBelow(std::string_view path, std::string_view ancestor);

}  // namespace yomber
