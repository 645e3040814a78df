#pragma once

#include <optional>
#include <string>
#include <vector>

namespace yomber {

struct IconFile {
  std::string path;
  /// Pixels, as its folder says; 0: unknown, or it can be drawn in any size.
  int side = 0;
  bool isScalable = false;  ///< SVG
  bool isThemed = false;    ///< from an icon theme, in contrast to a picture beside them
};

/// Where icons are installed: icon themes and single pictures.
///
/// Thread-safety: immutable; every operation reads files.
class IconThemes {
 public:
  /// `bases` hold themes; `pictures` single pictures. `theme` is asked before hicolor.
  IconThemes(std::vector<std::string> bases, std::vector<std::string> pictures, std::string theme);
  /// This user's and this machine's, with the theme that the user's settings name.
  static IconThemes system();

  /// Of the first theme that has the icon, the nearest that is no smaller than `side`, or else the
  /// largest. `name` may be an absolute path. Only PNG and SVG.
  [[nodiscard]] std::optional<IconFile> find(const std::string& name, int side) const;

 private:
  [[nodiscard]] std::vector<std::string> themesInOrder() const;
  [[nodiscard]] std::optional<IconFile> findInTheme(const std::string& theme,
                                                    const std::string& name, int side) const;
  [[nodiscard]] std::optional<IconFile> findPicture(const std::string& name) const;

  const std::vector<std::string> bases_;
  const std::vector<std::string> pictures_;
  const std::string theme_;
};

}  // namespace yomber
