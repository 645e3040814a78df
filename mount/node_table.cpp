#include "mount/node_table.h"

#include <algorithm>
#include <limits>
#include <ranges>
#include <utility>

#include "mount/places.h"
#include "platform/ostrell/exclusions.h"

namespace yomber {
namespace {

/// Where the daemon watches nothing: what the drive leaves alone, and its own notes in the trash.
bool isUnwatchedFolder(const Node& folder, std::string_view name) {
  return folder.isUnwatched || qs_isExcludedName(name) ||
         (folder.base == Places::kTrash && name == "info");
}

/// What of several ctimes the kernel knows. Other than 0, it stays until what it knows is dropped.
constexpr std::int64_t kUnknownChange = std::numeric_limits<std::int64_t>::min();

}  // namespace

Node::Node(FileIdentity itsIdentity, std::uint8_t itsType) : identity(itsIdentity), type(itsType) {}

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
  byPlace_.forEach([](Node& node) { delete &node; });
  for (Node* node : unplaced_) delete node;
}

Node& NodeTable::addBase(std::uint32_t base, FileIdentity identity) {
  LockGuard guard(mutex_);
  Node* const known = byInode_.find(identity.inode);
  if (known != nullptr && known->base == base) return *known;
  if (known != nullptr) byInode_.erase(*known);
  auto* node = new Node(identity, DT_DIR);
  node->base = base;
  node->uses_ = 1;
  unplaced_.insert(node);
  byInode_.insert(*node);
  return *node;
}

Node& NodeTable::found(Node& folder, std::string_view name, const struct statx& status) {
  const FileIdentity identity = FileIdentity::of(status);
  const auto type = static_cast<std::uint8_t>(IFTODT(status.stx_mode));
  LockGuard guard(mutex_);
  Node* known = byInode_.find(identity.inode);
  if (known != nullptr && (known->identity != identity || known->type != type)) {
    byInode_.erase(*known);
    known = nullptr;  // its inode number was given again
  }
  if (known == nullptr) {
    known = new Node(identity, type);
    byInode_.insert(*known);
  }
  Node& node = *known;
  ++node.lookups_;
  node.mayBeAway = mayHaveHoles(status);
  place(node, folder, name);
  note(node, nanoseconds(status.stx_ctime));
  return node;
}

void NodeTable::seen(Node& folder, std::string_view name, const FileIdentity& identity) {
  std::vector<SharedDescriptor> ended;
  LockGuard guard(mutex_);
  Node* const node = byInode_.find(identity.inode);
  if (node != nullptr && node->identity == identity) place(*node, folder, name);
  ended.swap(ended_);
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

void NodeTable::moved(const Entry& from, const Entry& to, bool isExchange, Remains replaced) {
  LockGuard guard(mutex_);
  Node* const node = from.node;
  Node* const other = to.node;
  if (node == other) return;  // two names of one file
  // Kept while it is nowhere.
  if (node != nullptr) ++node->uses_;
  if (other != nullptr) ++other->uses_;
  if (other != nullptr && !isExchange) remove(to, std::move(replaced));
  if (node != nullptr) place(*node, to.folder, to.name);
  if (other != nullptr && isExchange) place(*other, from.folder, from.name);
  if (node != nullptr) endUse(*node);
  if (other != nullptr) endUse(*other);
}

void NodeTable::removed(const Entry& entry, Remains remains) {
  LockGuard guard(mutex_);
  if (entry.node == nullptr) return;
  ++entry.node->uses_;
  remove(entry, std::move(remains));
  endUse(*entry.node);
}

void NodeTable::remove(const Entry& entry, Remains remains) {
  Node& node = *entry.node;
  // It was found under another name meanwhile.
  if (node.parent_ != nullptr && at(entry.folder, entry.name) != &node) return;
  unplace(node);
  if (!remains.descriptor) return;
  if (remains.hasOtherNames) named_.emplace_back(&node, remains.descriptor);
  remains_[&node] = std::move(remains.descriptor);
  if (named_.size() > kNamedKept) endOldestNamed();
}

void NodeTable::endOldestNamed() {
  const auto [node, descriptor] = std::move(named_.front());
  named_.pop_front();
  const auto found = remains_.find(node);
  // The node may be another one by now, or have other remains.
  if (found == remains_.end() || found->second != descriptor.lock()) return;
  ended_.push_back(std::move(found->second));
  remains_.erase(found);
}

SharedDescriptor NodeTable::remains(const Node& node) const {
  LockGuard guard(mutex_);
  const auto found = remains_.find(&node);
  return found == remains_.end() ? nullptr : found->second;
}

void NodeTable::endRemains(const Node& node) {
  const auto found = remains_.find(&node);
  if (found == remains_.end()) return;
  ended_.push_back(std::move(found->second));
  remains_.erase(found);
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
  Node* const known = byInode_.find(inode);
  return known == nullptr ? NodeUse() : startUse(*known);
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
  byInode_.forEach([&](Node& node) {
    ++node.uses_;
    result.push_back(NodeUse(*this, node));
  });
  return result;
}

std::optional<NodeTable::Way> NodeTable::wayTo(const Node& node) const {
  LockGuard guard(mutex_);
  Way way;
  const Node* step = &node;
  while (!step->base) {
    if (step->parent_ == nullptr) return std::nullopt;
    way.steps.push_back({step->parent_->identity.inode, step->name_.string()});
    step = step->parent_;
  }
  std::reverse(way.steps.begin(), way.steps.end());
  way.base = *step->base;
  return way;
}

std::optional<NodeTable::Place> NodeTable::placeOf(const Node& node) {
  LockGuard guard(mutex_);
  if (node.parent_ == nullptr) return std::nullopt;
  return Place{startUse(*node.parent_), node.name_.string()};
}

std::size_t NodeTable::size() const {
  LockGuard guard(mutex_);
  return byPlace_.size() + unplaced_.size();
}

Node* NodeTable::at(const Node& folder, std::string_view name) const {
  return byPlace_.find(PlaceKey{&folder, name});
}

/// A base has no place.
void NodeTable::place(Node& node, Node& folder, std::string_view name) {
  if (node.base || (node.parent_ == &folder && node.name_ == name)) return;
  if (Node* const other = at(folder, name); other != nullptr && other != &node) {
    ++other->uses_;
    unplace(*other);
    endUse(*other);
  }
  const bool mayHaveEntries = node.isFolder() && node.uses_ > 0;
  ++node.uses_;
  unplace(node);
  breakCycle(node, folder);
  const bool isUnwatched = node.isFolder() && isUnwatchedFolder(folder, name);
  const bool isOtherwise = node.isUnwatched.exchange(isUnwatched) != isUnwatched;
  ++folder.uses_;
  node.parent_ = &folder;
  node.name_ = name;
  endRemains(node);  // it has another name
  unplaced_.erase(&node);
  byPlace_.insert(node);
  if (isOtherwise && mayHaveEntries) noteWatchedBelow();
  endUse(node);
}

/// Nobody knows what is below a folder but what is there itself; such moves are rare.
void NodeTable::noteWatchedBelow() {
  std::vector<Node*> way;
  byPlace_.forEach([&way](Node& node) {
    if (!node.isFolder()) return;
    way.clear();
    for (Node* step = &node; step->parent_ != nullptr; step = step->parent_) way.push_back(step);
    for (Node* step : std::views::reverse(way))
      step->isUnwatched = isUnwatchedFolder(*step->parent_, step->name_.view());
  });
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
  byPlace_.erase(node);
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
  endRemains(node);
  byInode_.erase(node);
  delete &node;
}

void NodeTable::stopUse(Node& node) {
  std::vector<SharedDescriptor> ended;
  LockGuard guard(mutex_);
  endUse(node);
  ended.swap(ended_);
}

}  // namespace yomber
