#pragma once

#include <dirent.h>

#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <shared_mutex>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <vector>

#include "mount/file_identity.h"
#include "mount/linked_table.h"
#include "mount/listing_marks.h"
#include "mount/short_name.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/lock.h"

namespace yomber {

using SharedDescriptor = std::shared_ptr<const FileDescriptor>;

/// A file or folder that the kernel knows. Its fields belong to the NodeTable, except where they
/// say otherwise.
///
/// There are as many as the kernel remembers, often all of a drive: what few of them have is kept
/// beside them, and no field is larger than it has to be.
class Node {
 public:
  Node(FileIdentity itsIdentity, std::uint8_t itsType);
  Node(const Node&) = delete;
  Node& operator=(const Node&) = delete;

  [[nodiscard]] bool isFolder() const { return type == DT_DIR; }

  const FileIdentity identity;
  /// Of a folder that is shown in the root although it lies elsewhere, and of the root: the number
  /// of its place among `Places`.
  std::optional<std::uint32_t> base;
  const std::uint8_t type;  ///< DT_…
  /// A folder in which nobody sees changes.
  std::atomic<bool> isUnwatched = false;
  /// The content may be away: it had holes when it was last looked at.
  std::atomic<bool> mayBeAway = false;
  /// Of a folder: what is known of those who list it.
  ListingMarks listing;

 private:
  friend class NodeTable;
  std::uint32_t uses_ = 0;  ///< children, open files and whoever holds a NodeUse
  Node* parent_ = nullptr;  ///< null: a base, or removed
  ShortName name_;          ///< on this disk
  std::uint64_t lookups_ = 0;
  std::int64_t toldChange_ = 0;
  Node* nextByInode_ = nullptr;
  Node* nextByPlace_ = nullptr;
};

class NodeTable;

/// What is left of a file that went from its place.
struct Remains {
  SharedDescriptor descriptor;  ///< O_PATH; may be nil
  bool hasOtherNames = false;   ///< none of which is known here
};

/// Keeps a node although the kernel may forget it. Thread-safety: that of the table.
class NodeUse {
 public:
  NodeUse() = default;
  NodeUse(NodeUse&& other) noexcept;
  NodeUse& operator=(NodeUse&& other) noexcept;
  ~NodeUse();
  [[nodiscard]] Node* get() const { return node_; }
  [[nodiscard]] Node* operator->() const { return node_; }
  explicit operator bool() const { return node_ != nullptr; }

 private:
  friend class NodeTable;
  /// Takes over a use that was counted.
  NodeUse(NodeTable& table, Node& node) : table_(&table), node_(&node) {}

  NodeTable* table_ = nullptr;
  Node* node_ = nullptr;
};

/// What the kernel knows, and where it is: one node for each file, by its place (the folder and the
/// name on this disk under which it was last seen). No node has a descriptor.
///
/// A node lives while the kernel has not forgotten it, while it has children or open files, and
/// while a NodeUse keeps it. Thread-safety: every operation may be called on any thread. Operations
/// on a node need it to be alive: one that the kernel has named in a request that is not answered,
/// or one that is in use.
class NodeTable {
 public:
  NodeTable();
  ~NodeTable();
  NodeTable(const NodeTable&) = delete;
  NodeTable& operator=(const NodeTable&) = delete;

  /// The node of a base (the root, a container's folder, the trash), made when it is new.
  /// It never goes.
  Node& addBase(std::uint32_t base, FileIdentity identity);

  /// The kernel is told of the file that was found in that place: one lookup more. `toldChange` is
  /// its ctime, ns.
  Node& found(Node& folder, std::string_view name, const struct statx& status);
  /// Somebody else has moved a file to that place, or given it that name as well: it is there from
  /// now on, when it is known, for whoever has it open or works in it.
  void seen(Node& folder, std::string_view name, const FileIdentity& identity);
  /// The kernel gives lookups back.
  void forget(Node& node, std::uint64_t lookups);

  /// The kernel was told of attributes with that ctime; 0: it has dropped what it was told.
  void noteTold(Node& node, std::int64_t change);
  /// The ctime that the kernel knows; none that a file has when it may know another one.
  [[nodiscard]] std::int64_t told(const Node& node) const;

  /// Of how many files with other names the remains are kept. The kernel may remember those for
  /// good, but looks most of them up again, which tells us a name.
  static constexpr std::size_t kNamedKept = 128;

  /// A place, and the node that was known to be there before a change; null: none.
  struct Entry {
    Node& folder;
    std::string_view name;
    Node* node = nullptr;
  };
  /// What was at `from` is at `to` now. With `isExchange` the two have changed places; else what
  /// was at `to` was removed. Whoever looks there may have told before that it is.
  void moved(const Entry& from, const Entry& to, bool isExchange, Remains replaced = {});
  /// The file is there no more. The kernel may have it for a while still: what remains is kept for
  /// as long, and its inode number with it.
  void removed(const Entry& entry, Remains remains = {});
  /// What is left of a node that was removed; nil when that is nothing.
  [[nodiscard]] SharedDescriptor remains(const Node& node) const;

  /// To be held from before an entry is moved or removed on the disk until that is told here.
  class Moving {
   public:
    explicit Moving(NodeTable& table) : lock_(table.moving_) {}

   private:
    std::shared_lock<std::shared_mutex> lock_;
  };
  /// To be held while what is on the disk is compared with what is known here: nothing is being
  /// moved meanwhile. Waits for whatever is; not while moving.
  class Standstill {
   public:
    explicit Standstill(NodeTable& table) : lock_(table.moving_) {}

   private:
    std::unique_lock<std::shared_mutex> lock_;
  };
  /// Returns when whatever is being moved now has been told here. Not while moving.
  void waitForMoves() { const Standstill wait(*this); }

  [[nodiscard]] NodeUse use(Node& node);
  [[nodiscard]] NodeUse byInode(std::uint64_t inode);
  [[nodiscard]] NodeUse inPlace(Node& folder, std::string_view name);
  /// Every node that has a place, or is a base.
  [[nodiscard]] std::vector<NodeUse> all();

  /// The way to a node: the base that it is below, and the names from there on, each with the inode
  /// of its folder. Nothing when the node was removed.
  struct Step {
    std::uint64_t folder = 0;
    std::string name;
  };
  struct Way {
    std::uint32_t base = 0;
    std::vector<Step> steps;
  };
  [[nodiscard]] std::optional<Way> wayTo(const Node& node) const;
  /// Where a node is: nothing for bases and for what was removed.
  struct Place {
    NodeUse folder;
    std::string name;
  };
  [[nodiscard]] std::optional<Place> placeOf(const Node& node);
  [[nodiscard]] std::size_t size() const;

 private:
  friend class NodeUse;
  NodeUse startUse(Node& node) REQUIRES(mutex_);
  struct PlaceKey {
    const Node* folder;
    std::string_view name;
  };
  struct ByPlace {
    static std::size_t hash(const PlaceKey& key) {
      return std::hash<std::string_view>()(key.name) * 31 + std::hash<const void*>()(key.folder);
    }
    static std::size_t hash(const Node& node) {
      return hash(PlaceKey{node.parent_, node.name_.view()});
    }
    static bool isSame(const Node& node, const PlaceKey& key) {
      return node.parent_ == key.folder && node.name_ == key.name;
    }
  };
  struct ByInode {
    static std::uint64_t hash(std::uint64_t inode) { return inode; }
    static std::uint64_t hash(const Node& node) { return node.identity.inode; }
    static bool isSame(const Node& node, std::uint64_t inode) {
      return node.identity.inode == inode;
    }
  };

  Node* at(const Node& folder, std::string_view name) const REQUIRES(mutex_);
  void place(Node& node, Node& folder, std::string_view name) REQUIRES(mutex_);
  void unplace(Node& node) REQUIRES(mutex_);
  void noteWatchedBelow() REQUIRES(mutex_);
  void remove(const Entry& entry, Remains remains) REQUIRES(mutex_);
  void endOldestNamed() REQUIRES(mutex_);
  void endRemains(const Node& node) REQUIRES(mutex_);
  static void note(Node& node, std::int64_t change);
  void breakCycle(const Node& node, Node& folder) REQUIRES(mutex_);
  void endUse(Node& node) REQUIRES(mutex_);
  void dropIfUnused(Node& node) REQUIRES(mutex_);
  void stopUse(Node& node);

  std::shared_mutex moving_;
  mutable Mutex mutex_;
  /// Of several nodes with one inode number, the one that was made last.
  LinkedTable<Node, &Node::nextByInode_, ByInode> byInode_ GUARDED_BY(mutex_);
  LinkedTable<Node, &Node::nextByPlace_, ByPlace> byPlace_ GUARDED_BY(mutex_);
  std::unordered_set<Node*> unplaced_ GUARDED_BY(mutex_);  ///< bases, and what was removed
  std::unordered_map<const Node*, SharedDescriptor> remains_ GUARDED_BY(mutex_);
  /// Those of files with other names, the oldest first; some may have ended.
  std::deque<std::pair<const Node*, std::weak_ptr<const FileDescriptor>>> named_ GUARDED_BY(mutex_);
  /// Of nodes that are gone. Closing them may free what they took on the disk: not under the lock.
  std::vector<SharedDescriptor> ended_ GUARDED_BY(mutex_);
};

}  // namespace yomber
