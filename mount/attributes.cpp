// Attributes of files and folders, extended ones too.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <climits>
#include <ctime>
#include <string>
#include <string_view>
#include <vector>

#include "mount/file_system.h"
#include "mount/set_id_bits.h"
#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/file_time.h"

namespace yomber {
namespace {

/// The drive's own attributes are nobody else's business.
constexpr std::string_view kOwnPrefix = "user.yomber.";
/// Permissions are checked by the kernel, which does not ask for these.
constexpr std::string_view kAccessListPrefix = "system.posix_acl_";
/// Programs that list files ask for it of each, until one answer is that there are none here.
constexpr std::string_view kLabel = "security.selinux";

bool isOwn(std::string_view name) { return name.starts_with(kOwnPrefix); }
bool isAccessList(std::string_view name) { return name.starts_with(kAccessListPrefix); }

timespec timeFrom(const struct stat& wanted, int which, int set, int setNow, bool isAccess) {
  if ((which & setNow) != 0) return {.tv_sec = 0, .tv_nsec = UTIME_NOW};
  if ((which & set) == 0) return {.tv_sec = 0, .tv_nsec = UTIME_OMIT};
  return isAccess ? wanted.st_atim : wanted.st_mtim;
}

/// Who is filling the file, or giving it up, puts the date back that is noted in it: ours is noted
/// instead. Whether there was a note.
bool noteDate(const std::string& path, const timespec& date) {
  if (date.tv_nsec == UTIME_OMIT) return false;
  if (::getxattr(path.c_str(), kHeldDateAttribute, nullptr, 0) < 0) return false;
  timespec noted = date;
  if (date.tv_nsec == UTIME_NOW) (void)clock_gettime(CLOCK_REALTIME, &noted);
  const std::string text = std::to_string(nanosecondsOf(noted));
  return ::setxattr(path.c_str(), kHeldDateAttribute, text.data(), text.size(), XATTR_REPLACE) == 0;
}

/// Whether nobody is about to put another date back, or has.
bool isKept(int descriptor, const std::string& path, const timespec& date) {
  struct statx status{};
  if (::getxattr(path.c_str(), kHeldDateAttribute, nullptr, 0) >= 0) return false;
  return date.tv_nsec == UTIME_NOW || lookAt(descriptor, "", status) != 0 ||
         nanoseconds(status.stx_mtime) == nanosecondsOf(date);
}

/// 0 or an errno. `times` as of utimensat.
int setDates(int descriptor, const std::array<timespec, 2>& times) {
  constexpr int kAttempts = 8;  // as often as a change may begin or end meanwhile
  const std::string path = pathOfDescriptor(descriptor);
  const timespec& date = times[1];
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    // The note first: who puts a date back looks for another note afterwards.
    const bool isNoted = noteDate(path, date);
    if (utimensat(descriptor, "", times.data(), AT_EMPTY_PATH) != 0) return errno;
    if (isNoted || date.tv_nsec == UTIME_OMIT || isKept(descriptor, path, date)) break;
  }
  return 0;
}

/// 0 or an errno. The set-id bits that go with it are those that the caller would take away on the
/// disk. A request that changes neither user nor group comes from the kernel before a write by
/// whoever has the file open, `mayBeWritten`, or of a chown that leaves both as they are: only the
/// owner may take bits away with that.
int setOwner(fuse_req_t request, int descriptor, const struct stat& wanted, int which,
             bool mayBeWritten) {
  struct stat before{};
  if (fstat(descriptor, &before) != 0) return errno;
  const mode_t taken = S_ISDIR(before.st_mode) ? 0 : setIDToTake(request, before);
  const bool isOwners = fuse_req_ctx(request)->uid == before.st_uid;
  const bool isKept = (which & (FUSE_SET_ATTR_UID | FUSE_SET_ATTR_GID)) == 0;
  if (isKept && taken != 0 && !isOwners && !mayBeWritten) return EPERM;
  const uid_t user = (which & FUSE_SET_ATTR_UID) != 0 ? wanted.st_uid : static_cast<uid_t>(-1);
  const gid_t group = (which & FUSE_SET_ATTR_GID) != 0 ? wanted.st_gid : static_cast<gid_t>(-1);
  if (fchownat(descriptor, "", user, group, AT_EMPTY_PATH) != 0) return errno;
  // Where the group may not execute, the kernel goes by our groups, not by the caller's.
  struct stat after{};
  const bool isLeft = (taken & S_ISGID) != 0 && fstat(descriptor, &after) == 0 &&
                      (after.st_mode & (S_ISGID | S_IXGRP)) == S_ISGID;
  const mode_t rest = after.st_mode & ALLPERMS & ~static_cast<mode_t>(S_ISGID);
  return isLeft && chmod(pathOfDescriptor(descriptor).c_str(), rest) != 0 ? errno : 0;
}

/// All but the size: 0 or an errno.
int setOthers(fuse_req_t request, int descriptor, const struct stat& wanted, int which,
              bool mayBeWritten) {
  const std::string path = pathOfDescriptor(descriptor);
  constexpr int kTimes =
      FUSE_SET_ATTR_ATIME | FUSE_SET_ATTR_MTIME | FUSE_SET_ATTR_ATIME_NOW | FUSE_SET_ATTR_MTIME_NOW;
  // What changes nothing is a change of owner that leaves both as they are.
  const bool isOwnerKept = (which & (FUSE_SET_ATTR_MODE | FUSE_SET_ATTR_SIZE | kTimes)) == 0;
  if (isOwnerKept || (which & (FUSE_SET_ATTR_UID | FUSE_SET_ATTR_GID)) != 0) {
    const int failure = setOwner(request, descriptor, wanted, which, mayBeWritten);
    if (failure != 0) return failure;
  }
  // After the owner, whose change takes set-id bits away.
  if ((which & FUSE_SET_ATTR_MODE) != 0 && chmod(path.c_str(), wanted.st_mode & ALLPERMS) != 0) {
    return errno;
  }
  if ((which & kTimes) == 0) return 0;
  const std::array<timespec, 2> times{
      timeFrom(wanted, which, FUSE_SET_ATTR_ATIME, FUSE_SET_ATTR_ATIME_NOW, true),
      timeFrom(wanted, which, FUSE_SET_ATTR_MTIME, FUSE_SET_ATTR_MTIME_NOW, false)};
  return setDates(descriptor, times);
}

/// Names end with a zero each.
std::vector<char> withoutOwn(const std::vector<char>& names) {
  std::vector<char> result;
  for (std::size_t start = 0; start < names.size();) {
    const std::string_view name(names.data() + start);
    if (!isOwn(name) && !isAccessList(name)) {
      result.insert(result.end(), name.begin(), name.end());
      result.push_back(0);
    }
    start += name.size() + 1;
  }
  return result;
}

}  // namespace

void FileSystem::getattr(fuse_req_t request, Node& node, fuse_file_info* /*info*/) {
  const EntryGate::Moment begun = gate_.now(node.identity.inode);
  struct statx status{};
  const int failure = statusOf(node, status);
  if (failure == 0) return answerAttributes(request, node, status, begun);
  (void)fuse_reply_err(request, failure);
}

void FileSystem::setattr(fuse_req_t request, Node& node, struct stat* wanted, int which,
                         fuse_file_info* info) {
  nodes_.noteTold(node, 0);
  const struct stat others = *wanted;
  const auto finish = [this, request, use = std::make_shared<NodeUse>(nodes_.use(node)), others,
                       which](int failure) {
    Descriptor descriptor;
    if (failure == 0) failure = descriptorOf(*use->get(), descriptor);
    if (failure == 0) {
      failure = setOthers(request, descriptor.number, others, which,
                          openFiles_.mayBeWritten(*use->get()));
    }
    const EntryGate::Moment begun = gate_.now(use->get()->identity.inode);
    struct statx status{};
    if (failure == 0) failure = lookAt(descriptor.number, "", status);
    if (failure == 0) putRight(descriptor.number, "", status);
    if (failure == 0) return answerAttributes(request, *use->get(), status, begun);
    (void)fuse_reply_err(request, failure);
  };
  if ((which & FUSE_SET_ATTR_SIZE) == 0) return finish(0);
  truncate(request, node, wanted->st_size, info, finish);
}

void FileSystem::readlink(fuse_req_t request, Node& node) {
  Descriptor descriptor;
  const int failure = descriptorOf(node, descriptor);
  if (failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  std::array<char, PATH_MAX + 1> target{};
  const ssize_t length = readlinkat(descriptor.number, "", target.data(), PATH_MAX);
  if (length < 0) {
    (void)fuse_reply_err(request, errno);
    return;
  }
  (void)fuse_reply_readlink(request, target.data());
}

void FileSystem::statfs(fuse_req_t request, Node& /*node*/) {
  struct statvfs status{};
  if (fstatvfs(places_->base(Places::kRoot).folder.get(), &status) != 0) {
    (void)fuse_reply_err(request, errno);
    return;
  }
  (void)fuse_reply_statfs(request, &status);
}

void FileSystem::setxattr(fuse_req_t request, Node& node, const char* name, const char* value,
                          std::size_t size, int flags) {
  Descriptor descriptor;
  int failure = isOwn(name) ? EPERM : 0;
  if (isAccessList(name)) failure = EOPNOTSUPP;
  if (failure == 0) failure = descriptorOf(node, descriptor);
  if (failure == 0 &&
      ::setxattr(pathOfDescriptor(descriptor.number).c_str(), name, value, size, flags) != 0) {
    failure = errno;
  }
  nodes_.noteTold(node, 0);
  (void)fuse_reply_err(request, failure);
}

void FileSystem::getxattr(fuse_req_t request, Node& node, const char* name, std::size_t size) {
  Descriptor descriptor;
  int failure = isOwn(name) ? ENODATA : 0;
  if (isAccessList(name)) failure = EOPNOTSUPP;
  if (failure == 0) failure = descriptorOf(node, descriptor);
  std::vector<char> value(size);
  ssize_t length = 0;
  if (failure == 0) {
    length = ::getxattr(pathOfDescriptor(descriptor.number).c_str(), name, value.data(), size);
    if (length < 0) failure = errno;
    if (failure == ENODATA && name == kLabel) failure = EOPNOTSUPP;
  }
  if (failure != 0) {
    (void)fuse_reply_err(request, failure);
  } else if (size == 0) {
    (void)fuse_reply_xattr(request, static_cast<std::size_t>(length));
  } else {
    (void)fuse_reply_buf(request, value.data(), static_cast<std::size_t>(length));
  }
}

void FileSystem::listxattr(fuse_req_t request, Node& node, std::size_t size) {
  Descriptor descriptor;
  int failure = descriptorOf(node, descriptor);
  std::vector<char> names(XATTR_LIST_MAX);
  if (failure == 0) {
    const ssize_t length =
        ::listxattr(pathOfDescriptor(descriptor.number).c_str(), names.data(), names.size());
    if (length < 0) failure = errno;
    names.resize(static_cast<std::size_t>(std::max<ssize_t>(length, 0)));
  }
  if (failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const std::vector<char> shown = withoutOwn(names);
  if (size == 0) {
    (void)fuse_reply_xattr(request, shown.size());
  } else if (shown.size() > size) {
    (void)fuse_reply_err(request, ERANGE);
  } else {
    (void)fuse_reply_buf(request, shown.data(), shown.size());
  }
}

void FileSystem::removexattr(fuse_req_t request, Node& node, const char* name) {
  Descriptor descriptor;
  int failure = isOwn(name) ? ENODATA : 0;
  if (isAccessList(name)) failure = EOPNOTSUPP;
  if (failure == 0) failure = descriptorOf(node, descriptor);
  if (failure == 0 && ::removexattr(pathOfDescriptor(descriptor.number).c_str(), name) != 0)
    failure = errno;
  nodes_.noteTold(node, 0);
  (void)fuse_reply_err(request, failure);
}

}  // namespace yomber
