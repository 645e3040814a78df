// Listing folders.
#include <dirent.h>
#include <fcntl.h>
#include <linux/fuse.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <string_view>
#include <vector>

#include "mount/file_system.h"
#include "mount/folder_stream.h"

namespace yomber {
namespace {

bool isDots(std::string_view name) { return name == "." || name == ".."; }

}  // namespace

/// A reply that is being filled with entries.
class FolderListing {
 public:
  FolderListing(fuse_req_t request, std::size_t size) : request_(request), bytes_(size) {}

  /// False when it is full.
  bool add(const char* name, const struct stat& attributes, off_t next) {
    return took(fuse_add_direntry(request_, rest(), left(), name, &attributes, next));
  }
  bool add(const char* name, const fuse_entry_param& entry, off_t next) {
    return took(fuse_add_direntry_plus(request_, rest(), left(), name, &entry, next));
  }
  [[nodiscard]] bool hasRoomFor(const std::string& name) const {
    return fuse_add_direntry_plus(request_, nullptr, 0, name.c_str(), nullptr, 0) <= left();
  }
  /// The kernel is to remember the node, if the reply reaches it.
  void noteTold(Node& node) { told_.push_back(&node); }
  [[nodiscard]] const std::vector<Node*>& told() const { return told_; }
  [[nodiscard]] bool isEmpty() const { return used_ == 0; }

  /// What is told with attributes must be asked for again before it is used.
  void holdForNow() {
    for (std::size_t at = 0; at + sizeof(fuse_direntplus) <= used_;) {
      fuse_direntplus entry{};
      std::memcpy(&entry, bytes_.data() + at, sizeof entry);
      entry.entry_out.entry_valid = 0;
      entry.entry_out.entry_valid_nsec = 0;
      entry.entry_out.attr_valid = 0;
      entry.entry_out.attr_valid_nsec = 0;
      std::memcpy(bytes_.data() + at, &entry, sizeof entry);
      at += FUSE_DIRENTPLUS_SIZE(&entry);
    }
  }
  int answer() { return fuse_reply_buf(request_, bytes_.data(), used_); }

 private:
  char* rest() { return bytes_.data() + used_; }
  [[nodiscard]] std::size_t left() const { return bytes_.size() - used_; }
  bool took(std::size_t size) {
    if (size > left()) return false;
    used_ += size;
    return true;
  }

  fuse_req_t request_;
  std::vector<char> bytes_;
  std::size_t used_ = 0;
  std::vector<Node*> told_;
};

void FileSystem::opendir(fuse_req_t request, Node& folder, fuse_file_info* info) {
  int failure = 0;
  const SharedDescriptor place = folders_.open(folder, failure);
  FileDescriptor opened;
  if (place) {
    opened = FileDescriptor(openat(place->get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    failure = errno;
  }
  if (!opened) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  std::vector<Places::ShownBase> shown;
  if (&folder == root_) shown = places_->shownBases();
  auto stream = std::make_unique<FolderStream>(std::move(opened), std::move(shown));
  info->fh = reinterpret_cast<std::uint64_t>(stream.get());
  info->cache_readdir = isTold_ && !folder.isUnwatched && &folder != root_;
  info->keep_cache = info->cache_readdir;
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
  const int result = isDataOnly != 0 ? fdatasync(descriptor) : ::fsync(descriptor);
  (void)fuse_reply_err(request, result == 0 ? 0 : errno);
}

void FileSystem::readdir(fuse_req_t request, Node& folder, std::size_t size, off_t offset,
                         fuse_file_info* info) {
  readFolder(request, folder, size, offset, info, false);
}

void FileSystem::readdirplus(fuse_req_t request, Node& folder, std::size_t size, off_t offset,
                             fuse_file_info* info) {
  readFolder(request, folder, size, offset, info, true);
}

/// Adds an entry to a listing; false when that is full.
bool FileSystem::addEntry(Node& folder, const FolderStream& stream,
                          const FolderStream::Entry& entry, bool withAttributes,
                          FolderListing& listing) {
  const std::string shown =
      entry.shown != nullptr ? entry.name : places_->shownName(folder.identity.inode, entry.name);
  fuse_entry_param told{};
  told.attr.st_ino =
      entry.shown != nullptr ? places_->base(entry.shown->base).identity.inode : entry.inode;
  told.attr.st_mode = DTTOIF(entry.type);
  if (!withAttributes) return listing.add(shown.c_str(), told.attr, entry.next);
  // Without a number the kernel takes the name alone, and looks it up when it needs it.
  if (isDots(entry.name) || entry.shown != nullptr || !listing.hasRoomFor(shown)) {
    return listing.add(shown.c_str(), told, entry.next);
  }
  struct statx status{};
  if (lookAt(stream.descriptor(), entry.name, status) != 0) return true;  // gone meanwhile
  putRight(stream.descriptor(), entry.name, status);
  Node& node = nodes_.found(folder, entry.name, status);
  told = entryOf(folder, node, status, true);
  listing.noteTold(node);
  return listing.add(shown.c_str(), told, entry.next);
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

void FileSystem::readFolder(fuse_req_t request, Node& folder, std::size_t size, off_t offset,
                            fuse_file_info* info, bool withAttributes) {
  const EntryGate::Moment begun = gate_.now(folder.identity.inode);
  FolderListing listing(request, size);
  const int failure = fillListing(folder, streamOf(info), offset, withAttributes, listing);
  if (failure != 0 && listing.isEmpty()) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const EntryGate::Telling telling(gate_, folder.identity.inode, begun);
  if (withAttributes && !telling.holds()) listing.holdForNow();
  // Once it is answered, the folder may be closed, and the stream gone.
  if (listing.answer() == 0) return;
  for (Node* node : listing.told()) nodes_.forget(*node, 1);
}

}  // namespace yomber
