// Opening and closing files.
#include <fcntl.h>
#include <linux/fuse.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstring>
#include <utility>

#include "mount/file_system.h"

namespace yomber {
namespace {

// What the kernel calls what the library does not know yet.
constexpr std::uint32_t kDirect = 1U << 0U;       // FOPEN_DIRECT_IO
constexpr std::uint32_t kKeepCache = 1U << 1U;    // FOPEN_KEEP_CACHE
constexpr std::uint32_t kNoFlush = 1U << 5U;      // FOPEN_NOFLUSH
constexpr std::uint32_t kPassThrough = 1U << 7U;  // FOPEN_PASSTHROUGH

/// fuse_open_out as it is since 7.40.
struct OpenAnswer {
  std::uint64_t handle = 0;
  std::uint32_t flags = 0;
  std::int32_t backing = 0;
};

std::uint32_t flagsOf(OpenFile::Way way) {
  switch (way) {
    case OpenFile::Way::PassThrough:
      return kPassThrough | kNoFlush;
    case OpenFile::Way::Cached:
      return kKeepCache | kNoFlush;
    case OpenFile::Way::Direct:
      break;
  }
  return kDirect | kNoFlush;
}

void setTime(double seconds, std::uint64_t& whole, std::uint32_t& rest) {
  whole = static_cast<std::uint64_t>(seconds);
  rest = static_cast<std::uint32_t>((seconds - std::floor(seconds)) * 1e9);
}

fuse_attr wireAttributes(const struct stat& from) {
  fuse_attr to{};
  to.ino = from.st_ino;
  to.size = static_cast<std::uint64_t>(from.st_size);
  to.blocks = static_cast<std::uint64_t>(from.st_blocks);
  to.atime = static_cast<std::uint64_t>(from.st_atim.tv_sec);
  to.mtime = static_cast<std::uint64_t>(from.st_mtim.tv_sec);
  to.ctime = static_cast<std::uint64_t>(from.st_ctim.tv_sec);
  to.atimensec = static_cast<std::uint32_t>(from.st_atim.tv_nsec);
  to.mtimensec = static_cast<std::uint32_t>(from.st_mtim.tv_nsec);
  to.ctimensec = static_cast<std::uint32_t>(from.st_ctim.tv_nsec);
  to.mode = from.st_mode;
  to.nlink = static_cast<std::uint32_t>(from.st_nlink);
  to.uid = from.st_uid;
  to.gid = from.st_gid;
  to.rdev = static_cast<std::uint32_t>(from.st_rdev);
  to.blksize = static_cast<std::uint32_t>(from.st_blksize);
  return to;
}

fuse_entry_out wireEntry(const fuse_entry_param& from) {
  fuse_entry_out to{};
  to.nodeid = from.ino;
  to.generation = from.generation;
  setTime(from.entry_timeout, to.entry_valid, to.entry_valid_nsec);
  setTime(from.attr_timeout, to.attr_valid, to.attr_valid_nsec);
  to.attr = wireAttributes(from.attr);
  return to;
}

}  // namespace

void FileSystem::open(fuse_req_t request, Node& node, fuse_file_info* info) {
  FileDescriptor content;
  FileDescriptor place;
  int failure = openNode(node, info->flags, content, place);
  if (failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const int flags = info->flags;
  const bool isForWriting = (flags & O_ACCMODE) != O_RDONLY;
  if (!content || !isForWriting || !isToBeSettled(content.get())) {
    return openFound(request, node, flags, std::move(content), std::move(place));
  }
  const auto settled = std::make_shared<FileDescriptor>(std::move(content));
  waitForDisk([this, request, &node, flags, settled] {
    const int unsettled = settleForWriting(settled->get());
    if (unsettled == 0) {
      return openFound(request, node, flags, std::move(*settled), FileDescriptor());
    }
    (void)fuse_reply_err(request, unsettled);
  });
}

void FileSystem::openFound(fuse_req_t request, Node& node, int flags, FileDescriptor content,
                           FileDescriptor place) {
  const auto file = addOpen(node, flags, std::move(content), std::move(place));
  if ((flags & O_TRUNC) == 0) return answerOpen(request, file, nullptr);
  // Only now that it is known to be the file that was meant.
  truncate(request, node, 0, nullptr, [this, request, file](int truncation) {
    if (truncation == 0) return answerOpen(request, file, nullptr);
    openFiles_.remove(*file);
    (void)fuse_reply_err(request, truncation);
  });
}

int FileSystem::openNode(Node& node, int flags, FileDescriptor& content, FileDescriptor& place) {
  const int failure = inPlace(node, [&](int folder, const char* name) {
    const int failed = openInPlace(folder, name, flags, node.mayBeAway, content, place);
    struct statx status{};
    if (failed != 0) return failed;
    const int unseen = lookAt((content ? content : place).get(), "", status);
    return unseen == 0 && FileIdentity::of(status) != node.identity ? ESTALE : unseen;
  });
  if (failure != ESTALE) return failure;
  // Removed, or moved behind our back, while somebody has it.
  if (const auto other = openFiles_.of(node)) return openAgain(other->any(), flags, content, place);
  const SharedDescriptor remains = nodes_.remains(node);
  return remains ? openAgain(remains->get(), flags, content, place) : ESTALE;
}

std::shared_ptr<OpenFile> FileSystem::addOpen(Node& node, int flags, FileDescriptor content,
                                              FileDescriptor place) {
  struct stat status{};
  (void)fstat(content ? content.get() : place.get(), &status);
  // Who writes to a file with set-id bits takes them away, unless he may leave them: when the
  // kernel writes by itself, they go whoever writes.
  const bool hasSetID = (status.st_mode & (S_ISUID | S_ISGID)) != 0;
  const auto present = hasSetID ? OpenFile::Way::Direct : OpenFile::Way::PassThrough;
  const auto wanted = session_->canPassThrough() ? present : OpenFile::Way::Cached;
  auto file = openFiles_.add(nodes_, node, flags, std::move(content), std::move(place), wanted);
  if (space_ != nullptr) space_->noteUse(node.identity.inode);
  file->changeWhenOpened = nanosecondsOf(status.st_ctim);
  file->bytesWhenOpened = static_cast<std::uint64_t>(status.st_blocks) * kBlockBytes;
  return file;
}

void FileSystem::answerOpen(fuse_req_t request, const std::shared_ptr<OpenFile>& file,
                            const fuse_entry_param* entry) {
  const OpenAnswer answer{
      .handle = reinterpret_cast<std::uint64_t>(file.get()),
      .flags = flagsOf(file->way),
      .backing = file->way == OpenFile::Way::PassThrough ? openFiles_.backingOf(file->node()) : 0};
  char bytes[sizeof(fuse_entry_out) + sizeof answer];
  std::size_t size = 0;
  if (entry != nullptr) {
    const fuse_entry_out wire = wireEntry(*entry);
    std::memcpy(bytes, &wire, sizeof wire);
    size = sizeof wire;
  }
  std::memcpy(bytes + size, &answer, sizeof answer);
  if (fuse_reply_buf(request, bytes, size + sizeof answer) == 0) return;
  // The kernel does not want it any more.
  if (entry != nullptr) nodes_.forget(file->node(), 1);
  openFiles_.remove(*file);
}

void FileSystem::release(fuse_req_t request, Node& node, fuse_file_info* info) {
  OpenFile& file = fileOf(info);
  struct statx status{};
  const bool isChanged = file.isWritable() && file.content() >= 0 &&
                         lookAt(file.content(), "", status) == 0 &&
                         nanoseconds(status.stx_ctime) != file.changeWhenOpened;
  const auto path = isChanged ? locationOf(node) : std::nullopt;
  if (isChanged) nodes_.noteTold(node, 0);
  const std::uint64_t bytes = status.stx_blocks * kBlockBytes;
  if (isChanged && space_ != nullptr && bytes > file.bytesWhenOpened) {
    space_->noteGrowth(bytes - file.bytesWhenOpened);
  }
  openFiles_.remove(file);
  (void)fuse_reply_err(request, 0);
  if (path) requests_->itemChanged(*path);
}

void FileSystem::create(fuse_req_t request, Node& folder, const char* name, mode_t mode,
                        fuse_file_info* info) {
  int failure = 0;
  const SharedDescriptor above = folders_.open(folder, failure);
  if (above && isShownBase(folder, name)) failure = EISDIR;
  if (!above || failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const EntryGate::Moment begun = gate_.now(folder.identity.inode);
  const int flags = info->flags & (O_ACCMODE | O_SYNC | O_DSYNC);
  FileDescriptor content(openat(
      above->get(), name, flags | O_CREAT | O_EXCL | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC,
      firstMode(request, mode)));
  if (!content) {
    // Somebody has made it meanwhile: the kernel has to look, whether the caller may open it.
    const bool isMade = errno == EEXIST && (info->flags & O_EXCL) == 0;
    (void)fuse_reply_err(request, isMade ? ESTALE : errno);
    return;
  }
  failure = giveToCaller(request, above->get(), name, mode);
  if (failure != 0) (void)unlinkat(above->get(), name, 0);
  nodes_.noteTold(folder, 0);
  struct statx status{};
  if (failure == 0) failure = lookAt(content.get(), "", status);
  if (failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  Node& node = nodes_.found(folder, name, status);
  const auto file = addOpen(node, info->flags, std::move(content), FileDescriptor());
  const EntryGate::Telling telling(gate_, folder.identity.inode, begun);
  const fuse_entry_param entry = entryOf(folder, node, status, telling.holds());
  answerOpen(request, file, &entry);
}

}  // namespace yomber
