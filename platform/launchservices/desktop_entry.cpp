#include "platform/launchservices/desktop_entry.h"

#include <algorithm>

namespace yomber {

namespace {

constexpr std::size_t kMaximumIDLength = 255;
constexpr std::size_t kMaximumEntries = 64;  // of one list
constexpr std::size_t kMaximumTextLength = 1024;

bool isIDCharacter(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' ||
         c == '_';
}

std::string_view trimmed(std::string_view text) {
  constexpr std::string_view kSpace = " \t\r";
  const auto first = text.find_first_not_of(kSpace);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kSpace) - first + 1);
}

/// Takes the first line off `text`.
std::string_view nextLine(std::string_view& text) {
  const auto end = text.find('\n');
  const auto line = text.substr(0, end);
  text = end == std::string_view::npos ? std::string_view{} : text.substr(end + 1);
  return trimmed(line);
}

char unescapedCharacter(char escape) {
  switch (escape) {
    case 's':
      return ' ';
    case 'n':
      return '\n';
    case 't':
      return '\t';
    case 'r':
      return '\r';
    default:
      return escape;
  }
}

std::string unescaped(std::string_view value) {
  std::string result;
  for (std::size_t at = 0; at < value.size() && result.size() < kMaximumTextLength; ++at) {
    const bool isEscape = value[at] == '\\' && at + 1 < value.size();
    result += isEscape ? unescapedCharacter(value[++at]) : value[at];
  }
  return result;
}

/// Adds the entries of a list to `to`, each once.
template <typename Accept>
void addEntries(std::string_view list, std::vector<std::string>& to, const Accept& accepts) {
  while (!list.empty() && to.size() < kMaximumEntries) {
    const auto end = list.find(';');
    const std::string each(trimmed(list.substr(0, end)));
    list = end == std::string_view::npos ? std::string_view{} : list.substr(end + 1);
    const bool isKnown = std::ranges::find(to, each) != to.end();
    if (!each.empty() && !isKnown && accepts(each)) to.push_back(each);
  }
}

void addContainers(std::string_view list, std::vector<std::string>& to,
                   std::vector<std::string>* invalidIDs) {
  addEntries(list, to, [invalidIDs](const std::string& id) {
    if (isValidContainerID(id)) return true;
    if (invalidIDs != nullptr) invalidIDs->push_back(id.substr(0, kMaximumIDLength));
    return false;
  });
}

void readKey(std::string_view line, DesktopEntry& entry, std::vector<std::string>* invalidIDs) {
  const auto equals = line.find('=');
  if (equals == std::string_view::npos) return;
  const std::string_view key = trimmed(line.substr(0, equals));
  const std::string_view value = trimmed(line.substr(equals + 1));
  if (key == "Name") {
    entry.name = unescaped(value);
  } else if (key == "Icon") {
    entry.iconName = unescaped(value);
  } else if (key == "Hidden") {
    entry.isHidden = value == "true";
  } else if (key == "X-Yomber-Container-Name") {
    entry.containerName = unescaped(value);
  } else if (key == "X-Yomber-Container" || key == "X-Yomber-Containers") {
    addContainers(value, entry.containerIDs, invalidIDs);
  } else if (key == "X-Yomber-Shared-Containers") {
    addContainers(value, entry.sharedContainerIDs, invalidIDs);
  } else if (key == "X-Yomber-Services") {
    addEntries(value, entry.services,
               [](const std::string& service) { return service.size() <= kMaximumIDLength; });
  }
}

}  // namespace

std::optional<DesktopEntry> parseDesktopEntry(std::string_view text,
                                              std::vector<std::string>* invalidIDs) {
  std::optional<DesktopEntry> entry;
  bool isInGroup = false;
  while (!text.empty()) {
    const std::string_view line = nextLine(text);
    if (line.empty() || line.front() == '#') continue;
    if (line.front() == '[') {
      isInGroup = line == "[Desktop Entry]";
      if (isInGroup && !entry) entry.emplace();
    } else if (isInGroup) {
      readKey(line, *entry, invalidIDs);
    }
  }
  return entry;
}

bool isValidContainerID(std::string_view containerID) {
  if (containerID.size() > kMaximumIDLength) return false;
  std::size_t parts = 0;
  while (true) {
    const auto dot = containerID.find('.');
    const auto part = containerID.substr(0, dot);
    if (part.empty() || !std::ranges::all_of(part, isIDCharacter)) return false;
    ++parts;
    if (dot == std::string_view::npos) return parts >= 2;
    containerID.remove_prefix(dot + 1);
  }
}

}  // namespace yomber
