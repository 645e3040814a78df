// Reading and writing.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <memory>
#include <thread>
#include <utility>

#include "mount/file_system.h"
#include "mount/removed_content.h"
#include "mount/set_id_bits.h"
#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_attributes.h"

namespace yomber {
namespace {

/// Between two attempts to open content that is here but held by whoever brought it.
constexpr std::chrono::milliseconds kPause{10};

void answerRead(fuse_req_t request, int descriptor, std::size_t size, off_t offset) {
  const auto bytes = std::make_unique_for_overwrite<char[]>(size);
  const ssize_t count = pread(descriptor, bytes.get(), size, offset);
  if (count < 0) {
    (void)fuse_reply_err(request, errno);
  } else {
    (void)fuse_reply_buf(request, bytes.get(), static_cast<std::size_t>(count));
  }
}

std::uint64_t blockBytesOf(int descriptor) {
  struct stat status{};
  if (fstat(descriptor, &status) != 0) return 0;
  return static_cast<std::uint64_t>(status.st_blocks) * kBlockBytes;
}

/// How one write is to be done: the kernel tells with each.
int writeFlags(const fuse_file_info* info) {
  // Where the end is, only the disk knows: others may have written there.
  int flags = (info->flags & O_APPEND) != 0 && info->writepage == 0 ? RWF_APPEND : 0;
  if ((info->flags & O_DSYNC) != 0) flags |= RWF_DSYNC;
  if ((info->flags & O_SYNC) == O_SYNC) flags |= RWF_SYNC;
  return flags;
}

void answerWrite(fuse_req_t request, OpenFile& file, const char* bytes, std::size_t size,
                 off_t offset, int flags) {
  takeSetIDAway(request, file.content());
  iovec part{.iov_base = const_cast<char*>(bytes), .iov_len = size};
  const ssize_t count = pwritev2(file.content(), &part, 1, offset, flags);
  if (count < 0) {
    (void)fuse_reply_err(request, errno);
    return;
  }
  (void)fuse_reply_write(request, static_cast<std::size_t>(count));
}

/// EAGAIN when the content has to come first, or is coming. `mayWait`: rather than disturb whoever
/// is filling it. EINPROGRESS when it has to be settled first, and that is not to be waited for.
int truncateNow(fuse_req_t request, int place, off_t size, bool mayWait, bool mayWaitForDisk) {
  if (isFault(place) && (size != 0 || (mayWait && isBeingChanged(place)))) return EAGAIN;
  const FileDescriptor file(
      ::open(pathOfDescriptor(place).c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  if (!file) return errno;  // EAGAIN: leased
  const bool isHere = !isFault(file.get());
  if (!isHere && size != 0) return EAGAIN;
  if (isHere && !mayWaitForDisk && isToBeSettled(file.get())) return EINPROGRESS;
  takeSetIDAway(request, file.get());
  int failure = isHere ? settleForWriting(file.get()) : 0;
  if (failure == 0 && ftruncate(file.get(), size) != 0) failure = errno;
  // Nothing of what is away is wanted any more when nothing stays.
  if (failure == 0 && !isHere) failure = takeMarksOff(file.get());
  return failure;
}

/// 0 or an errno. Who is filling the file, or gives it up, syncs it himself.
int syncNow(const OpenFile& file, bool isDataOnly) {
  FileDescriptor opened;
  if (file.content() < 0) {
    if (isBeingChanged(file.any())) return 0;
    const std::string path = pathOfDescriptor(file.any());
    for (const int access : {O_RDONLY, O_WRONLY}) {
      opened = FileDescriptor(::open(path.c_str(), access | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
      if (opened || errno != EACCES) break;
    }
    if (!opened) return errno == EWOULDBLOCK ? 0 : errno;  // leased by him
  }
  const int descriptor = opened ? opened.get() : file.content();
  return (isDataOnly ? fdatasync(descriptor) : ::fsync(descriptor)) == 0 ? 0 : errno;
}

}  // namespace

void FileSystem::withContent(fuse_req_t request, const std::shared_ptr<OpenFile>& file,
                             std::function<void(int failure)> then, int attempts) {
  const int failure = file->openContent(false);
  if (failure != EINPROGRESS) {
    return contentOpened(request, file, failure, std::move(then), attempts);
  }
  waitForDisk([this, request, file, then = std::move(then), attempts] {
    contentOpened(request, file, file->openContent(true), then, attempts);
  });
}

void FileSystem::contentOpened(fuse_req_t request, const std::shared_ptr<OpenFile>& file,
                               int failure, std::function<void(int failure)> then, int attempts) {
  if (failure != EAGAIN) return then(failure);
  if (attempts == 0) return then(EIO);
  const bool wasRemoved = isRemoved(file->any());
  waitForContent(request, file->node(), file->any(),
                 [this, request, file, then = std::move(then), attempts, wasRemoved](int waited) {
                   // Meanwhile the drive has lost sight of it.
                   const bool isGone = !wasRemoved && waited != EINTR && isRemoved(file->any());
                   // Busy: somebody has it open for writing at this moment.
                   if (waited != 0 && waited != EBUSY && !isGone) return then(waited);
                   if (space_ != nullptr) space_->noteGrowth(blockBytesOf(file->any()));
                   if (attempts < kAttempts) std::this_thread::sleep_for(kPause);
                   withContent(request, file, then, attempts - 1);
                 });
}

void FileSystem::waitForContent(fuse_req_t request, Node& node, int place,
                                ContentWaits::Then then) {
  if (isRemoved(place)) {
    const auto kept = std::make_shared<const FileDescriptor>(fcntl(place, F_DUPFD_CLOEXEC, 0));
    return waits_.wait(
        request, nodes_.use(node),
        [kept](ContentRequests::Completion completion) {
          return provideRemoved(kept, std::move(completion));
        },
        std::move(then));
  }
  const auto path = locationOf(node);
  if (!path) return then(ENOENT);
  waits_.wait(request, nodes_.use(node), *path, std::move(then));
}

void FileSystem::read(fuse_req_t request, Node& /*node*/, std::size_t size, off_t offset,
                      fuse_file_info* info) {
  OpenFile& file = fileOf(info);
  if (file.content() >= 0) return answerRead(request, file.content(), size, offset);
  // Whoever only wants to know what it is gets that from what is kept.
  char kept[4096];
  const ssize_t count = file.readKept(kept, size, offset);
  if (count >= 0) {
    (void)fuse_reply_buf(request, kept, static_cast<std::size_t>(count));
    return;
  }
  const auto shared = openFiles_.shared(file);
  withContent(request, shared, [request, shared, size, offset](int failure) {
    if (failure == 0) return answerRead(request, shared->content(), size, offset);
    (void)fuse_reply_err(request, failure);
  });
}

void FileSystem::write(fuse_req_t request, Node& node, const char* bytes, std::size_t size,
                       off_t offset, fuse_file_info* info) {
  OpenFile& file = fileOf(info);
  nodes_.noteTold(node, 0);
  const int flags = writeFlags(info);
  const bool waitsForDisk = (flags & (RWF_DSYNC | RWF_SYNC)) != 0;
  if (file.content() >= 0 && !waitsForDisk) {
    return answerWrite(request, file, bytes, size, offset, flags);
  }
  const auto shared = openFiles_.shared(file);
  const auto writeNow = [request, shared, kept = std::make_shared<std::string>(bytes, size), offset,
                         flags] {
    answerWrite(request, *shared, kept->data(), kept->size(), offset, flags);
  };
  withContent(request, shared, [this, request, writeNow, waitsForDisk](int failure) {
    if (failure != 0) {
      (void)fuse_reply_err(request, failure);
    } else if (waitsForDisk) {
      waitForDisk(writeNow);
    } else {
      writeNow();
    }
  });
}

void FileSystem::fsync(fuse_req_t request, Node& node, int isDataOnly, fuse_file_info* info) {
  // What was written through another descriptor counts as well.
  auto file = openFiles_.shared(fileOf(info));
  if (file->content() < 0) {
    if (auto other = openFiles_.of(node)) file = std::move(other);
  }
  waitForDisk([request, file, isDataOnly] {
    (void)fuse_reply_err(request, syncNow(*file, isDataOnly != 0));
  });
}

void FileSystem::fallocate(fuse_req_t request, Node& node, int mode, off_t offset, off_t length,
                           fuse_file_info* info) {
  const auto file = openFiles_.shared(fileOf(info));
  nodes_.noteTold(node, 0);
  withContent(request, file, [request, file, mode, offset, length](int failure) {
    if (failure == 0) takeSetIDAway(request, file->content());
    if (failure == 0 && ::fallocate(file->content(), mode, offset, length) != 0) failure = errno;
    (void)fuse_reply_err(request, failure);
  });
}

void FileSystem::lseek(fuse_req_t request, Node& /*node*/, off_t offset, int whence,
                       fuse_file_info* info) {
  const OpenFile& file = fileOf(info);
  off_t result = -1;
  if (file.content() >= 0) {
    result = ::lseek(file.content(), offset, whence);
  } else {
    // What is away is all data.
    struct stat status{};
    const bool isInside = fstat(file.any(), &status) == 0 && offset >= 0 && offset < status.st_size;
    if (isInside) result = whence == SEEK_HOLE ? status.st_size : offset;
    if (!isInside) errno = ENXIO;
  }
  if (result < 0) {
    (void)fuse_reply_err(request, errno);
  } else {
    (void)fuse_reply_lseek(request, result);
  }
}

void FileSystem::copyFileRange(fuse_req_t request, Node& /*source*/, off_t sourceOffset,
                               fuse_file_info* sourceInfo, fuse_ino_t target, off_t targetOffset,
                               fuse_file_info* targetInfo, std::size_t length, int flags) {
  const auto from = openFiles_.shared(fileOf(sourceInfo));
  const auto to = openFiles_.shared(fileOf(targetInfo));
  nodes_.noteTold(nodeOf(target), 0);
  const auto copy = [request, from, to, sourceOffset, targetOffset, length, flags](int failure) {
    loff_t read = sourceOffset;
    loff_t written = targetOffset;
    ssize_t count = -1;
    if (failure == 0) {
      takeSetIDAway(request, to->content());
      count = copy_file_range(from->content(), &read, to->content(), &written, length,
                              static_cast<unsigned>(flags));
      if (count < 0) failure = errno;
    }
    if (failure != 0) {
      (void)fuse_reply_err(request, failure);
    } else {
      (void)fuse_reply_write(request, static_cast<std::size_t>(count));
    }
  };
  withContent(request, from, [this, request, to, copy](int failure) {
    if (failure != 0) return copy(failure);
    withContent(request, to, copy);
  });
}

void FileSystem::truncate(fuse_req_t request, Node& node, off_t size, fuse_file_info* info,
                          std::function<void(int failure)> then, int attempts,
                          bool mayWaitForDisk) {
  const int held = info != nullptr ? fileOf(info).content() : -1;
  if (held >= 0) {
    takeSetIDAway(request, held);
    return then(ftruncate(held, size) == 0 ? 0 : errno);
  }
  Descriptor place;
  int failure = descriptorOf(node, place);
  if (failure == 0) {
    failure = truncateNow(request, place.number, size, attempts == kAttempts, mayWaitForDisk);
  }
  auto use = std::make_shared<NodeUse>(nodes_.use(node));
  if (failure == EINPROGRESS) {
    return waitForDisk([this, request, use, size, then = std::move(then), attempts] {
      truncate(request, *use->get(), size, nullptr, then, attempts, true);
    });
  }
  if (failure != EAGAIN) return then(failure);
  if (attempts == 0) return then(EBUSY);
  waitForContent(request, node, place.number,
                 [this, request, use, size, then = std::move(then), attempts](int waited) {
                   // Busy: somebody has it open for writing at this moment. Where nothing stays,
                   // nobody needs what could not be had.
                   const bool goesOn = waited == EBUSY || (size == 0 && waited != EINTR);
                   if (waited != 0 && !goesOn) return then(waited);
                   if (attempts < kAttempts) std::this_thread::sleep_for(kPause);
                   truncate(request, *use->get(), size, nullptr, then, attempts - 1);
                 });
}

}  // namespace yomber
