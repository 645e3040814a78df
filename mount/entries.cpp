// Looking up entries, and forgetting them.
#include <cerrno>

#include "mount/file_system.h"

namespace yomber {
namespace {

/// For how long the kernel keeps that there is no such entry, in seconds: of those it is not told
/// when we have lost track.
constexpr double kNothingThere = 5;

}  // namespace

void FileSystem::lookup(fuse_req_t request, Node& folder, const char* name) {
  if (&folder == root_) {
    if (const auto base = places_->shownBase(name)) return answerBase(request, *base);
  }
  int failure = 0;
  const SharedDescriptor descriptor = folders_.open(folder, failure);
  if (!descriptor) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  const EntryGate::Moment begun = gate_.now(folder.identity.inode);
  const std::string onDisk = nameOnDisk(folder, name);
  struct statx status{};
  failure = lookAt(descriptor->get(), onDisk.c_str(), status);
  if (failure != 0 && failure != ENOENT) {
    (void)fuse_reply_err(request, failure);
    return;
  }
  if (failure == ENOENT) {
    const EntryGate::Telling telling(gate_, folder.identity.inode, begun);
    fuse_entry_param nothing{};
    nothing.entry_timeout = telling.holds() && isTold_ && !folder.isUnwatched ? kNothingThere : 0;
    (void)fuse_reply_entry(request, &nothing);
    return;
  }
  putRight(descriptor->get(), onDisk.c_str(), status);
  answerFound(request, folder, onDisk, status, begun);
}

void FileSystem::answerFound(fuse_req_t request, Node& folder, const std::string& name,
                             const struct statx& status, EntryGate::Moment begun) {
  Node& node = nodes_.found(folder, name, status);
  const EntryGate::Telling telling(gate_, folder.identity.inode, begun);
  const fuse_entry_param entry = entryOf(folder, node, status, telling.holds());
  if (fuse_reply_entry(request, &entry) == -ENOENT) nodes_.forget(node, 1);
}

void FileSystem::forget(fuse_req_t request, Node& node, std::uint64_t lookups) {
  nodes_.forget(node, lookups);
  fuse_reply_none(request);
}

void FileSystem::forgetMany(fuse_req_t request, std::size_t count, fuse_forget_data* forgotten) {
  for (std::size_t i = 0; i < count; ++i) {
    nodes_.forget(nodeOf(forgotten[i].ino), forgotten[i].nlookup);
  }
  fuse_reply_none(request);
}

}  // namespace yomber
