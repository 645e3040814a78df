#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <functional>
#include <random>
#include <string_view>

#include "platform/fileprovider/file_operations.h"

namespace yomber {
namespace {

/// Differs from process to process, so that no table of names tells what a token stands for.
const std::string& salt() {
  static const std::string bytes = [] {
    std::random_device random;
    return std::to_string(random()) + std::to_string(random());
  }();
  return bytes;
}

/// What follows the last dot, its dot included, if it is short and plain.
std::string_view extensionOf(std::string_view name) {
  constexpr std::size_t kLongest = 9;
  const std::size_t dot = name.rfind('.');
  if (dot == std::string_view::npos || dot == 0 || name.size() - dot > kLongest) return {};
  for (const char c : name.substr(dot + 1)) {
    const bool isPlain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
    if (!isPlain) return {};
  }
  return name.substr(dot);
}

std::string tokenFor(std::string_view name) {
  const auto hash =
      static_cast<std::uint64_t>(std::hash<std::string>()(salt() + std::string(name)));
  std::array<char, 17> digits{};
  (void)std::snprintf(digits.data(), digits.size(), "%08llx",
                      static_cast<unsigned long long>(hash & 0xFFFF'FFFFU));
  return digits.data() + std::string(extensionOf(name));
}

}  // namespace

std::optional<std::string> fp_obfuscatedPath(const std::optional<std::string>& path) {
  if (!path) return std::nullopt;
  std::string out;
  for (std::size_t at = 0; at < path->size();) {
    const std::size_t slash = std::min(path->find('/', at), path->size());
    if (slash > at) out += tokenFor(std::string_view(*path).substr(at, slash - at));
    if (slash < path->size()) out += '/';
    at = slash + 1;
  }
  return out;
}

}  // namespace yomber
