// Listing folders.
#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <string_view>
#include <utility>
#include <vector>

#include "mount/file_system.h"
#include "mount/folder_listing.h"
#include "mount/folder_stream.h"
#include "platform/foundation/descriptor_path.h"

namespace yomber {
namespace {

bool isDots(std::string_view name) { return name == "." || name == ".."; }

/// What may be read but not searched has no "." for us.
FileDescriptor openToRead(int folder) {
  constexpr int kFlags = O_RDONLY | O_DIRECTORY | O_CLOEXEC;
  FileDescriptor opened(openat(folder, ".", kFlags));
  if (opened || errno != EACCES) return opened;
  return FileDescriptor(::open(pathOfDescriptor(folder).c_str(), kFlags));
}

}  // namespace

void FileSystem::opendir(fuse_req_t request, Node& folder, fuse_file_info* info) {
  int failure = 0;
  const SharedDescriptor place = folders_.open(folder, failure);
  FileDescriptor opened;
  if (place) {
    opened = openToRead(place->get());
    failure = errno;
  }
  if (!opened) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  std::vector<Places::ShownBase> shown;
  if (&folder == root_) shown = places_->shownBases();
  auto stream = std::make_unique<FolderStream>(std::move(opened), std::move(shown));
  stream->isWalked = choosesAttributes_ && (info->flags & O_NOFOLLOW) != 0;
  info->fh = reinterpret_cast<std::uint64_t>(stream.get());
  info->keep_cache = isTold_ && !folder.isUnwatched && &folder != root_;
  // From names that it has already, the kernel would look up each entry that is walked over.
  const bool lacksAttributes = stream->isWalked && folder.listing.takeNames();
  info->cache_readdir = info->keep_cache && !lacksAttributes;
  const bool isNews = thumbnails_ != nullptr && thumbnails_->isUnknown(folder.identity.inode);
  auto listed = isNews ? desktopFolder(folder) : std::nullopt;
  if (fuse_reply_open(request, info) == 0) (void)stream.release();
  if (listed) thumbnails_->noteListing(std::move(*listed));
}

void FileSystem::releasedir(fuse_req_t request, Node& /*folder*/, fuse_file_info* info) {
  delete &streamOf(info);
  (void)fuse_reply_err(request, 0);
}

void FileSystem::fsyncdir(fuse_req_t request, Node& /*folder*/, int isDataOnly,
                          fuse_file_info* info) {
  const int descriptor = streamOf(info).descriptor();
  // The folder stays open until this is answered.
  waitForDisk([request, descriptor, isDataOnly] {
    const int result = isDataOnly != 0 ? fdatasync(descriptor) : ::fsync(descriptor);
    (void)fuse_reply_err(request, result == 0 ? 0 : errno);
  });
}

void FileSystem::readdir(fuse_req_t request, Node& folder, std::size_t size, off_t offset,
                         fuse_file_info* info) {
  FolderListing listing(request, size, FolderListing::Form::Names);
  readFolder(request, folder, offset, streamOf(info), false, listing);
}

void FileSystem::readdirplus(fuse_req_t request, Node& folder, std::size_t size, off_t offset,
                             fuse_file_info* info) {
  FolderListing listing(request, size, FolderListing::Form::WithAttributes);
  FolderStream& stream = streamOf(info);
  const bool isWanted = !choosesAttributes_ || stream.isWalked || offset == 0;
  const bool wasLookedAt = folder.listing.takeLookup();
  readFolder(request, folder, offset, stream, isWanted || wasLookedAt, listing);
}

/// Adds an entry to a listing; false when that is full.
bool FileSystem::addEntry(Node& folder, const FolderStream& stream,
                          const FolderStream::Entry& entry, bool withAttributes,
                          FolderListing& listing) {
  const std::string shown =
      entry.shown != nullptr ? entry.name : places_->shownName(folder.identity.inode, entry.name);
  const bool isByName = !withAttributes || isDots(entry.name) || entry.shown != nullptr;
  struct statx status{};
  const bool isTold = !isByName && listing.hasRoomFor(shown.c_str());
  const int failure = isTold ? lookAt(stream.descriptor(), entry.name, status) : 0;
  if (failure == ENOENT) return true;  // gone meanwhile
  // A folder that we may read may have entries that we may not look at.
  if (!isTold || failure != 0) {
    struct stat known{};
    known.st_ino =
        entry.shown != nullptr ? places_->base(entry.shown->base).identity.inode : entry.inode;
    known.st_mode = DTTOIF(entry.type);
    return listing.addName(shown.c_str(), known, entry.next);
  }
  putRight(stream.descriptor(), entry.name, status);
  Node& node = nodes_.found(folder, entry.name, status);
  listing.addEntry(shown.c_str(), entryOf(folder, node, status, true), node, entry.next);
  return true;
}

int FileSystem::fillListing(Node& folder, FolderStream& stream, off_t offset, bool withAttributes,
                            FolderListing& listing) {
  LockGuard guard(stream.mutex);
  FolderStream::Entry entry;
  int failure = stream.seek(offset);
  for (;;) {
    if (failure == 0) failure = stream.look(entry);
    if (failure != 0 || entry.name == nullptr) return failure;
    // A container shown under a name hides what else has it.
    const bool isHidden = entry.shown == nullptr && isShownBase(folder, entry.name);
    if (!isHidden && !addEntry(folder, stream, entry, withAttributes, listing)) return 0;
    stream.take(entry);
  }
}

/// Attributes are told along to whoever wants them: who walks a tree (programs that do open its
/// folders so that no link is followed), who has just begun, since most folders are small, and who
/// looks at entries while he reads on. For that to show, the last of as many as fit is told by its
/// name alone.
void FileSystem::readFolder(fuse_req_t request, Node& folder, off_t offset, FolderStream& stream,
                            bool withAttributes, FolderListing& listing) {
  const EntryGate::Moment begun = gate_.now(folder.identity.inode);
  const bool isSampled = choosesAttributes_ && !stream.isWalked;
  const int failure = fillListing(folder, stream, offset, withAttributes, listing);
  if (failure != 0 && listing.isEmpty()) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  if (!withAttributes && !listing.isEmpty()) folder.listing.noteNames();
  Node* const sample = isSampled && listing.isFull() ? listing.tellLastByName() : nullptr;
  if (sample != nullptr) nodes_.forget(*sample, 1);
  const EntryGate::Telling telling(gate_, folder.identity.inode, begun);
  if (withAttributes && !telling.holds()) listing.holdForNow();
  // Once it is answered, the folder may be closed, and the stream gone.
  if (listing.answer() == 0) return;
  for (Node* node : listing.told()) nodes_.forget(*node, 1);
}

}  // namespace yomber
