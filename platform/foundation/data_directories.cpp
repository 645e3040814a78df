#include "platform/foundation/data_directories.h"

#include <cstdlib>
#include <string_view>

namespace yomber {
namespace {

std::string environmentOr(const char* name, const std::string& otherwise) {
  const char* const value = std::getenv(name);
  return value != nullptr && *value != '\0' ? value : otherwise;
}

}  // namespace

std::vector<std::string> dataDirectories(const std::string& subfolder) {
  std::vector<std::string> result;
  const std::string home = environmentOr("HOME", "");
  std::string list = environmentOr("XDG_DATA_HOME", home.empty() ? "" : home + "/.local/share");
  list += ":" + environmentOr("XDG_DATA_DIRS", "/usr/local/share:/usr/share");
  std::string_view rest = list;
  while (!rest.empty()) {
    const auto colon = rest.find(':');
    std::string directory(rest.substr(0, colon));
    rest = colon == std::string_view::npos ? std::string_view{} : rest.substr(colon + 1);
    while (directory.size() > 1 && directory.ends_with('/')) directory.pop_back();
    if (directory.starts_with('/')) result.push_back(directory + "/" + subfolder);
  }
  return result;
}

std::string cacheDirectory() {
  const std::string home = environmentOr("HOME", "");
  const std::string result = environmentOr("XDG_CACHE_HOME", home.empty() ? "" : home + "/.cache");
  return result.starts_with('/') ? result : std::string();
}

}  // namespace yomber
