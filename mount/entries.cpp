// Looking up entries, and forgetting them.
#include <cerrno>

#include "mount/file_system.h"
#include "platform/foundation/fault_points.h"

namespace yomber {
namespace {

FaultPoint lookupLooked("mount.lookup.looked");
FaultPoint lookupTold("mount.lookup.told");

/// So often an entry is looked at that changes each time.
constexpr int kLooks = 8;
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
  lookAndAnswer(request, folder, descriptor->get(), nameOnDisk(folder, name));
  (void)lookupTold.hit();
}

void FileSystem::lookAndAnswer(fuse_req_t request, Node& folder, int descriptor,
                               const std::string& name) {
  const std::uint64_t inode = folder.identity.inode;
  for (int look = 1;; ++look) {
    const EntryGate::Moment begun = gate_.now(inode);
    struct statx status{};
    const int failure = lookAt(descriptor, name.c_str(), status);
    if (failure != 0 && failure != ENOENT) {
      (void)fuse_reply_err(request, failure);
      return;
    }
    if (failure == 0) {
      folder.listing.noteLookup();
      putRight(descriptor, name.c_str(), status);
    }
    (void)lookupLooked.hit();
    const EntryGate::Telling telling(gate_, inode, begun);
    // It may have been moved: the kernel looks up what it has already without locking the folder.
    if (!telling.holds() && look < kLooks) continue;
    if (failure == 0) return answerFound(request, folder, name, status, telling);
    fuse_entry_param nothing{};
    nothing.entry_timeout = telling.holds() && isTold_ && !folder.isUnwatched ? kNothingThere : 0;
    (void)fuse_reply_entry(request, &nothing);
    return;
  }
}

void FileSystem::answerFound(fuse_req_t request, Node& folder, const std::string& name,
                             const struct statx& status, const EntryGate::Telling& telling) {
  Node& node = nodes_.found(folder, name, status);
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
