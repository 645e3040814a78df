#include "mount/file_system.h"

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <utility>

#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/file_time.h"

namespace yomber {
namespace {

/// Years: what is told holds until we say otherwise.
constexpr double kForGood = 3e8;
/// While nobody tells us of changes, in seconds.
constexpr double kForTheMoment = 1;

FaultPoint diskWaited("mount.disk.waited");

statx_timestamp timestampOf(std::int64_t time) {
  const timespec from = timespecOf(time);
  statx_timestamp result{};
  result.tv_sec = from.tv_sec;
  result.tv_nsec = static_cast<std::uint32_t>(from.tv_nsec);
  return result;
}

}  // namespace

FileSystem::FileSystem(std::unique_ptr<Places> places, std::shared_ptr<ContentRequests> requests)
    : places_(std::move(places)),
      requests_(std::move(requests)),
      folders_(nodes_, *places_),
      openFiles_({.open = [this](int descriptor) { return session_->openBacking(descriptor); },
                  .close = [this](int number) { session_->closeBacking(number); }}),
      entryNotices_(
          [this](const EntryNotices::Notice& notice) {
            const auto tell =
                notice.isOther ? &KernelSession::entryIsOther : &KernelSession::entryMayBeOther;
            (session_->*tell)(*notice.folder.get(), notice.name);
          },
          ThreadPool::shared()),
      waits_(requests_),
      root_(&nodeOfBase(Places::kRoot)),
      disk_({.promptThreads = 4, .maximumThreads = 64, .keptIdleThreads = 1}) {}

FileSystem::~FileSystem() = default;

void FileSystem::waitForDisk(std::function<void()> work) {
  disk_.async([work = std::move(work)] {
    (void)diskWaited.hit();
    work();
  });
}

Node& FileSystem::nodeOf(fuse_ino_t number) const {
  if (number == FUSE_ROOT_ID) return *root_;
  return *reinterpret_cast<Node*>(number);  // NOLINT: the number that we gave it
}

OpenFile& FileSystem::fileOf(const fuse_file_info* info) {
  return *reinterpret_cast<OpenFile*>(info->fh);  // NOLINT: the number that we gave it
}

FolderStream& FileSystem::streamOf(const fuse_file_info* info) {
  return *reinterpret_cast<FolderStream*>(info->fh);  // NOLINT: the number that we gave it
}

Node& FileSystem::nodeOfBase(std::uint32_t base) {
  return nodes_.addBase(base, places_->base(base).identity);
}

int FileSystem::descriptorOf(Node& node, Descriptor& descriptor) {
  int failure = ESTALE;
  if (node.isFolder()) {
    descriptor.folder = folders_.open(node, failure);
    if (!descriptor.folder) return failure;
    descriptor.number = descriptor.folder->get();
    return 0;
  }
  descriptor.file = openFiles_.of(node);
  if (descriptor.file) {
    descriptor.number = descriptor.file->any();
    return 0;
  }
  const int failed = inPlace(node, [&](int folder, const char* name) {
    FileDescriptor opened(openat(folder, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
    struct statx status{};
    const int unseen = opened ? lookAt(opened.get(), "", status) : errno;
    if (unseen != 0) return unseen;
    if (FileIdentity::of(status) != node.identity) return ESTALE;
    descriptor.number = opened.get();
    descriptor.owned = std::move(opened);
    return 0;
  });
  if (failed != ESTALE) return failed;
  descriptor.folder = nodes_.remains(node);
  if (!descriptor.folder) return ESTALE;
  descriptor.number = descriptor.folder->get();
  return 0;
}

int FileSystem::inPlace(const Node& node, const std::function<int(int, const char*)>& use) {
  constexpr int kMoves = 8;  // as often as it may be moved meanwhile
  int failure = ESTALE;
  for (int attempt = 0; attempt < kMoves; ++attempt) {
    const auto place = nodes_.placeOf(node);
    if (!place && nodes_.remains(node)) break;
    if (place) {
      const SharedDescriptor folder = folders_.open(*place->folder.get(), failure);
      if (folder) failure = use(folder->get(), place->name.c_str());
      if (failure != ESTALE && failure != ENOENT) return failure;
    }
    // What it changes places with may have been seen in its place, or it in the other one.
    nodes_.waitForMoves();
  }
  return ESTALE;
}

int FileSystem::statusOf(Node& node, struct statx& status) {
  if (node.base) return lookAt(places_->base(*node.base).folder.get(), "", status);
  if (const auto file = openFiles_.of(node)) {
    const int failure = lookAt(file->any(), "", status);
    if (failure == 0) putRight(file->any(), "", status);
    return failure;
  }
  const int failed = inPlace(node, [&](int folder, const char* name) {
    const int unseen = lookAt(folder, name, status);
    if (unseen != 0) return unseen;
    if (FileIdentity::of(status) != node.identity) return ESTALE;
    putRight(folder, name, status);
    return 0;
  });
  if (failed != ESTALE) return failed;
  const SharedDescriptor remains = nodes_.remains(node);
  return remains ? lookAt(remains->get(), "", status) : ESTALE;
}

void FileSystem::putRight(int folder, const char* name, struct statx& status) {
  if (!mayHaveHoles(status)) return;
  std::string path = pathOfDescriptor(folder);
  if (*name != 0) path.append("/").append(name);
  char text[32];
  const ssize_t length = *name != 0
                             ? lgetxattr(path.c_str(), kHeldDateAttribute, text, sizeof text)
                             : ::getxattr(path.c_str(), kHeldDateAttribute, text, sizeof text);
  std::int64_t date = 0;
  if (length <= 0 || std::from_chars(text, text + length, date).ec != std::errc()) return;
  status.stx_mtime = timestampOf(date);
}

std::string FileSystem::nameOnDisk(const Node& folder, const char* name) const {
  return places_->nameOnDisk(folder.identity.inode, name);
}

std::optional<std::string> FileSystem::locationOf(const Node& node) const {
  const auto way = nodes_.wayTo(node);
  if (!way) return std::nullopt;
  std::string result = places_->base(way->base).path;
  for (const auto& step : way->steps) {
    result += '/';
    result += places_->shownName(step.folder, step.name);
  }
  return result;
}

std::optional<DesktopThumbnails::Folder> FileSystem::desktopFolder(const Node& folder) const {
  const auto way = nodes_.wayTo(folder);
  if (!way) return std::nullopt;
  const std::string& base = places_->base(way->base).path;
  DesktopThumbnails::Folder result{.base = way->base,
                                   .inode = folder.identity.inode,
                                   .onDisk = base,
                                   .location = base,
                                   .shown = {}};
  if (way->base != Places::kRoot) result.shown = "/" + places_->shownNameOfBase(way->base);
  for (const auto& step : way->steps) {
    const std::string shown = places_->shownName(step.folder, step.name);
    result.onDisk += "/" + step.name;
    result.location += "/" + shown;
    result.shown += "/" + shown;
  }
  return result;
}

void FileSystem::noteChangedEntry(std::uint64_t folder, const std::string& nameOnDisk) {
  if (space_ != nullptr) space_->noteChange();
  if (thumbnails_ == nullptr || !DesktopThumbnails::mayBePicture(nameOnDisk)) return;
  const NodeUse above = nodes_.byInode(folder);
  const auto place = above ? desktopFolder(*above.get()) : std::nullopt;
  if (place) {
    thumbnails_->noteChange(*place, nameOnDisk);
  } else {
    thumbnails_->forget(folder);
  }
}

bool FileSystem::isShownBase(const Node& folder, const char* name) const {
  return &folder == root_ && places_->shownBase(name).has_value();
}

double FileSystem::longestTime(const Node& folder) const {
  return isTold_ && !folder.isUnwatched ? kForGood : kForTheMoment;
}

fuse_entry_param FileSystem::entryOf(const Node& folder, const Node& node,
                                     const struct statx& status, bool holds) const {
  fuse_entry_param entry{};
  entry.ino = numberOf(node);
  entry.generation = 1;
  entry.attr = statOf(status);
  entry.attr_timeout = holds ? std::min(longestTime(folder), longestTime(node)) : 0;
  entry.entry_timeout = holds ? longestTime(folder) : 0;
  return entry;
}

void FileSystem::answerAttributes(fuse_req_t request, Node& node, struct statx status,
                                  EntryGate::Moment begun) {
  const EntryGate::Telling telling(gate_, node.identity.inode, begun);
  nodes_.noteTold(node, nanoseconds(status.stx_ctime));
  node.mayBeAway = mayHaveHoles(status);
  const struct stat attributes = statOf(status);
  const auto place = nodes_.placeOf(node);
  const double inFolder = longestTime(place ? *place->folder.get() : node);
  const double longest = std::min(inFolder, longestTime(node));
  (void)fuse_reply_attr(request, &attributes, telling.holds() ? longest : 0);
}

void FileSystem::answerBase(fuse_req_t request, std::uint32_t base) {
  Node& node = nodeOfBase(base);
  const EntryGate::Moment begun = gate_.now(node.identity.inode);
  struct statx status{};
  const int failure = statusOf(node, status);
  if (failure != 0) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const EntryGate::Telling telling(gate_, node.identity.inode, begun);
  fuse_entry_param entry = entryOf(node, node, status, telling.holds());
  nodes_.noteTold(node, nanoseconds(status.stx_ctime));
  // Which containers there are is told otherwise than entries are.
  entry.entry_timeout = kForTheMoment;
  (void)fuse_reply_entry(request, &entry);
}

}  // namespace yomber
