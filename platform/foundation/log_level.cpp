#include "platform/foundation/log_level.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace yomber {
namespace {

constexpr std::array<std::string_view, 5> kNames{"debug", "info", "default", "error", "fault"};
constexpr std::string_view kMagic = "yomberL1";
constexpr std::size_t kPageSize = 4096;

class Descriptor {
 public:
  explicit Descriptor(int number) : number_(number) {}
  ~Descriptor() {
    if (number_ >= 0) ::close(number_);
  }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;
  [[nodiscard]] int get() const { return number_; }

 private:
  const int number_;
};

}  // namespace

struct LogLevelPage::Layout {
  std::array<char, 8> magic;
  std::atomic<std::uint8_t> level;

  static constexpr std::uint8_t kHighest = static_cast<std::uint8_t>(LogLevel::Fault);
};

static_assert(std::atomic<std::uint8_t>::is_always_lock_free);

namespace {

constexpr std::size_t kLevelOffset = kMagic.size();

/// Whether the open file is a page that this user alone can have written.
bool isPage(int descriptor) {
  struct stat status{};
  std::array<char, kLevelOffset + 1> head{};
  if (fstat(descriptor, &status) != 0 || !S_ISREG(status.st_mode)) return false;
  if (status.st_uid != geteuid() || (status.st_mode & 077U) != 0) return false;
  if (status.st_size != static_cast<off_t>(kPageSize)) return false;
  if (pread(descriptor, head.data(), head.size(), 0) != static_cast<ssize_t>(head.size())) {
    return false;
  }
  return std::memcmp(head.data(), kMagic.data(), kMagic.size()) == 0 &&
         static_cast<unsigned char>(head.back()) <= static_cast<unsigned char>(LogLevel::Fault);
}

int openPage(const std::string& path) {
  return ::open(path.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
}

/// What happens to a file that stands where the page goes.
enum class Existing { Keep, Replace };

/// Puts a complete new page at `path`; false and errno when that fails.
bool makePage(const std::string& path, Existing existing) {
  std::string temporary = path + ".XXXXXX";
  const Descriptor file(mkostemp(temporary.data(), O_CLOEXEC));
  if (file.get() < 0) return false;
  std::array<char, kPageSize> page{};
  std::copy(kMagic.begin(), kMagic.end(), page.begin());
  page[kLevelOffset] = static_cast<char>(LogLevel::Info);
  const bool written =
      write(file.get(), page.data(), page.size()) == static_cast<ssize_t>(kPageSize);
  if (!written) errno = ENOSPC;
  bool placed = false;
  if (written && existing == Existing::Replace) {
    placed = std::rename(temporary.c_str(), path.c_str()) == 0;
    if (placed) return true;
  } else if (written) {
    // Of several processes that start together, one wins and the others use its page.
    placed = link(temporary.c_str(), path.c_str()) == 0 || errno == EEXIST;
  }
  const int number = errno;
  unlink(temporary.c_str());
  errno = number;
  return placed;
}

}  // namespace

std::string_view logLevelName(LogLevel level) { return kNames.at(static_cast<std::size_t>(level)); }

std::optional<LogLevel> logLevelNamed(std::string_view name) {
  const auto* const found = std::find(kNames.begin(), kNames.end(), name);
  if (found == kNames.end()) return std::nullopt;
  return static_cast<LogLevel>(found - kNames.begin());
}

std::unique_ptr<LogLevelPage> LogLevelPage::open(const std::string& path, NSErrorRef* error) {
  constexpr int kAttempts = 8;  // several processes may find and replace a bad page together
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    const Descriptor file(openPage(path));
    const bool missing = file.get() < 0 && errno == ENOENT;
    if (!missing && file.get() >= 0 && isPage(file.get())) {
      void* const memory =
          mmap(nullptr, kPageSize, PROT_READ | PROT_WRITE, MAP_SHARED, file.get(), 0);
      if (memory == MAP_FAILED) break;
      return std::unique_ptr<LogLevelPage>(new LogLevelPage(static_cast<Layout*>(memory)));
    }
    if (!makePage(path, missing ? Existing::Keep : Existing::Replace)) break;
  }
  storeError(error, NSError::errorWithErrno(errno, path));
  return nullptr;
}

LogLevelPage::~LogLevelPage() { munmap(layout_, kPageSize); }

LogLevel LogLevelPage::level() const {
  const auto level = layout_->level.load(std::memory_order_relaxed);
  return static_cast<LogLevel>(std::min(level, Layout::kHighest));
}

void LogLevelPage::setLevel(LogLevel level) {
  layout_->level.store(static_cast<std::uint8_t>(level), std::memory_order_relaxed);
}

const std::atomic<std::uint8_t>* LogLevelPage::cell() const { return &layout_->level; }

NSErrorRef setSharedLogLevel(const DrivePaths& paths, LogLevel level) {
  // A home that does not exist is rather a wrong home than one to be made.
  if (access(paths.home.c_str(), F_OK) != 0) return NSError::errorWithErrno(errno, paths.home);
  NSErrorRef error = paths.create();
  if (error) return error;
  const auto page = LogLevelPage::open(paths.logLevelPage, &error);
  if (page) page->setLevel(level);
  return error;
}

}  // namespace yomber
