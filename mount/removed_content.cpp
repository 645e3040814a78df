#include "mount/removed_content.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <string>
#include <string_view>
#include <thread>
#include <utility>

#include "mount/open_files.h"
#include "platform/fileprovider/constants.h"
#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/thread_pool.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/fault_record.h"
#include "platform/rozzel/container.h"

namespace yomber {
namespace {

/// Between two attempts to open what somebody was filling already when it was removed.
constexpr std::chrono::milliseconds kPause{10};

/// As applications understand it.
NSErrorRef asErrno(const NSErrorRef& error) {
  if (rz_isError(error, RZErrorNetworkUnavailable) || rz_isError(error, RZErrorStoreBusy))
    return NSError::errorWithErrno(ENETUNREACH);
  return rz_isError(error, RZErrorStoreFull) ? NSError::errorWithErrno(ENOSPC) : error;
}

class Fetching {
 public:
  explicit Fetching(SharedDescriptor place) : place_(std::move(place)) {}

  void cancel() { isCancelled_ = true; }

  NSErrorRef run() {
    FileDescriptor file;
    if (NSErrorRef error = open(file)) return error;
    bool isDamaged = false;
    const auto record = readFaultRecord(file.get(), isDamaged);
    struct stat before{};
    if (!isFault(file.get())) return nullptr;
    if (!record || fstat(file.get(), &before) != 0) return NSError::errorWithErrno(EIO);
    if (NSErrorRef error = fill(file.get(), *record, before)) return error;
    const std::array<timespec, 2> dates{before.st_atim, before.st_mtim};
    (void)futimens(file.get(), dates.data());
    const int failure = takeMarksOff(file.get());
    return failure != 0 ? NSError::errorWithErrno(failure) : nullptr;
  }

 private:
  /// Waits for whoever is filling it.
  NSErrorRef open(FileDescriptor& file) const {
    constexpr int kFlags = O_RDWR | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
    while (!isCancelled_) {
      file = FileDescriptor(::open(pathOfDescriptor(place_->get()).c_str(), kFlags));
      if (!file && errno == EACCES) file = FileDescriptor(openReadOnly(kFlags));
      if (file) return nullptr;
      if (errno != EWOULDBLOCK) return NSError::errorWithErrno(errno);
      std::this_thread::sleep_for(kPause);
    }
    return NSError::errorWithErrno(EINTR);
  }

  /// One that its owner may not write to.
  [[nodiscard]] int openReadOnly(int flags) const {
    const std::string path = pathOfDescriptor(place_->get());
    struct stat status{};
    if (fstat(place_->get(), &status) != 0) return -1;
    const mode_t mode = status.st_mode & ALLPERMS;
    if (chmod(path.c_str(), mode | S_IRUSR | S_IWUSR) != 0) return -1;
    const int file = ::open(path.c_str(), flags);
    const int failure = errno;
    (void)chmod(path.c_str(), mode);
    errno = failure;
    return file;
  }

  NSErrorRef fill(int file, const FaultRecord& record, const struct stat& before) const {
    const auto size = static_cast<std::uint64_t>(before.st_size);
    if (size != record.content.size) return NSError::errorWithErrno(EIO);
    const auto container =
        RZContainer::containerWithIdentifier(QSUbiquitousRozzelContainerIdentifier);
    const std::string account = container->accountName();
    if (account.empty() || (!record.account.empty() && record.account != account))
      return NSError::errorWithErrno(EACCES);
    // What an earlier filling left would show where the content has holes.
    constexpr auto kKept = static_cast<off_t>(kKeptBytes);
    if (before.st_size > kKept && fallocate(file, FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE, kKept,
                                            before.st_size - kKept) != 0) {
      return NSError::errorWithErrno(errno);
    }
    const RZTransfer transfer{.progress = [this](std::uint64_t) { return !isCancelled_; }};
    const auto& engine = container->privateCloudDatabase()->engine();
    return asErrno(engine->copyAsset(record.content, file, transfer));
  }

  const SharedDescriptor place_;
  std::atomic<bool> isCancelled_ = false;
};

}  // namespace

bool isRemoved(int descriptor) {
  struct stat status{};
  return fstat(descriptor, &status) == 0 && status.st_nlink == 0;
}

std::shared_ptr<ContentRequests::Request> provideRemoved(SharedDescriptor place,
                                                         ContentRequests::Completion completion) {
  class Held final : public ContentRequests::Request {
   public:
    explicit Held(std::shared_ptr<Fetching> fetching) : fetching_(std::move(fetching)) {}
    ~Held() override { fetching_->cancel(); }
    Held(const Held&) = delete;
    Held& operator=(const Held&) = delete;

   private:
    const std::shared_ptr<Fetching> fetching_;
  };
  auto fetching = std::make_shared<Fetching>(std::move(place));
  ThreadPool::shared().async(
      [fetching, completion = std::move(completion)] { completion(fetching->run()); });
  return std::make_shared<Held>(std::move(fetching));
}

}  // namespace yomber
