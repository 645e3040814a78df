#include "mount/kernel_updates.h"

#include <cstddef>
#include <memory>
#include <unordered_map>
#include <utility>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {
namespace {

FaultPoint changeLooked("mount.change.looked");

constexpr std::size_t kToldTogether = 1000;

}  // namespace

/// Whose content is being dropped on other threads, each on one. Thread-safety: any threads.
class KernelUpdates::Dropping {
 public:
  /// False: somebody is at it, and will do it once more.
  bool begin(const Node& node) {
    LockGuard guard(mutex_);
    const auto [place, isNew] = again_.try_emplace(&node, false);
    if (!isNew) place->second = true;
    return isNew;
  }
  /// The content has been dropped. True: once more.
  bool isToBeDoneAgain(const Node& node) {
    LockGuard guard(mutex_);
    const auto place = again_.find(&node);
    if (std::exchange(place->second, false)) return true;
    again_.erase(place);
    return false;
  }

 private:
  Mutex mutex_;
  std::unordered_map<const Node*, bool> again_ GUARDED_BY(mutex_);
};

KernelUpdates::KernelUpdates(FileSystem& files, KernelSession& session)
    : files_(files), session_(session), dropping_(std::make_shared<Dropping>()) {}

void KernelUpdates::noteEntry(Node& folder, const std::string& name, bool isOther) {
  entries_.push_back({files_.nodes().use(folder), name, isOther});
  if (entries_.size() >= kToldTogether) tellEntries();
}

void KernelUpdates::tellEntries() { files_.entryNotices().send(std::exchange(entries_, {})); }

void KernelUpdates::entryChanged(std::uint64_t folder, const std::string& nameOnDisk) {
  files_.noteChangedEntry(folder, nameOnDisk);
  NodeTable& nodes = files_.nodes();
  const NodeUse above = nodes.byInode(folder);
  if (!above) return;
  files_.gate().change(folder);
  int failure = 0;
  const SharedDescriptor descriptor = files_.folders().open(*above.get(), failure);
  if (!descriptor) return entryMayHaveChanged(*above.get(), nameOnDisk);
  const Found found = lookAgain(*above.get(), descriptor->get(), nameOnDisk);
  const std::string shown = files_.places().shownName(folder, nameOnDisk);
  const std::int64_t change = nanoseconds(found.status.stx_ctime);
  if (found.isOther) {
    noteEntry(*above.get(), shown, true);
  } else if (found.known) {
    nodeChanged(*found.known.get(), change);
  } else {
    // That there was nothing, or another name of a file that has several.
    noteEntry(*above.get(), shown, false);
    const NodeUse same = found.isThere ? nodes.byInode(found.status.stx_ino) : NodeUse();
    if (same && same->identity == FileIdentity::of(found.status)) nodeChanged(*same.get(), change);
  }
}

KernelUpdates::Found KernelUpdates::lookAgain(Node& folder, int descriptor,
                                              const std::string& nameOnDisk) {
  NodeTable& nodes = files_.nodes();
  Found found;
  // What is being moved through us is on the disk already, and not here yet.
  const NodeTable::Standstill standstill(nodes);
  found.isThere = lookAt(descriptor, nameOnDisk.c_str(), found.status) == 0;
  (void)changeLooked.hit();
  found.known = nodes.inPlace(folder, nameOnDisk);
  const bool isSame =
      found.known && found.isThere && found.known->identity == FileIdentity::of(found.status);
  found.isOther = found.known && !isSame;
  if (found.isOther)
    nodes.removed({.folder = folder, .name = nameOnDisk, .node = found.known.get()});
  if (found.isThere && !isSame) nodes.seen(folder, nameOnDisk, FileIdentity::of(found.status));
  return found;
}

/// The folder is not where it was, so the entry cannot be looked at; or looking now says nothing of
/// later.
void KernelUpdates::entryMayHaveChanged(Node& folder, const std::string& nameOnDisk) {
  noteEntry(folder, files_.places().shownName(folder.identity.inode, nameOnDisk), false);
  if (const NodeUse node = files_.nodes().inPlace(folder, nameOnDisk)) {
    files_.nodes().noteTold(*node.get(), 0);
    nodeIsOther(*node.get());
  }
}

void KernelUpdates::folderChanged(std::uint64_t folder) {
  if (files_.thumbnails() != nullptr) files_.thumbnails()->forget(folder);
  NodeTable& nodes = files_.nodes();
  const NodeUse above = nodes.byInode(folder);
  if (!above) return;
  files_.gate().change(folder);
  // Of what is in it now nobody will tell: the kernel is to look for itself.
  const bool isUnwatched = above->isUnwatched || (!above->base && !nodes.placeOf(*above.get()));
  for (const NodeUse& node : nodes.all()) {
    const auto place = nodes.placeOf(*node.get());
    if (!place || place->folder.get() != above.get()) continue;
    if (isUnwatched) {
      entryMayHaveChanged(*above.get(), place->name);
    } else {
      entryChanged(folder, place->name);
    }
  }
  nodes.noteTold(*above.get(), 0);
  session_.contentIsOther(*above.get());
}

void KernelUpdates::attributesChanged(std::uint64_t folder) {
  const NodeUse node = files_.nodes().byInode(folder);
  if (!node) return;
  int failure = 0;
  const SharedDescriptor descriptor = files_.folders().open(*node.get(), failure);
  struct statx status{};
  if (!descriptor || lookAt(descriptor->get(), "", status) != 0) return;
  nodeChanged(*node.get(), nanoseconds(status.stx_ctime));
}

void KernelUpdates::nodeChanged(Node& node, std::int64_t change) {
  files_.gate().change(node.identity.inode);
  if (files_.nodes().told(node) == change) return;
  files_.nodes().noteTold(node, 0);
  nodeIsOther(node);
}

/// All of it: the kernel drops content by itself only when the date is another one, which whoever
/// changes it may put back.
void KernelUpdates::nodeIsOther(Node& node) {
  if (!files_.mayWaitForContent(node)) return session_.contentIsOther(node);
  session_.attributesAreOther(node);
  // The kernel drops no page that is being read, and waits: maybe for as long as content takes.
  if (!dropping_->begin(node)) return;
  ThreadPool::shared().async([&session = session_, dropping = dropping_,
                              use = std::make_shared<NodeUse>(files_.nodes().use(node))] {
    do {
      session.contentIsOther(*use->get());
    } while (dropping->isToBeDoneAgain(*use->get()));
  });
}

void KernelUpdates::anythingChanged() {
  files_.gate().changeAll();
  NodeTable& nodes = files_.nodes();
  for (const NodeUse& node : nodes.all()) {
    nodes.noteTold(*node.get(), 0);
    nodeIsOther(*node.get());
    const auto place = nodes.placeOf(*node.get());
    if (!place) continue;
    const std::uint64_t folder = place->folder->identity.inode;
    noteEntry(*place->folder.get(), files_.places().shownName(folder, place->name), false);
  }
}

void KernelUpdates::showName(std::uint64_t folder, const std::string& nameOnDisk,
                             const std::string& name) {
  const std::string before = files_.places().shownName(folder, nameOnDisk);
  files_.places().showName(folder, nameOnDisk, name);
  const std::string after = files_.places().shownName(folder, nameOnDisk);
  const NodeUse above = files_.nodes().byInode(folder);
  if (!above || before == after) return;
  files_.gate().change(folder);
  noteEntry(*above.get(), before, true);
  noteEntry(*above.get(), after, true);
  session_.contentIsOther(*above.get());
}

void KernelUpdates::showContainer(const std::string& location, const std::string& name) {
  const auto before = files_.places().shownBases();
  files_.places().showContainer(location, name);
  Node& root = files_.root();
  files_.gate().change(root.identity.inode);
  for (const auto& shown : before) {
    const auto now = files_.places().shownBase(shown.name);
    if (now != shown.base) noteEntry(root, shown.name, true);
  }
  if (!name.empty()) noteEntry(root, name, false);
  session_.contentIsOther(root);
}

}  // namespace yomber
