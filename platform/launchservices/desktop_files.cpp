#include "platform/launchservices/desktop_files.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <map>
#include <set>
#include <string_view>

#include "platform/foundation/data_directories.h"
#include "platform/foundation/file_descriptor.h"

namespace yomber {
namespace {

constexpr std::size_t kMaximumFileSize = 256 * std::size_t{1024};
constexpr std::string_view kSuffix = ".desktop";
constexpr int kMaximumDepth = 4;

void collectFiles(const std::string& directory, const std::string& prefix, int depth,
                  std::map<std::string, std::string>& pathsByID) {
  DIR* const stream = opendir(directory.c_str());
  if (stream == nullptr) return;
  while (const dirent* const entry = readdir(stream)) {
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    const std::string path = directory + "/" + name;
    if (name.ends_with(kSuffix)) {
      pathsByID.try_emplace(prefix + name.substr(0, name.size() - kSuffix.size()), path);
    } else if (entry->d_type == DT_DIR && depth < kMaximumDepth) {
      collectFiles(path, prefix + name + "-", depth + 1, pathsByID);
    }
  }
  closedir(stream);
}

}  // namespace

std::vector<std::string> applicationDirectories() { return dataDirectories("applications"); }

std::vector<DesktopFile> desktopFiles(const std::vector<std::string>& directories) {
  std::vector<DesktopFile> result;
  std::set<std::string> seenIDs;
  for (const auto& directory : directories) {
    std::map<std::string, std::string> pathsByID;
    collectFiles(directory, "", 0, pathsByID);
    for (const auto& [id, path] : pathsByID) {
      if (seenIDs.insert(id).second) result.push_back({id, path});
    }
  }
  return result;
}

std::string desktopFileText(const std::string& path) {
  // Non-blocking: what is called .desktop may be a pipe.
  const FileDescriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) return {};
  std::string text;
  std::array<char, 16384> buffer;
  while (text.size() < kMaximumFileSize) {
    const ssize_t length = read(file.get(), buffer.data(), buffer.size());
    if (length <= 0) break;
    text.append(buffer.data(), static_cast<std::size_t>(length));
  }
  return text;
}

}  // namespace yomber
