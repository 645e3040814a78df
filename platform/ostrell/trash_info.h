#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/date.h"

namespace yomber {

/// What the trash keeps about one item: a `.trashinfo` file of the freedesktop.org trash.
///
/// Other programs read and write such files too: theirs have nothing but `path` and `deletionDate`.
struct TrashInfo {
  /// Where the item was, relative to the drive's root as the mount shows it (containers by their
  /// display names), or absolute. Bytes, without "." and ".." components.
  std::string path;
  std::string deletionDate;     ///< local time, "2026-03-31T18:05:09"
  std::string containerID;      ///< ours; empty when unknown
  std::string pathInContainer;  ///< ours: below the container's Documents; set with `containerID`
  std::string kind;             ///< ours: "document", "folder", "alias", "bookmark", "symlink"

  friend bool operator==(const TrashInfo&, const TrashInfo&) = default;
};

/// The information about `<trash>/files/NAME` is in `<trash>/info/NAME.trashinfo`.
inline constexpr std::string_view kTrashInfoSuffix = ".trashinfo";

/// The file's text, and back. Nothing for what is no such file, or has no path that makes sense;
/// keys that are not known, and of those that come twice all but the first, are passed over.
[[nodiscard]] std::string trashInfoText(const TrashInfo& info);
[[nodiscard]] std::optional<TrashInfo> parseTrashInfo(std::string_view text);

/// Of a file; nothing as well when it cannot be read, or is too large to be one.
[[nodiscard]] std::optional<TrashInfo> readTrashInfo(const std::string& path);
/// The name that a file at `<trash>/files/NAME` had, by the information beside it. Nothing for what
/// lies elsewhere, or deeper. Reads the disk.
[[nodiscard]] std::optional<std::string> trashedName(const std::string& path);

/// A deletion date as it is written.
[[nodiscard]] std::string trashDeletionDate(NSDate date);

}  // namespace yomber
