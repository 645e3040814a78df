#include "mount/node_table.h"

#include <algorithm>
#include <limits>
#include <utility>

#include "mount/open_files.h"
#include "mount/places.h"

namespace yomber {
namespace {

/// Where the daemon watches nothing: what the drive leaves alone, and its own notes in the trash.
bool isUnwatchedFolder(const Node& folder, std::string_view name) {
  return folder.isUnwatched || name.ends_with(".nosync") ||
         (folder.base == Places::kTrash && name == "info");
}

/// What of several ctimes the kernel knows. Other than 0, it stays until what it knows is dropped.
constexpr std::int64_t kUnknownChange = std::numeric_limits<std::int64_t>::min();

}  // namespace

Node::Node(FileIdentity itsIdentity, std::uint32_t itsType)
    : identity(itsIdentity), type(itsType) {}
Node::~Node() = default;

NodeUse::NodeUse(NodeUse&& other) noexcept
    : table_(other.table_), node_(std::exchange(other.node_, nullptr)) {}

NodeUse& NodeUse::operator=(NodeUse&& other) noexcept {
  std::swap(table_, other.table_);
  std::swap(node_, other.node_);
  return *this;
}

NodeUse::~NodeUse() {
  if (node_ != nullptr) table_->stopUse(*node_);
}

NodeTable::NodeTable() = default;

NodeTable::~NodeTable() {
  for (Node* node : byPlace_) delete node;
  for (Node* node : unplaced_) delete node;
}

Node& NodeTable::addBase(std::uint32_t base, FileIdentity identity) {
  LockGuard guard(mutex_);
  const auto known = byInode_.find(identity.inode);
  if (known != byInode_.end() && known->second->base == base) return *known->second;
  auto* node = new Node(identity, S_IFDIR);
  node->base = base;
  node->uses_ = 1;
  unplaced_.insert(node);
  byInode_[identity.inode] = node;
  return *node;
}

Node& NodeTable::found(Node& folder, std::string_view name, const struct statx& status) {
  const FileIdentity identity = FileIdentity::of(status);
  LockGuard guard(mutex_);
  Node*& known = byInode_[identity.inode];
  if (known != nullptr &&
      (known->identity != identity || known->type != (status.stx_mode & S_IFMT))) {
    known = nullptr;  // its inode number was given again
  }
  if (known == nullptr) {
    known = new Node(identity, status.stx_mode & S_IFMT);
    unplaced_.insert(known);
  }
  Node& node = *known;
  ++node.lookups_;
  node.mayBeAway = mayHaveHoles(status);
  if (!node.base && (node.parent_ != &folder || node.name_ != name)) place(node, folder, name);
  note(node, nanoseconds(status.stx_ctime));
  return node;
}

void NodeTable::forget(Node& node, std::uint64_t lookups) {
  std::vector<SharedDescriptor> ended;
  LockGuard guard(mutex_);
  node.lookups_ -= std::min(lookups, node.lookups_);
  dropIfUnused(node);
  ended.swap(ended_);
}

void NodeTable::noteTold(Node& node, std::int64_t change) {
  LockGuard guard(mutex_);
  note(node, change);
}

/// Of two answers to requests that met, the kernel takes the one that it sees first.
void NodeTable::note(Node& node, std::int64_t change) {
  const bool isOther = change != 0 && node.toldChange_ != 0 && node.toldChange_ != change;
  node.toldChange_ = isOther ? kUnknownChange : change;
}

std::int64_t NodeTable::told(const Node& node) const {
  LockGuard guard(mutex_);
  return node.toldChange_;
}

void NodeTable::moved(Node& folder, std::string_view name, Node& newFolder,
                      std::string_view newName, bool isExchange, SharedDescriptor remains) {
  LockGuard guard(mutex_);
  Node* const node = at(folder, name);
  Node* const other = at(newFolder, newName);
  if (node == other) return;  // two names of one file
  // Kept while it is nowhere.
  if (node != nullptr) ++node->uses_;
  if (other != nullptr) ++other->uses_;
  if (node != nullptr) unplace(*node);
  if (other != nullptr && isExchange) unplace(*other);
  if (other != nullptr && !isExchange) remove(*other, std::move(remains));
  if (node != nullptr) place(*node, newFolder, newName);
  if (other != nullptr && isExchange) place(*other, folder, name);
  if (node != nullptr) endUse(*node);
  if (other != nullptr) endUse(*other);
}

void NodeTable::removed(Node& folder, std::string_view name, SharedDescriptor remains) {
  LockGuard guard(mutex_);
  Node* const node = at(folder, name);
  if (node == nullptr) return;
  ++node->uses_;
  remove(*node, std::move(remains));
  endUse(*node);
}

void NodeTable::remove(Node& node, SharedDescriptor remains) {
  unplace(node);
  node.remains_ = std::move(remains);
}

SharedDescriptor NodeTable::remains(const Node& node) const {
  LockGuard guard(mutex_);
  return node.remains_;
}

NodeUse NodeTable::startUse(Node& node) {
  ++node.uses_;
  return {*this, node};
}

NodeUse NodeTable::use(Node& node) {
  LockGuard guard(mutex_);
  return startUse(node);
}

NodeUse NodeTable::byInode(std::uint64_t inode) {
  LockGuard guard(mutex_);
  const auto known = byInode_.find(inode);
  return known == byInode_.end() ? NodeUse() : startUse(*known->second);
}

NodeUse NodeTable::inPlace(Node& folder, std::string_view name) {
  LockGuard guard(mutex_);
  Node* const node = at(folder, name);
  return node == nullptr ? NodeUse() : startUse(*node);
}

std::vector<NodeUse> NodeTable::all() {
  LockGuard guard(mutex_);
  std::vector<NodeUse> result;
  result.reserve(byInode_.size());
  for (const auto& [inode, node] : byInode_) result.push_back(startUse(*node));
  return result;
}

std::optional<NodeTable::Way> NodeTable::wayTo(const Node& node) const {
  LockGuard guard(mutex_);
  Way way;
  const Node* step = &node;
  while (!step->base) {
    if (step->parent_ == nullptr) return std::nullopt;
    way.steps.push_back({step->parent_->identity.inode, step->name_});
    step = step->parent_;
  }
  std::reverse(way.steps.begin(), way.steps.end());
  way.base = *step->base;
  return way;
}

std::optional<NodeTable::Place> NodeTable::placeOf(const Node& node) {
  LockGuard guard(mutex_);
  if (node.parent_ == nullptr) return std::nullopt;
  return Place{startUse(*node.parent_), node.name_};
}

std::size_t NodeTable::size() const {
  LockGuard guard(mutex_);
  return byPlace_.size() + unplaced_.size();
}

Node* NodeTable::at(const Node& folder, std::string_view name) const {
  const auto found = byPlace_.find(PlaceKey{&folder, name});
  return found == byPlace_.end() ? nullptr : *found;
}

void NodeTable::place(Node& node, Node& folder, std::string_view name) {
  if (Node* const other = at(folder, name); other != nullptr && other != &node) {
    ++other->uses_;
    unplace(*other);
    endUse(*other);
  }
  ++node.uses_;
  unplace(node);
  breakCycle(node, folder);
  node.isUnwatched = node.isFolder() && isUnwatchedFolder(folder, name);
  ++folder.uses_;
  node.parent_ = &folder;
  node.name_ = name;
  if (node.remains_) ended_.push_back(std::move(node.remains_));  // it has another name
  unplaced_.erase(&node);
  byPlace_.insert(&node);
  endUse(node);
}

/// Folders that were moved behind our back may be found again in any order: one of those on the way
/// from `folder` up is not where it was.
void NodeTable::breakCycle(const Node& node, Node& folder) {
  for (Node* step = &folder; step->parent_ != nullptr; step = step->parent_) {
    if (step->parent_ != &node) continue;
    ++step->uses_;
    unplace(*step);
    --step->uses_;  // whoever places something below it keeps it
    return;
  }
}

void NodeTable::unplace(Node& node) {
  Node* const folder = node.parent_;
  if (folder == nullptr) return;
  byPlace_.erase(&node);
  unplaced_.insert(&node);
  node.parent_ = nullptr;
  node.name_.clear();
  endUse(*folder);
}

void NodeTable::endUse(Node& node) {
  --node.uses_;
  dropIfUnused(node);
}

void NodeTable::dropIfUnused(Node& node) {
  if (node.lookups_ > 0 || node.uses_ > 0) return;
  if (node.parent_ != nullptr) {
    ++node.uses_;
    unplace(node);
    --node.uses_;
  }
  unplaced_.erase(&node);
  if (node.remains_) ended_.push_back(std::move(node.remains_));
  const auto known = byInode_.find(node.identity.inode);
  if (known != byInode_.end() && known->second == &node) byInode_.erase(known);
  delete &node;
}

void NodeTable::stopUse(Node& node) {
  std::vector<SharedDescriptor> ended;
  LockGuard guard(mutex_);
  endUse(node);
  ended.swap(ended_);
}

}  // namespace yomber
