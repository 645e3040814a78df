#include "platform/foundation/key_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <charconv>

#include "platform/foundation/file_descriptor.h"

namespace yomber {
namespace {

std::string_view trimmed(std::string_view text) {
  constexpr std::string_view kSpace = " \t\r";
  const auto first = text.find_first_not_of(kSpace);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kSpace) - first + 1);
}

/// Takes what comes before `separator` off `text`.
std::string_view nextPart(std::string_view& text, char separator) {
  const auto end = text.find(separator);
  const auto part = text.substr(0, end);
  text = end == std::string_view::npos ? std::string_view{} : text.substr(end + 1);
  return trimmed(part);
}

}  // namespace

KeyFile::KeyFile(std::string_view text) {
  std::map<std::string, std::string>* group = nullptr;
  while (!text.empty()) {
    const std::string_view line = nextPart(text, '\n');
    if (line.empty() || line.front() == '#') continue;
    if (line.front() == '[') {
      group =
          line.ends_with(']') ? &groups_[std::string(line.substr(1, line.size() - 2))] : nullptr;
      continue;
    }
    const auto equals = line.find('=');
    if (group == nullptr || equals == std::string_view::npos) continue;
    group->try_emplace(std::string(trimmed(line.substr(0, equals))),
                       trimmed(line.substr(equals + 1)));
  }
}

KeyFile KeyFile::read(const std::string& path, std::size_t limit) {
  // Non-blocking: whatever has the name may be a pipe.
  const FileDescriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) return KeyFile({});
  std::string text;
  std::array<char, 16384> buffer;
  while (text.size() < limit) {
    const ssize_t length = ::read(file.get(), buffer.data(), buffer.size());
    if (length <= 0) break;
    text.append(buffer.data(), static_cast<std::size_t>(length));
  }
  return KeyFile(std::string_view(text).substr(0, limit));
}

const std::string& KeyFile::value(const std::string& group, const std::string& key) const {
  static const std::string kNone;
  const auto keys = groups_.find(group);
  if (keys == groups_.end()) return kNone;
  const auto found = keys->second.find(key);
  return found == keys->second.end() ? kNone : found->second;
}

std::vector<std::string> KeyFile::list(const std::string& group, const std::string& key,
                                       char separator) const {
  std::vector<std::string> result;
  std::string_view rest = value(group, key);
  while (!rest.empty()) {
    const std::string_view part = nextPart(rest, separator);
    if (!part.empty()) result.emplace_back(part);
  }
  return result;
}

int KeyFile::number(const std::string& group, const std::string& key, int otherwise) const {
  const std::string& text = value(group, key);
  int result = 0;
  const auto [end, failure] = std::from_chars(text.data(), text.data() + text.size(), result);
  return failure == std::errc() && end == text.data() + text.size() ? result : otherwise;
}

}  // namespace yomber
