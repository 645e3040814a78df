#include "platform/ostrell/exclusions.h"

#include <algorithm>
#include <array>
#include <cstddef>

namespace yomber {
namespace {

/// "*" stands for anything, also for nothing, at the one place where the pattern has it.
struct Pattern {
  std::string_view prefix;
  std::string_view suffix;
};

constexpr std::array kPatterns = {
    Pattern{".~lock.", "#"},         // office suites' locks
    Pattern{"~$", ""},               // the same, of another family
    Pattern{".#", ""},               // Emacs' locks
    Pattern{".goutputstream-", ""},  // GIO's file while it is written
    Pattern{".fuse_hidden", ""},     // removed, but still open
    Pattern{".nfs0", ""},            // the same, on network file systems
    Pattern{"", ".part"},            // partial downloads
    Pattern{"", ".partial"},
    Pattern{"", ".crdownload"},
    Pattern{"", ".opdownload"},
    Pattern{".", ".kate-swp"},  // Kate's swap files
    Pattern{"", ".nosync"},     // the user's own wish
};

constexpr std::array<std::string_view, 1> kNames = {".DS_Store"};

bool matches(std::string_view name, const Pattern& pattern) {
  return name.size() >= pattern.prefix.size() + pattern.suffix.size() &&
         name.starts_with(pattern.prefix) && name.ends_with(pattern.suffix);
}

/// ".notes.txt.swp", and .swo, .swn … where that was taken.
bool isVimSwap(std::string_view name) {
  if (name.size() < 6 || !name.starts_with('.')) return false;
  const std::string_view extension = name.substr(name.size() - 4);
  const char last = extension.back();
  return extension.starts_with(".sw") && ((last >= 'a' && last <= 'p') || last == 'x');
}

/// "#notes.txt#".
bool isEmacsAutosave(std::string_view name) {
  return name.size() > 2 && name.starts_with('#') && name.ends_with('#');
}

std::size_t countExcludedNames(std::string_view path) {
  std::size_t count = 0;
  while (!path.empty()) {
    const std::size_t end = std::min(path.find('/'), path.size());
    if (qs_isExcludedName(path.substr(0, end))) ++count;
    path.remove_prefix(std::min(end + 1, path.size()));
  }
  return count;
}

}  // namespace

bool qs_isExcludedName(std::string_view name) {
  return std::ranges::find(kNames, name) != kNames.end() ||
         std::ranges::any_of(kPatterns,
                             [&](const Pattern& pattern) { return matches(name, pattern); }) ||
         isVimSwap(name) || isEmacsAutosave(name);
}

bool qs_isExcludedMove(std::string_view from, std::string_view to) {
  // Above the drive such names mean nothing, and both have them.
  return countExcludedNames(to) > countExcludedNames(from);
}

}  // namespace yomber
