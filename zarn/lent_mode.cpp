#include "zarn/lent_mode.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstdint>
#include <string_view>
#include <utility>

#include "platform/foundation/atomic_cell.h"
#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/log.h"

namespace yomber {
namespace {

constexpr mode_t kAllBits = 07777;

FaultPoint modeLent("zarn.mode.lent");

AtomicCell<std::string>& notesFolder() {
  static auto* const instance = new AtomicCell<std::string>;  // never destroyed, as threads use it
  return *instance;
}

std::string linkTarget(const std::string& path) {
  std::array<char, PATH_MAX + 64> target{};
  const ssize_t length = readlink(path.c_str(), target.data(), target.size());
  return std::string(target.data(), length > 0 ? static_cast<std::size_t>(length) : 0);
}

/// A link appears whole or not at all: its target is the note, "MODE INODE PATH".
std::string writeNote(int file, const struct stat& status) {
  const std::string folder = notesFolder().load();
  if (folder.empty()) return {};
  static std::atomic<std::uint64_t> last{0};
  const std::string text = std::to_string(status.st_mode & kAllBits) + " " +
                           std::to_string(status.st_ino) + " " + linkTarget(pathOfDescriptor(file));
  for (;;) {
    std::string note = folder + "/" + std::to_string(++last);
    if (symlink(text.c_str(), note.c_str()) == 0) return note;
    if (errno == ENOENT && mkdir(folder.c_str(), S_IRWXU) == 0) continue;
    if (errno != EEXIST) return {};
  }
}

template <typename Number>
bool takeNumber(std::string_view& text, Number& number) {
  const auto [rest, failure] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (failure != std::errc()) return false;
  text.remove_prefix(static_cast<std::size_t>(rest - text.data()));
  const bool hasMore = text.starts_with(' ');
  if (hasMore) text.remove_prefix(1);
  return hasMore;
}

void restore(std::string_view note) {
  mode_t mode = 0;
  std::uint64_t inode = 0;
  if (!takeNumber(note, mode) || !takeNumber(note, inode)) return;
  const FileDescriptor file(open(std::string(note).c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0) return;
  const bool isAsLent =
      status.st_ino == inode && (status.st_mode & kAllBits) == ((mode | S_IWUSR) & kAllBits);
  if (isAsLent) (void)chmod(pathOfDescriptor(file.get()).c_str(), mode & kAllBits);
}

}  // namespace

std::optional<LentMode> LentMode::lend(int file) {
  struct stat status{};
  if (fstat(file, &status) != 0) return std::nullopt;
  const bool helps =
      !S_ISLNK(status.st_mode) && status.st_uid == geteuid() && (status.st_mode & S_IWUSR) == 0;
  if (!helps) {
    errno = EACCES;
    return std::nullopt;
  }
  LentMode result;
  result.file_ = fcntl(file, F_DUPFD_CLOEXEC, 0);
  if (result.file_ < 0) return std::nullopt;
  result.own_ = status.st_mode & kAllBits;
  result.note_ = writeNote(file, status);
  const bool isNoted = !result.note_.empty() || notesFolder().load().empty();
  if (!isNoted || chmod(pathOfDescriptor(file).c_str(), result.own_ | S_IWUSR) != 0) {
    return std::nullopt;
  }
  (void)modeLent.hit();
  return result;
}

LentMode::LentMode(LentMode&& other) noexcept
    : file_(std::exchange(other.file_, -1)),
      own_(other.own_),
      note_(std::exchange(other.note_, {})) {}

LentMode::~LentMode() {
  if (file_ < 0) return;
  const int number = errno;
  struct stat status{};
  const bool isAsLent =
      fstat(file_, &status) == 0 && (status.st_mode & kAllBits) == (own_ | S_IWUSR);
  if (isAsLent) (void)chmod(pathOfDescriptor(file_).c_str(), own_);
  close(file_);
  if (!note_.empty()) (void)unlink(note_.c_str());
  errno = number;
}

void setLentModesFolder(std::string path) { notesFolder().store(std::move(path)); }

void restoreLentModes() {
  const std::string folder = notesFolder().load();
  DIR* const stream = folder.empty() ? nullptr : opendir(folder.c_str());
  if (stream == nullptr) return;
  while (const dirent* const entry = readdir(stream)) {
    const std::string note = folder + "/" + entry->d_name;
    const std::string text = linkTarget(note);
    if (text.empty()) continue;
    log_default(defaultLog(), "[NOTICE] putting back the mode of a file: %@", text);
    restore(text);
    (void)unlink(note.c_str());
  }
  closedir(stream);
}

}  // namespace yomber
