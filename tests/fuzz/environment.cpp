// What the environment says, and what anyone may write into a file's attributes.

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <limits>
#include <set>
#include <string>
#include <string_view>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/ostrell/daemon_link.h"
#include "tests/fuzz/expect.h"
#include "tests/fuzz/quiet_log.h"
#include "zarn/containers.h"
#include "zarn/item_attributes.h"
#include "zarn/row_queries.h"

namespace yomber::fuzz {
namespace {

/// Sets a variable for as long as the object lives.
class Variable {
 public:
  Variable(const char* name, std::string_view value) : name_(name) {
    expect(setenv(name, std::string(value.substr(0, value.find('\0'))).c_str(), 1) == 0,
           "a variable was set");
  }
  ~Variable() { (void)unsetenv(name_); }
  Variable(const Variable&) = delete;
  Variable& operator=(const Variable&) = delete;

 private:
  const char* const name_;
};

void checkPaths(const DrivePaths& paths) {
  expect(paths.home.starts_with('/'), "a home is absolute");
  expect(paths.home == "/" || !paths.home.ends_with('/'), "a home ends without a slash");
  for (const std::string& path : {paths.tree, paths.store, paths.database, paths.log}) {
    expect(path.starts_with(paths.home + "/"), "what is the drive's lies in its home");
  }
  for (const std::string& path : {paths.daemonSocket, paths.controlSocket, paths.logLevelPage}) {
    expect(path.starts_with(paths.runtimeDirectory + "/"), "sockets lie in one folder");
  }
  // Makes nothing; most homes are not there.
  if (const auto error = paths.check()) {
    expect(!error->localizedDescription().empty(), "a refusal says why");
  }
}

void readPaths(std::string_view value) {
  for (const char* const name : {"YOMBER_HOME", "XDG_DATA_HOME", "XDG_RUNTIME_DIR", "HOME"}) {
    const Variable variable(name, value);
    checkPaths(DrivePaths::forDefaultHome());
  }
}

void readApplicationDirectories(std::string_view value) {
  for (const char* const name : {"XDG_DATA_DIRS", "XDG_DATA_HOME", "HOME"}) {
    const Variable variable(name, value);
    for (const std::string& directory : applicationDirectories()) {
      expect(directory.starts_with('/'), "directories of applications are absolute");
    }
  }
}

void readTimeout(std::string_view value) {
  const Variable variable("YOMBER_DAEMON_TIMEOUT_MS", value);
  const auto timeout = DaemonLink::create("/home/ada/drive")->callOptions().timeout;
  expect(timeout.count() > 0 && timeout <= std::chrono::hours(24), "calls end within a day");
}

void readFaults(std::string_view value) {
  if (const auto error = FaultPoint::arm(value)) {
    expect(!error->localizedDescription().empty(), "a refusal says how faults are written");
  }
  FaultPoint::disarmAll();
}

void readTags(std::string_view value) {
  std::set<std::string> seen;
  for (const std::string& tag : splitTags(value)) {
    expect(!tag.empty() && tag.find(',') == std::string::npos, "a tag has no comma");
    expect(tag.front() != ' ' && tag.back() != ' ', "a tag has no blanks around it");
    expect(seen.insert(tag).second, "a tag is there once");
  }
}

/// Writes `value` into the attribute; false where the file system takes none of that size.
bool write(const std::string& path, const char* attribute, std::string_view value) {
  return lsetxattr(path.c_str(), attribute, value.data(), value.size(), 0) == 0;
}

void readAttributes(const std::string& path, std::string_view value) {
  for (const char* const name : {kIDAttribute, kFavoriteAttribute, kLastUsedAttribute,
                                 kSharedAttribute, kFaultAttribute, kFilledAttribute}) {
    if (!write(path, name, value)) continue;
    const ItemAttributes read = readItemAttributes(path.c_str());
    if (read.id) {
      constexpr auto kLargest =
          static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
      expect(*read.id <= kLargest, "an id is one that can have been issued");
      expect(std::string_view(name) == kIDAttribute, "an id comes from its attribute");
    }
    expect(read.isFault == isFaultAtPath(path), "everybody sees the same faults");
    expect(lremovexattr(path.c_str(), name) == 0, "an attribute was removed");
  }
  if (!write(path, kTagsAttribute, value)) return;
  expect(readItemAttributes(path.c_str()).extra.tags == splitTags(value), "tags are read whole");
  expect(lremovexattr(path.c_str(), kTagsAttribute) == 0, "an attribute was removed");
}

std::string makeFile(const TemporaryDirectory& directory) {
  const std::string path = directory / "file";
  const int file = open(path.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, S_IRUSR | S_IWUSR);
  expect(file >= 0, "a file was made");
  close(file);
  expect(write(path, kTagsAttribute, "red"), "the temporary directory takes attributes");
  return path;
}

}  // namespace
}  // namespace yomber::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace yomber;
  static TemporaryDirectory directory;
  static const std::string file = fuzz::makeFile(directory);
  static const bool isQuiet = (fuzz::quietLogs(), true);
  (void)isQuiet;
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  fuzz::readPaths(bytes);
  fuzz::readApplicationDirectories(bytes);
  fuzz::readTimeout(bytes);
  fuzz::readFaults(bytes);
  fuzz::readTags(bytes);
  fuzz::readAttributes(file, bytes);
  return 0;
}
