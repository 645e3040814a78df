#pragma once

#include <string>
#include <vector>

namespace yomber {

/// Where applications are installed: `applications` below $XDG_DATA_HOME, then below each of
/// $XDG_DATA_DIRS, with the defaults of the XDG base directories. The earlier ones count first.
[[nodiscard]] std::vector<std::string> applicationDirectories();

struct DesktopFile {
  std::string id;  ///< the desktop file id without the suffix
  std::string path;
};

/// The `.desktop` files below these directories, in the order of the directories and then of their
/// ids: names of subdirectories are joined to the name with '-'. Of several files with one id, the
/// first stands in for the others.
[[nodiscard]] std::vector<DesktopFile> desktopFiles(const std::vector<std::string>& directories);

/// The file's text; empty for what is no regular file or cannot be read. What is longer than any
/// desktop file is cut off.
[[nodiscard]] std::string desktopFileText(const std::string& path);

}  // namespace yomber
