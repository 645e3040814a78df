#pragma once

#include <cstddef>
#include <cstdint>
#include <list>
#include <memory>
#include <unordered_map>
#include <utility>

#include "mount/node_table.h"
#include "mount/places.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/lock.h"

namespace yomber {

/// Descriptors (O_PATH) of folders, for calls that name an entry in one. The few that were used
/// last are kept. A way to a folder never leads through a symbolic link, and what is found at its
/// end is that folder or nothing.
///
/// Thread-safety: every operation may be called on any thread.
class FolderDescriptors {
 public:
  static constexpr std::size_t kKept = 128;

  FolderDescriptors(NodeTable& nodes, const Places& places) : nodes_(nodes), places_(places) {}

  /// Nil and an errno when it cannot be opened: ESTALE when the folder is not where it was last
  /// seen. One that was removed is opened as long as something is left of it.
  [[nodiscard]] SharedDescriptor open(const Node& folder, int& failure);
  /// Lets go of a folder that was removed.
  void forget(const FileIdentity& folder);

 private:
  struct Kept {
    FileIdentity identity;
    SharedDescriptor descriptor;
  };
  SharedDescriptor kept(const FileIdentity& identity);
  void keep(const FileIdentity& identity, const SharedDescriptor& descriptor);
  [[nodiscard]] FileDescriptor follow(const NodeTable::Way& way, int& failure) const;

  NodeTable& nodes_;
  const Places& places_;
  Mutex mutex_;
  std::list<Kept> byUse_ GUARDED_BY(mutex_);  ///< the last used first
  std::unordered_map<std::uint64_t, std::list<Kept>::iterator> byInode_ GUARDED_BY(mutex_);
};

}  // namespace yomber
