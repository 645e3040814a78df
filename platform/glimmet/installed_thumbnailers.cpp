#include "platform/glimmet/installed_thumbnailers.h"

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <fstream>

#include "platform/foundation/data_directories.h"
#include "platform/foundation/key_file.h"

namespace yomber {
namespace {

constexpr const char* kGroup = "Thumbnailer Entry";
constexpr std::string_view kSuffix = ".thumbnailer";

std::int64_t nanoseconds(const timespec& time) {
  return std::int64_t{time.tv_sec} * 1'000'000'000 + time.tv_nsec;
}

bool isExecutable(const std::string& path) {
  struct stat status{};
  return stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode) &&
         access(path.c_str(), X_OK) == 0;
}

/// By its path, or along $PATH.
bool isInstalled(const std::string& program) {
  if (program.empty()) return true;
  if (program.find('/') != std::string::npos) return isExecutable(program);
  const char* const path = std::getenv("PATH");
  std::string_view rest = path != nullptr ? path : "/usr/local/bin:/usr/bin:/bin";
  while (!rest.empty()) {
    const auto colon = rest.find(':');
    const std::string directory(rest.substr(0, colon));
    rest = colon == std::string_view::npos ? std::string_view{} : rest.substr(colon + 1);
    if (directory.starts_with('/') && isExecutable(directory + "/" + program)) return true;
  }
  return false;
}

/// As a shell splits them, without its other powers; none when a quote is not closed.
std::vector<std::string> words(std::string_view text) {
  std::vector<std::string> all;
  bool isInWord = false;
  char quote = '\0';
  for (std::size_t at = 0; at < text.size(); ++at) {
    const char c = text[at];
    const bool isSpace = quote == '\0' && (c == ' ' || c == '\t');
    if (!isSpace && !std::exchange(isInWord, true)) all.emplace_back();
    if (isSpace) {
      isInWord = false;
    } else if (quote == '\0' && (c == '"' || c == '\'')) {
      quote = c;
    } else if (c == quote) {
      quote = '\0';
    } else if (c == '\\' && quote != '\'' && at + 1 < text.size()) {
      all.back() += text[++at];
    } else {
      all.back() += c;
    }
  }
  return quote == '\0' ? all : std::vector<std::string>();
}

/// Sorted; without the suffix's false friends.
std::vector<std::string> thumbnailerNames(const std::string& directory) {
  std::vector<std::string> names;
  DIR* const stream = opendir(directory.c_str());
  if (stream == nullptr) return names;
  while (const dirent* const entry = readdir(stream)) {
    const std::string_view name = entry->d_name;
    if (name.size() > kSuffix.size() && name.ends_with(kSuffix)) names.emplace_back(name);
  }
  closedir(stream);
  std::ranges::sort(names);
  return names;
}

}  // namespace

InstalledThumbnailers::InstalledThumbnailers(std::vector<std::string> directories,
                                             std::string aliasesPath)
    : directories_(std::move(directories)), aliasesPath_(std::move(aliasesPath)) {}

InstalledThumbnailers& InstalledThumbnailers::system() {
  // Never destroyed: threads may ask while the process ends.
  static auto* const thumbnailers = new InstalledThumbnailers(dataDirectories("thumbnailers"));
  return *thumbnailers;
}

std::vector<std::string> InstalledThumbnailers::commandFor(std::string_view type) {
  std::vector<Thumbnailer> candidates;
  {
    const LockGuard lock(mutex_);
    if (isChanged()) readAll();
    const auto found = thumbnailers_.find(canonical(type));
    if (found == thumbnailers_.end()) return {};
    candidates = found->second;
  }
  const auto first = std::ranges::find_if(
      candidates, [](const Thumbnailer& each) { return isInstalled(each.program); });
  return first == candidates.end() ? std::vector<std::string>() : first->command;
}

std::vector<std::string> InstalledThumbnailers::types() {
  const LockGuard lock(mutex_);
  if (isChanged()) readAll();
  std::vector<std::string> all;
  for (const auto& [type, candidates] : thumbnailers_) {
    const auto isThere = [](const Thumbnailer& each) { return isInstalled(each.program); };
    if (std::ranges::any_of(candidates, isThere)) all.push_back(type);
  }
  std::ranges::sort(all);
  return all;
}

std::string InstalledThumbnailers::versions() {
  const LockGuard lock(mutex_);
  if (isChanged()) readAll();
  std::string all;
  for (const auto& [path, stamp] : stamps_) {
    if (path.ends_with(kSuffix))
      all += path + " " + std::to_string(stamp.mtime) + " " + std::to_string(stamp.ctime) + ";";
  }
  return all;
}

InstalledThumbnailers::Stamp InstalledThumbnailers::stampOf(const std::string& path) {
  struct stat status{};
  if (stat(path.c_str(), &status) != 0) return {};
  return {status.st_ino, nanoseconds(status.st_mtim), nanoseconds(status.st_ctim)};
}

bool InstalledThumbnailers::isChanged() const {
  return stamps_.empty() || std::ranges::any_of(stamps_, [](const auto& each) {
           return stampOf(each.first) != each.second;
         });
}

void InstalledThumbnailers::readAll() {
  stamps_.clear();
  thumbnailers_.clear();
  readAliases();
  std::vector<std::string> seen;
  for (const std::string& directory : directories_) readDirectory(directory, seen);
}

void InstalledThumbnailers::readDirectory(const std::string& directory,
                                          std::vector<std::string>& seen) {
  // Before it is read, so that a change meanwhile is seen the next time.
  stamps_.emplace_back(directory, stampOf(directory));
  for (const std::string& name : thumbnailerNames(directory)) {
    if (std::ranges::find(seen, name) != seen.end()) continue;
    seen.push_back(name);
    readThumbnailer(directory + "/" + name);
  }
}

void InstalledThumbnailers::readThumbnailer(const std::string& path) {
  stamps_.emplace_back(path, stampOf(path));
  const KeyFile file = KeyFile::read(path);
  const Thumbnailer thumbnailer{file.value(kGroup, "TryExec"), words(file.value(kGroup, "Exec"))};
  if (thumbnailer.command.empty()) return;
  for (const std::string& type : file.list(kGroup, "MimeType", ';'))
    thumbnailers_[canonical(type)].push_back(thumbnailer);
}

void InstalledThumbnailers::readAliases() {
  stamps_.emplace_back(aliasesPath_, stampOf(aliasesPath_));
  aliases_.clear();
  std::ifstream file(aliasesPath_);
  for (std::string alias, type; file >> alias >> type;) aliases_.emplace(alias, type);
}

std::string InstalledThumbnailers::canonical(std::string_view type) const {
  std::string result(type);
  std::ranges::transform(result, result.begin(), [](char c) {
    return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
  });
  const auto alias = aliases_.find(result);
  return alias == aliases_.end() ? result : alias->second;
}

}  // namespace yomber
