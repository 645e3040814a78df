#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace yomber {

/// What a `.desktop` file says about the containers of its application.
struct DesktopEntry {
  std::string name;           ///< Name=
  std::string iconName;       ///< Icon=
  std::string containerName;  ///< X-Yomber-Container-Name=; empty: the application's name
  std::vector<std::string> containerIDs;  ///< X-Yomber-Containers=; valid ones, each once, in order
  std::vector<std::string> sharedContainerIDs;  ///< X-Yomber-Shared-Containers=; the same
  std::vector<std::string> services;            ///< X-Yomber-Services=; each once, in order
  bool isHidden = false;  ///< Hidden=true: as if the application were not installed
};

/// Reads the group "[Desktop Entry]". Nothing when there is none. Container ids that are not valid
/// are left out and reported in `invalidIDs`.
[[nodiscard]] std::optional<DesktopEntry> parseDesktopEntry(
    std::string_view text, std::vector<std::string>* invalidIDs = nullptr);

/// Reverse-DNS form: letters, digits, '-', '_' and single dots between parts, at least two parts,
/// at most 255 bytes. Such an id is safe as the name of a folder.
[[nodiscard]] bool isValidContainerID(std::string_view containerID);

}  // namespace yomber
