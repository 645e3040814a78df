#include "zarn/content/changed_file.h"

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <utility>

#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/file_time.h"
#include "platform/foundation/whole_transfer.h"
#include "zarn/content/fault_record.h"

namespace yomber {
namespace {

constexpr int kOpening = O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;

/// Opens a file that its owner may not write to, or not even read; `status` is from before.
FileDescriptor openProtectedFile(const std::string& path, struct stat& status,
                                 std::optional<LentMode>& lent) {
  const FileDescriptor place(open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!place || fstat(place.get(), &status) != 0) return {};
  if (!S_ISREG(status.st_mode)) {
    errno = EACCES;
    return {};
  }
  auto taken = LentMode::lend(place.get());
  if (!taken) return {};
  lent.emplace(std::move(*taken));
  const std::string again = pathOfDescriptor(place.get());
  return FileDescriptor(open(again.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC));
}

}  // namespace

ChangedFile ChangedFile::open(const std::string& path, NSErrorRef* error) {
  ChangedFile result;
  result.path_ = path;
  FileDescriptor file(::open(path.c_str(), O_RDWR | kOpening));
  if (!file && errno == EACCES) file = openProtectedFile(path, result.status_, result.lent_);
  if (!file) {
    storeError(error, result.failure(errno));
    return result;
  }
  result.file_ = std::move(file);
  const bool isKnown = result.lent_ || fstat(result.file_.get(), &result.status_) == 0;
  if (!isKnown || !S_ISREG(result.status_.st_mode)) {
    storeError(error, result.failure(isKnown ? EINVAL : errno));
    result.file_ = FileDescriptor();
  }
  result.mtime_ = result.status_.st_mtim;
  return result;
}

ChangedFile::ChangedFile(ChangedFile&& other) noexcept
    : file_(std::move(other.file_)),
      path_(std::move(other.path_)),
      status_(other.status_),
      lent_(std::move(other.lent_)),
      mtime_(other.mtime_),
      isHeld_(std::exchange(other.isHeld_, false)) {}

ChangedFile::~ChangedFile() = default;

NSErrorRef ChangedFile::failure(int number) const { return NSError::errorWithErrno(number, path_); }

NSErrorRef ChangedFile::holdDate() {
  if (const auto earlier = heldDate(file_.get())) {
    mtime_ = timespecOf(*earlier);
    isHeld_ = true;
  }
  while (!isHeld_) {
    if (NSErrorRef error = setAttribute(kHeldDateAttribute, std::to_string(nanosecondsOf(mtime_))))
      return error;
    // Who sets a date looks for a note after it; we look for a date after the note.
    struct stat now{};
    if (fstat(file_.get(), &now) != 0) return failure(errno);
    isHeld_ = nanosecondsOf(now.st_mtim) == nanosecondsOf(mtime_);
    if (!isHeld_) mtime_ = now.st_mtim;
  }
  return nullptr;
}

NSErrorRef ChangedFile::putDatesBack() {
  std::array<std::timespec, 2> times{status_.st_atim, mtime_};
  std::optional<std::int64_t> noted;
  do {
    noted = isHeld_ ? heldDate(file_.get()) : std::nullopt;
    // Somebody has set both since. A date beyond those that can be noted is still our own.
    if (noted && *noted != nanosecondsOf(mtime_)) {
      mtime_ = timespecOf(*noted);
      times = {std::timespec{.tv_sec = 0, .tv_nsec = UTIME_OMIT}, mtime_};
    }
    if (futimens(file_.get(), times.data()) != 0) return failure(errno);
  } while (isHeld_ && heldDate(file_.get()) != noted);
  return std::exchange(isHeld_, false) ? removeAttribute(kHeldDateAttribute) : nullptr;
}

NSErrorRef ChangedFile::writeHead(const std::string& head) const {
  const int number = writeWhole(file_.get(), head);
  return number == 0 ? nullptr : failure(number);
}

NSErrorRef ChangedFile::punch() const {
  struct stat now{};
  if (fstat(file_.get(), &now) != 0) return failure(errno);
  const auto size = static_cast<std::uint64_t>(now.st_size);
  if (size <= kKeptBytes) return nullptr;
  // To the end of the last block, which would stay otherwise.
  const std::uint64_t length = (size - kKeptBytes + kKeptBytes - 1) / kKeptBytes * kKeptBytes;
  if (!punchAt(kKeptBytes, length)) return failure(errno);
  shrinkMap();
  return nullptr;
}

bool ChangedFile::punchAt(std::uint64_t offset, std::uint64_t length) const {
  constexpr int kMode = FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE;
  return fallocate(file_.get(), kMode, static_cast<off_t>(offset), static_cast<off_t>(length)) == 0;
}

/// The map of a file in many pieces has blocks of its own. ext4 takes the last one back only when a
/// piece is added to the one that is left.
void ChangedFile::shrinkMap() const {
  constexpr std::uint64_t kSector = 512;
  struct stat now{};
  const bool isSmall = fstat(file_.get(), &now) != 0 ||
                       static_cast<std::uint64_t>(now.st_blocks) * kSector <= 2 * kKeptBytes;
  if (isSmall) return;
  // Without room for it, it stays as it is.
  (void)fallocate(file_.get(), FALLOC_FL_KEEP_SIZE, kKeptBytes, kKeptBytes);
  (void)punchAt(kKeptBytes, kKeptBytes);
}

NSErrorRef ChangedFile::setAttribute(const char* name, const std::string& value) const {
  return fsetxattr(file_.get(), name, value.data(), value.size(), 0) == 0 ? nullptr
                                                                          : failure(errno);
}

NSErrorRef ChangedFile::removeAttribute(const char* name) const {
  const bool isGone = fremovexattr(file_.get(), name) == 0 || errno == ENODATA;
  return isGone ? nullptr : failure(errno);
}

NSErrorRef ChangedFile::sync() const { return fsync(file_.get()) == 0 ? nullptr : failure(errno); }

std::optional<std::int64_t> heldDate(int file) {
  std::array<char, 32> text{};
  const ssize_t length = fgetxattr(file, kHeldDateAttribute, text.data(), text.size());
  if (length <= 0) return std::nullopt;
  std::int64_t number = 0;
  const char* const end = text.data() + length;
  const auto [rest, failure] = std::from_chars(text.data(), end, number);
  if (failure != std::errc() || rest != end) return std::nullopt;
  return number;
}

bool hasHoleFrom(int file, std::uint64_t offset, std::uint64_t size) {
  if (offset >= size) return false;
  const off_t hole = lseek(file, static_cast<off_t>(offset), SEEK_HOLE);
  return hole >= 0 && static_cast<std::uint64_t>(hole) < size;
}

bool hasDataFrom(int file, std::uint64_t offset) {
  return lseek(file, static_cast<off_t>(offset), SEEK_DATA) >= 0;
}

}  // namespace yomber
