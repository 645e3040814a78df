#pragma once

#include <string_view>

namespace yomber {

/// Whether a file or folder of this name never syncs, nor anything in it: editors' lock and swap
/// files, partial downloads, temporary names of file systems and desktops, and names ending in
/// ".nosync". The daemon and its clients decide by this one rule.
///
/// `name` is one path component, as bytes.
[[nodiscard]] bool qs_isExcludedName(std::string_view name);

/// Whether a move takes something to where it does not sync from where it does; by the paths' names
/// alone.
[[nodiscard]] bool qs_isExcludedMove(std::string_view from, std::string_view to);

}  // namespace yomber
