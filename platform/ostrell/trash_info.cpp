#include "platform/ostrell/trash_info.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <ctime>
#include <utility>

#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/file_time.h"
#include "platform/foundation/percent_encoding.h"

namespace yomber {
namespace {

constexpr std::string_view kGroup = "[Trash Info]";
constexpr std::string_view kPath = "Path";
constexpr std::string_view kDeletionDate = "DeletionDate";
constexpr std::string_view kContainer = "X-Yomber-Container";
constexpr std::string_view kPathInContainer = "X-Yomber-Path";
constexpr std::string_view kKind = "X-Yomber-Kind";
/// Besides letters and digits, what stands for itself in a value.
constexpr std::string_view kPlain = "-._~/";

/// Paths may be long, but not without end.
constexpr std::size_t kLargestInfo = 1024 * 1024;

/// Nothing when it cannot be read, or is too large.
std::optional<std::string> readAll(const std::string& path) {
  const FileDescriptor file(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) return std::nullopt;
  std::string text;
  std::array<char, 4096> buffer;
  for (;;) {
    const ssize_t length = read(file.get(), buffer.data(), buffer.size());
    if (length < 0 && errno == EINTR) continue;
    if (length < 0) return std::nullopt;
    if (length == 0) return text;
    text.append(buffer.data(), static_cast<std::size_t>(length));
    if (text.size() > kLargestInfo) return std::nullopt;
  }
}

/// What comes before the last slash, and what after it.
std::pair<std::string_view, std::string_view> splitPath(std::string_view path) {
  const std::size_t slash = path.rfind('/');
  if (slash == std::string_view::npos) return {{}, path};
  return {path.substr(0, slash), path.substr(slash + 1)};
}

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

/// Nothing for a '%' without two digits.
std::optional<std::string> percentDecoded(std::string_view text) {
  std::string result;
  result.reserve(text.size());
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      result += text[i];
      continue;
    }
    if (text.size() - i < 3) return std::nullopt;
    const int high = hexDigit(text[i + 1]);
    const int low = hexDigit(text[i + 2]);
    if (high < 0 || low < 0) return std::nullopt;
    result += static_cast<char>(high * 16 + low);
    i += 2;
  }
  return result;
}

bool isSensible(std::string_view path) {
  if (path.starts_with('/')) path.remove_prefix(1);
  if (path.empty() || path.contains('\0')) return false;
  for (;;) {
    const std::size_t slash = path.find('/');
    const std::string_view component = path.substr(0, slash);
    if (component.empty() || component == "." || component == "..") return false;
    if (slash == std::string_view::npos) return true;
    path.remove_prefix(slash + 1);
  }
}

void addLine(std::string& text, std::string_view key, std::string_view value) {
  if (value.empty()) return;
  text.append(key).append("=").append(value).append("\n");
}

std::string_view trimmed(std::string_view text) {
  constexpr std::string_view kBlank = " \t\r";
  const std::size_t begin = text.find_first_not_of(kBlank);
  if (begin == std::string_view::npos) return {};
  return text.substr(begin, text.find_last_not_of(kBlank) - begin + 1);
}

/// Takes the first line off.
std::string_view takeLine(std::string_view& text) {
  const std::size_t end = text.find('\n');
  const std::string_view line = text.substr(0, end);
  text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
  return trimmed(line);
}

std::string* fieldOf(TrashInfo& info, std::string_view key) {
  if (key == kPath) return &info.path;
  if (key == kDeletionDate) return &info.deletionDate;
  if (key == kContainer) return &info.containerID;
  if (key == kPathInContainer) return &info.pathInContainer;
  return key == kKind ? &info.kind : nullptr;
}

}  // namespace

std::string trashInfoText(const TrashInfo& info) {
  std::string text(kGroup);
  text += '\n';
  addLine(text, kPath, percentEncoded(info.path, kPlain));
  addLine(text, kDeletionDate, info.deletionDate);
  addLine(text, kContainer, percentEncoded(info.containerID, kPlain));
  addLine(text, kPathInContainer, percentEncoded(info.pathInContainer, kPlain));
  addLine(text, kKind, info.kind);
  return text;
}

std::optional<TrashInfo> parseTrashInfo(std::string_view text) {
  if (takeLine(text) != kGroup) return std::nullopt;
  TrashInfo info;
  while (!text.empty()) {
    const std::string_view line = takeLine(text);
    if (line.starts_with('[')) break;  // another group
    const std::size_t equals = line.find('=');
    if (equals == std::string_view::npos) continue;
    std::string* const field = fieldOf(info, trimmed(line.substr(0, equals)));
    if (field == nullptr || !field->empty()) continue;
    auto value = percentDecoded(trimmed(line.substr(equals + 1)));
    if (value) *field = std::move(*value);
  }
  if (!isSensible(info.path)) return std::nullopt;
  const bool hasPlace = !info.containerID.empty() && isSensible(info.pathInContainer) &&
                        !info.pathInContainer.starts_with('/');
  if (!hasPlace) {
    info.containerID.clear();
    info.pathInContainer.clear();
  }
  return info;
}

std::optional<TrashInfo> readTrashInfo(const std::string& path) {
  const auto text = readAll(path);
  return text ? parseTrashInfo(*text) : std::nullopt;
}

std::optional<std::string> trashedName(const std::string& path) {
  const auto [folder, name] = splitPath(path);
  const auto [trash, files] = splitPath(folder);
  const auto trashName = splitPath(trash).second;
  if (files != "files" || !trashName.starts_with(".Trash") || name.empty()) return std::nullopt;
  const auto info = readTrashInfo(std::string(trash) + "/info/" + std::string(name) +
                                  std::string(kTrashInfoSuffix));
  if (!info) return std::nullopt;
  const std::string former(splitPath(info->path).second);
  return former.empty() ? std::nullopt : std::optional(former);
}

std::string trashDeletionDate(NSDate date) {
  const std::time_t seconds = timespecOf(date.nanoseconds()).tv_sec;
  std::tm local{};
  std::array<char, 32> text{};
  if (localtime_r(&seconds, &local) == nullptr) return {};
  const std::size_t length = std::strftime(text.data(), text.size(), "%Y-%m-%dT%H:%M:%S", &local);
  return std::string(text.data(), length);
}

}  // namespace yomber
