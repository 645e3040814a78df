#include "mount/kernel_session.h"

#include <fcntl.h>
#include <linux/fuse.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

#include "mount/operations.h"
#include "mount/request_loop.h"
#include "mount/set_id_capability.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/log.h"

namespace yomber {
namespace {

// What the kernel calls what the library does not know yet (linux/fuse.h from 7.40 on).
constexpr std::uint32_t kInitExtended = 1U << 30U;
constexpr std::uint32_t kWeTakeSetIDAway = 1U << 28U;  // FUSE_HANDLE_KILLPRIV_V2
constexpr std::uint32_t kDirectMaps2 = 1U << 4U;       // FUSE_DIRECT_IO_ALLOW_MMAP
constexpr std::uint32_t kPassThrough2 = 1U << 5U;      // FUSE_PASSTHROUGH
constexpr std::uint32_t kWritebackCache = 1U << 16U;
struct BackingMap {
  std::int32_t descriptor;
  std::uint32_t flags;
  std::uint64_t padding;
};
constexpr unsigned long kBackingOpen = _IOW(229, 1, BackingMap);
constexpr unsigned long kBackingClose = _IOW(229, 2, std::uint32_t);

constexpr unsigned kThreads = 16;

NSErrorRef failureToMount(const std::string& mountPoint, int failure) {
  const std::string reason =
      "cannot mount at " + mountPoint +
      "; it has to be an empty folder of yours, and /dev/fuse (package fuse3) has to be there";
  return NSError::errorWithDomain(NSPOSIXErrorDomain, failure == 0 ? EIO : failure,
                                  {{NSLocalizedDescriptionKey, reason}});
}

bool isTruncation(const fuse_buf& request) {
  fuse_setattr_in wanted{};
  if (request.size < sizeof(fuse_in_header) + sizeof wanted) return false;
  std::memcpy(&wanted, static_cast<const char*>(request.mem) + sizeof(fuse_in_header),
              sizeof wanted);
  return (wanted.valid & FATTR_SIZE) != 0;
}

/// Whether what is asked for moves content.
bool mayTakeLong(const fuse_buf& request) {
  fuse_in_header header{};
  if (request.size < sizeof header) return false;
  std::memcpy(&header, request.mem, sizeof header);
  switch (header.opcode) {
    case FUSE_READ:
    case FUSE_WRITE:
    case FUSE_FALLOCATE:
    case FUSE_COPY_FILE_RANGE:
      return true;
    case FUSE_SETATTR:
      return isTruncation(request);
    default:
      return false;
  }
}

/// Whoever has files open there keeps them until he closes them, but nobody answers him.
void takeAway(const std::string& mountPoint) {
  if (umount2(mountPoint.c_str(), MNT_DETACH) == 0) return;
  const pid_t child = fork();
  if (child == 0) {
    execlp("fusermount3", "fusermount3", "-u", "-z", "--", mountPoint.c_str(), nullptr);
    _exit(127);
  }
  if (child > 0) (void)waitpid(child, nullptr, 0);
}

/// What a process that was killed has left: a mount that nobody answers.
void takeAwayDeadMount(const std::string& mountPoint) {
  struct stat status{};
  if (stat(mountPoint.c_str(), &status) != 0 && errno == ENOTCONN) takeAway(mountPoint);
}

}  // namespace

fuse_ino_t numberOf(const Node& node) {
  const bool isRoot = node.base && *node.base == 0;
  return isRoot ? FUSE_ROOT_ID : reinterpret_cast<fuse_ino_t>(&node);
}

std::unique_ptr<KernelSession> KernelSession::mount(FileSystem& files, const Options& options,
                                                    NSErrorRef* error) {
  std::unique_ptr<KernelSession> session(new KernelSession(files, options));
  if (NSErrorRef failure = session->begin()) {
    storeError(error, std::move(failure));
    return nullptr;
  }
  return session;
}

NSErrorRef KernelSession::begin() {
  takeAwayDeadMount(options_.mountPoint);
  std::string settings = "default_permissions,fsname=yomber,subtype=yomber";
  if (options_.allowOthers) settings += ",allow_other";
  if (options_.isPrivileged) settings += ",dev,suid";
  std::array<std::string, 3> words{"yomber-mount", "-o", settings};
  std::array<char*, 3> pointers{words[0].data(), words[1].data(), words[2].data()};
  fuse_args arguments = FUSE_ARGS_INIT(static_cast<int>(pointers.size()), pointers.data());
  const fuse_lowlevel_ops operations = mountOperations();
  session_ = fuse_session_new(&arguments, &operations, sizeof operations, this);
  fuse_opt_free_args(&arguments);
  if (session_ == nullptr) return failureToMount(options_.mountPoint, EINVAL);
  errno = 0;
  if (fuse_session_mount(session_, options_.mountPoint.c_str()) != 0) {
    return failureToMount(options_.mountPoint, errno);
  }
  isMounted_ = true;
  const fuse_custom_io io{
      .writev = writeReply, .read = readRequest, .splice_receive = nullptr, .splice_send = nullptr};
  const int device = fuse_session_fd(session_);
  const int flags = fcntl(device, F_GETFL);
  if (flags < 0 || fcntl(device, F_SETFL, flags | O_NONBLOCK) != 0) {
    return failureToMount(options_.mountPoint, errno);
  }
  const int failure = fuse_session_custom_io(session_, &io, device);
  return failure == 0 ? nullptr : failureToMount(options_.mountPoint, -failure);
}

KernelSession::~KernelSession() {
  if (isMounted_) fuse_session_unmount(session_);
  if (session_ != nullptr) fuse_session_destroy(session_);
}

int KernelSession::run() {
  RequestLoop loop(
      {.device = fuse_session_fd(session_),
       .receive =
           [this](fuse_buf& request) { return fuse_session_receive_buf(session_, &request); },
       .answer = [this](const fuse_buf& request) { fuse_session_process_buf(session_, &request); },
       .mayTakeLong = mayTakeLong},
      kThreads);
  const int failure = loop.run();
  isOver_ = true;
  return failure;
}

/// The loop waits for the device, which ends with the mount.
void KernelSession::end() {
  if (isOver_) return;
  // What was written through maps is still the kernel's alone.
  const FileDescriptor mounted(
      open(options_.mountPoint.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (mounted) (void)syncfs(mounted.get());
  takeAway(options_.mountPoint);
}

ssize_t KernelSession::readRequest(int descriptor, void* buffer, std::size_t size, void* self) {
  const ssize_t count = read(descriptor, buffer, size);
  auto& session = *static_cast<KernelSession*>(self);
  if (session.firstRequest_ == 0 && count > 0) {
    session.noteOffer(buffer, static_cast<std::size_t>(count));
  }
  return count;
}

/// The first request is that in which the kernel says what it can.
void KernelSession::noteOffer(const void* request, std::size_t size) {
  fuse_in_header header{};
  fuse_init_in offer{};
  if (size < sizeof header) return;
  std::memcpy(&header, request, sizeof header);
  firstRequest_ = header.unique;
  std::memcpy(&offer, static_cast<const char*>(request) + sizeof header,
              std::min(sizeof offer, size - sizeof header));
  const bool isExtended = header.opcode == FUSE_INIT && (offer.flags & kInitExtended) != 0;
  canPassThrough_ = isExtended && options_.isPrivileged && options_.mayPassThrough &&
                    (offer.flags2 & kPassThrough2) != 0;
  canTakeSetIDAway_ = header.opcode == FUSE_INIT && (offer.flags & kWeTakeSetIDAway) != 0;
  canMapDirect_ = isExtended && (offer.flags2 & kDirectMaps2) != 0;
}

/// The library does not know how to ask for what this needs, so its first answer is completed.
ssize_t KernelSession::writeReply(int descriptor, iovec* parts, int count, void* self) {
  auto& session = *static_cast<KernelSession*>(self);
  fuse_out_header header{};
  fuse_init_out answer{};
  if (session.isSettled_ || count != 2 || parts[1].iov_len != sizeof answer) {
    return writev(descriptor, parts, count);
  }
  std::memcpy(&header, parts[0].iov_base, sizeof header);
  if (header.unique != session.firstRequest_) return writev(descriptor, parts, count);
  session.isSettled_ = true;
  std::memcpy(&answer, parts[1].iov_base, sizeof answer);
  std::uint32_t wanted = session.canMapDirect_ ? kDirectMaps2 : 0;
  if (session.canPassThrough_) {
    wanted |= kPassThrough2;
    answer.flags &= ~kWritebackCache;
    answer.unused[0] = 1;  // max_stack_depth: what is below us is no such file system
  }
  // Else it asks with every write whether there is something to take away.
  if (session.canTakeSetIDAway_) answer.flags |= kWeTakeSetIDAway;
  if (wanted != 0) answer.flags |= kInitExtended;
  answer.flags2 |= wanted;
  std::array<iovec, 2> completed{parts[0], {&answer, sizeof answer}};
  return writev(descriptor, completed.data(), 2);
}

int KernelSession::openBacking(int descriptor) {
  const WithoutSetIDCapability asOthers;
  BackingMap map{.descriptor = descriptor, .flags = 0, .padding = 0};
  const int number = ioctl(fuse_session_fd(session_), kBackingOpen, &map);
  if (number > 0) return number;
  const bool isForGood = errno == EPERM || errno == EOPNOTSUPP || errno == ELOOP || errno == ENOTTY;
  if (isForGood && canPassThrough_.exchange(false)) {
    log_default(defaultLog(), "[NOTICE] the kernel reads nothing by itself here: errno %d", errno);
  }
  return 0;
}

void KernelSession::closeBacking(int number) {
  auto closed = static_cast<std::uint32_t>(number);
  (void)ioctl(fuse_session_fd(session_), kBackingClose, &closed);
}

void KernelSession::entryIsOther(const Node& folder, const std::string& name) {
  (void)fuse_lowlevel_notify_inval_entry(session_, numberOf(folder), name.data(), name.size());
}

void KernelSession::entryMayBeOther(const Node& folder, const std::string& name) {
  const int failure = fuse_lowlevel_notify_expire_entry(session_, numberOf(folder), name.data(),
                                                        name.size(), FUSE_LL_EXPIRE_ONLY);
  if (failure == -ENOSYS) entryIsOther(folder, name);
}

void KernelSession::attributesAreOther(const Node& node) {
  (void)fuse_lowlevel_notify_inval_inode(session_, numberOf(node), -1, 0);
}

void KernelSession::contentIsOther(const Node& node) {
  (void)fuse_lowlevel_notify_inval_inode(session_, numberOf(node), 0, 0);
}

}  // namespace yomber
