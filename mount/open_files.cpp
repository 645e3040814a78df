#include "mount/open_files.h"

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstddef>
#include <string>
#include <utility>

#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/whole_transfer.h"
#include "platform/ostrell/fault_record.h"

namespace yomber {
namespace {

FaultPoint markTaken("mount.mark.taken");

/// What is left to us to open again with.
constexpr int kKeptFlags = O_ACCMODE | O_SYNC | O_DSYNC;
/// Never waits for a lease: who holds one is filling the file, or giving its content up.
constexpr int kOwnFlags = O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;

bool isLeased(int failure) { return failure == EWOULDBLOCK; }

}  // namespace

bool isToBeSettled(int descriptor) {
  return fgetxattr(descriptor, kFaultAttribute, nullptr, 0) >= 0;
}

int settleForWriting(int descriptor) {
  if (!isToBeSettled(descriptor)) return 0;
  if (fdatasync(descriptor) != 0) return errno;
  return takeMarksOff(descriptor);
}

bool isBeingChanged(int descriptor) {
  return readAttribute(descriptor, kHeldDateAttribute, nullptr, 0) >= 0;
}

int takeMarksOff(int descriptor) {
  if (markTaken.hit()) return EIO;
  // The fault first: the others mean nothing without it.
  if (fremovexattr(descriptor, kFaultAttribute) != 0 && errno != ENODATA) return errno;
  (void)fremovexattr(descriptor, kFilledAttribute);
  (void)fremovexattr(descriptor, kHeldDateAttribute);
  return 0;
}

OpenFile::OpenFile(NodeUse node, int flags, FileDescriptor content, FileDescriptor place)
    : node_(std::move(node)),
      flags_(flags & kKeptFlags),
      content_(content.release()),
      place_(std::move(place)) {}

OpenFile::~OpenFile() {
  if (content() >= 0) close(content());
}

namespace {

/// Somebody may have written there around us.
bool isHeadKept(int fault) {
  std::array<char, kKeptBytes> head{};
  std::size_t length = 0;
  bool isDamaged = false;
  const auto record = readFaultRecord(fault, isDamaged);
  if (!record || readWhole(fault, head, 0, length) != 0) return false;
  return headChecksum({head.data(), length}) == record->head;
}

}  // namespace

bool OpenFile::isWritable() const { return (flags_ & O_ACCMODE) != O_RDONLY; }

int OpenFile::openContent(bool mayWaitForDisk) {
  LockGuard guard(mutex_);
  if (content() >= 0) return 0;
  if (isFault(place_.get())) return EAGAIN;  // whoever is filling it is to be alone with it
  const int flags = O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
  FileDescriptor opened(::open(pathOfDescriptor(place_.get()).c_str(), flags_ | flags));
  if (!opened) return errno;  // EAGAIN: leased
  if (isFault(opened.get())) return EAGAIN;
  if (isWritable() && isToBeSettled(opened.get())) {
    if (!mayWaitForDisk) return EINPROGRESS;
    if (const int failure = settleForWriting(opened.get()); failure != 0) return failure;
  }
  content_.store(opened.release(), std::memory_order_release);
  return 0;
}

ssize_t OpenFile::readKept(void* bytes, std::size_t size, off_t offset) const {
  struct stat status{};
  if (fstat(place_.get(), &status) != 0) return -1;
  if (offset >= status.st_size) return 0;
  const auto start = static_cast<std::uint64_t>(offset);
  const auto whole = static_cast<std::uint64_t>(status.st_size);
  const std::uint64_t kept = std::min(whole, kKeptBytes);
  if (std::min(start + size, whole) > kept || isBeingChanged(place_.get())) {
    errno = EAGAIN;
    return -1;
  }
  const FileDescriptor opened(
      ::open(pathOfDescriptor(place_.get()).c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  if (!opened) return -1;
  if (whole > kKeptBytes && !isHeadKept(opened.get())) {
    errno = EAGAIN;
    return -1;
  }
  return pread(opened.get(), bytes, std::min<std::uint64_t>(size, kept - start), offset);
}

namespace {

int openEither(int folder, const char* name, int flags, int ownFlags, FileDescriptor& content,
               FileDescriptor& place) {
  content = FileDescriptor(openat(folder, name, (flags & kKeptFlags) | ownFlags));
  if (content && !isFault(content.get())) return 0;
  if (!content && !isLeased(errno)) return errno;
  content = FileDescriptor();
  place = FileDescriptor(openat(folder, name, O_PATH | (ownFlags & O_NOFOLLOW) | O_CLOEXEC));
  return place ? 0 : errno;
}

}  // namespace

int openInPlace(int folder, const char* name, int flags, bool mayBeAway, FileDescriptor& content,
                FileDescriptor& place) {
  // Whoever is filling it is to be alone with it.
  if (mayBeAway && isFaultAtPath(pathOfDescriptor(folder) + "/" + name)) {
    place = FileDescriptor(openat(folder, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
    return place ? 0 : errno;
  }
  return openEither(folder, name, flags, kOwnFlags, content, place);
}

int openAgain(int descriptor, int flags, FileDescriptor& content, FileDescriptor& place) {
  const std::string path = pathOfDescriptor(descriptor);
  if (isFault(descriptor)) {
    place = FileDescriptor(::open(path.c_str(), O_PATH | O_CLOEXEC));
    return place ? 0 : errno;
  }
  return openEither(AT_FDCWD, path.c_str(), flags, kOwnFlags & ~O_NOFOLLOW, content, place);
}

std::shared_ptr<OpenFile> OpenFiles::add(NodeTable& nodes, Node& node, int flags,
                                         FileDescriptor content, FileDescriptor place,
                                         OpenFile::Way wanted) {
  auto file =
      std::make_shared<OpenFile>(nodes.use(node), flags, std::move(content), std::move(place));
  LockGuard guard(mutex_);
  OfNode& all = open_[&node];
  auto& files = all.files;
  const bool isDirect = std::any_of(files.begin(), files.end(), [](const auto& other) {
    return other->way == OpenFile::Way::Direct;
  });
  const bool isBacked = all.backing != 0;
  file->way = isDirect && !isBacked ? OpenFile::Way::Direct : wanted;
  if (isBacked) file->way = OpenFile::Way::PassThrough;
  if (file->content() < 0) file->way = OpenFile::Way::Direct;
  if (file->way == OpenFile::Way::PassThrough && !isBacked) {
    all.backing = backing_.open(file->content());
    if (all.backing == 0) file->way = OpenFile::Way::Direct;
  }
  files.push_back(file);
  return file;
}

void OpenFiles::remove(OpenFile& file) {
  std::shared_ptr<OpenFile> removed;  // ends after the lock: it lets go of its node
  LockGuard guard(mutex_);
  const auto known = open_.find(&file.node());
  if (known == open_.end()) return;
  OfNode& all = known->second;
  auto& files = all.files;
  const auto found = std::find_if(files.begin(), files.end(),
                                  [&](const auto& other) { return other.get() == &file; });
  if (found == files.end()) return;
  removed = std::move(*found);
  files.erase(found);
  const bool isBacked = std::any_of(files.begin(), files.end(), [](const auto& other) {
    return other->way == OpenFile::Way::PassThrough;
  });
  if (!isBacked && all.backing != 0) backing_.close(std::exchange(all.backing, 0));
  if (files.empty()) open_.erase(known);
}

int OpenFiles::backingOf(const Node& node) const {
  LockGuard guard(mutex_);
  const auto known = open_.find(&node);
  return known == open_.end() ? 0 : known->second.backing;
}

std::shared_ptr<OpenFile> OpenFiles::of(const Node& node) const {
  LockGuard guard(mutex_);
  const auto known = open_.find(&node);
  if (known == open_.end()) return nullptr;
  const auto& files = known->second.files;
  const auto found = std::find_if(files.begin(), files.end(),
                                  [](const auto& file) { return file->content() >= 0; });
  return found != files.end() ? *found : files.front();
}

bool OpenFiles::mayWaitForContent(const Node& node) const {
  LockGuard guard(mutex_);
  const auto known = open_.find(&node);
  if (known == open_.end()) return false;
  const auto& files = known->second.files;
  return std::any_of(files.begin(), files.end(),
                     [](const auto& file) { return file->content() < 0; });
}

bool OpenFiles::mayBeWritten(const Node& node) const {
  LockGuard guard(mutex_);
  const auto known = open_.find(&node);
  return known != open_.end() && std::ranges::any_of(known->second.files, [](const auto& file) {
           return file->isWritable();
         });
}

std::shared_ptr<OpenFile> OpenFiles::shared(const OpenFile& file) const {
  LockGuard guard(mutex_);
  const auto known = open_.find(&file.node());
  if (known == open_.end()) return nullptr;
  for (const auto& other : known->second.files) {
    if (other.get() == &file) return other;
  }
  return nullptr;
}

}  // namespace yomber
