#include "platform/launchservices/icon_themes.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstdlib>
#include <limits>

#include "platform/foundation/data_directories.h"
#include "platform/foundation/key_file.h"

namespace yomber {
namespace {

constexpr const char* kThemeGroup = "Icon Theme";
constexpr const char* kLastTheme = "hicolor";
constexpr std::size_t kMaximumThemes = 32;
constexpr std::size_t kMaximumNameLength = 255;
constexpr int kMaximumSide = 4096;

bool isFile(const std::string& path) {
  struct stat status{};
  return stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode);
}

/// Some write a name with what it ends with.
std::string withoutSuffix(const std::string& name) {
  for (const char* suffix : {".png", ".svg", ".xpm"})
    if (name.ends_with(suffix)) return name.substr(0, name.size() - 4);
  return name;
}

bool isThemeName(const std::string& name) {
  return !name.empty() && name.size() <= kMaximumNameLength &&
         name.find('/') == std::string::npos && name.front() != '.';
}

std::optional<IconFile> fileWithSuffix(const std::string& path) {
  if (isFile(path + ".png")) return IconFile{.path = path + ".png"};
  if (isFile(path + ".svg")) return IconFile{.path = path + ".svg", .isScalable = true};
  return std::nullopt;
}

/// The smaller the better: first those that are no smaller than `side`.
std::pair<bool, int> misfit(const IconFile& icon, int side) {
  const int own = icon.isScalable ? side : icon.side;
  return {own < side, own < side ? std::numeric_limits<int>::max() - own : own};
}

std::string settingsTheme() {
  const char* const home = std::getenv("HOME");
  const char* const set = std::getenv("XDG_CONFIG_HOME");
  const std::string config = set != nullptr && *set == '/' ? std::string(set)
                             : home != nullptr             ? std::string(home) + "/.config"
                                                           : "/etc/xdg";
  for (const std::string& folder : {config, std::string("/etc")}) {
    for (const char* file : {"/gtk-4.0/settings.ini", "/gtk-3.0/settings.ini"}) {
      const KeyFile settings = KeyFile::read(folder + file);
      const std::string& theme = settings.value("Settings", "gtk-icon-theme-name");
      if (isThemeName(theme)) return theme;
    }
  }
  const KeyFile settings = KeyFile::read(config + "/kdeglobals");
  const std::string& theme = settings.value("Icons", "Theme");
  return isThemeName(theme) ? theme : kLastTheme;
}

}  // namespace

IconThemes::IconThemes(std::vector<std::string> bases, std::vector<std::string> pictures,
                       std::string theme)
    : bases_(std::move(bases)), pictures_(std::move(pictures)), theme_(std::move(theme)) {}

IconThemes IconThemes::system() {
  std::vector<std::string> bases = dataDirectories("icons");
  if (const char* const home = std::getenv("HOME"); home != nullptr && *home == '/')
    bases.insert(bases.begin(), std::string(home) + "/.icons");
  return {std::move(bases), dataDirectories("pixmaps"), settingsTheme()};
}

std::optional<IconFile> IconThemes::find(const std::string& name, int side) const {
  if (name.starts_with('/')) {
    if (!isFile(name)) return std::nullopt;
    return IconFile{.path = name, .isScalable = name.ends_with(".svg")};
  }
  const std::string plain = withoutSuffix(name);
  if (!isThemeName(plain)) return std::nullopt;
  for (const std::string& theme : themesInOrder())
    if (auto found = findInTheme(theme, plain, side)) return found;
  return findPicture(plain);
}

std::vector<std::string> IconThemes::themesInOrder() const {
  std::vector<std::string> result{theme_};
  for (std::size_t at = 0; at < result.size() && result.size() < kMaximumThemes; ++at) {
    for (const std::string& base : bases_) {
      const KeyFile index = KeyFile::read(base + "/" + result[at] + "/index.theme");
      if (!index.hasGroup(kThemeGroup)) continue;
      for (const std::string& parent : index.list(kThemeGroup, "Inherits", ','))
        if (isThemeName(parent) && std::ranges::find(result, parent) == result.end())
          result.push_back(parent);
      break;
    }
  }
  // Everybody's last resort, wherever else it was named.
  std::erase(result, kLastTheme);
  result.emplace_back(kLastTheme);
  return result;
}

std::optional<IconFile> IconThemes::findInTheme(const std::string& theme, const std::string& name,
                                                int side) const {
  KeyFile index({});
  for (const std::string& base : bases_) {
    index = KeyFile::read(base + "/" + theme + "/index.theme");
    if (index.hasGroup(kThemeGroup)) break;
  }
  std::vector<std::string> folders = index.list(kThemeGroup, "Directories", ',');
  const std::vector<std::string> scaled = index.list(kThemeGroup, "ScaledDirectories", ',');
  folders.insert(folders.end(), scaled.begin(), scaled.end());
  std::optional<IconFile> best;
  for (const std::string& folder : folders) {
    const int size = std::clamp(index.number(folder, "Size", 0), 0, kMaximumSide);
    const int scale = std::clamp(index.number(folder, "Scale", 1), 1, 8);
    if (folder.find("..") != std::string::npos) continue;
    for (const std::string& base : bases_) {
      auto found = fileWithSuffix(base + "/" + theme + "/" + folder + "/" + name);
      if (!found) continue;
      found->side = size * scale;
      found->isThemed = true;
      if (!best || misfit(*found, side) < misfit(*best, side)) best = found;
      break;
    }
  }
  return best;
}

std::optional<IconFile> IconThemes::findPicture(const std::string& name) const {
  for (const auto* folders : {&bases_, &pictures_})
    for (const std::string& folder : *folders)
      if (auto found = fileWithSuffix(folder + "/" + name)) return found;
  return std::nullopt;
}

}  // namespace yomber
