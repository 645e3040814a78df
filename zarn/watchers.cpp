#include "zarn/watchers.h"

#include <algorithm>
#include <map>
#include <optional>
#include <unordered_map>
#include <utility>

#include "platform/foundation/lock.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"

namespace yomber {

namespace {

/// The folders above those that changes happened in, while one commit is told.
class AncestorCache {
 public:
  AncestorCache(const std::vector<ItemChange>& changes, const Watchers::Ancestors& ancestors)
      : ancestors_(ancestors) {
    for (const auto& change : changes) {
      if (change.isDead() && change.row.isFolder()) deadParents_[change.row.id] = change.row.parent;
    }
  }

  bool isBelow(std::uint64_t folder, std::uint64_t ancestor) {
    if (folder == ancestor) return true;
    const auto& above = chain(folder);
    return std::ranges::find(above, ancestor) != above.end();
  }

 private:
  /// A folder that went in this very commit is no longer in the database: its row tells.
  const std::vector<std::uint64_t>& chain(std::uint64_t folder) {
    const auto [at, isNew] = chains_.try_emplace(folder);
    if (!isNew) return at->second;
    std::vector<std::uint64_t> result;
    std::uint64_t current = folder;
    for (auto dead = deadParents_.find(current); dead != deadParents_.end();
         dead = deadParents_.find(current)) {
      current = dead->second;
      result.push_back(current);
      if (result.size() > deadParents_.size()) break;
    }
    if (current != kNoParent && current != kRootID && current != kTrashID) {
      const auto rest = ancestors_(current);
      result.insert(result.end(), rest.begin(), rest.end());
    }
    return chains_[folder] = std::move(result);
  }

  const Watchers::Ancestors& ancestors_;
  std::unordered_map<std::uint64_t, std::uint64_t> deadParents_;
  std::unordered_map<std::uint64_t, std::vector<std::uint64_t>> chains_;
};

struct Watch {
  std::uint64_t folder = kRootID;
  std::uint32_t options = 0;
};

/// What a change is for one watch.
enum class Effect { None, Update, Deletion, TooMuch };

bool wasSubtreeMember(const ItemChange& change, std::uint64_t folder, AncestorCache& ancestors) {
  if (change.isNew) return false;
  const std::uint64_t before = change.isDead() ? change.row.parent : change.parentBefore;
  if (folder == kRootID) return true;  // or in the trash: then the deletion is told once more
  return ancestors.isBelow(before, folder);
}

Effect subtreeEffect(const ItemChange& change, std::uint64_t folder, AncestorCache& ancestors) {
  bool isInside = false;
  if (!change.isDead()) {
    isInside = folder == kRootID ? !change.row.isTrashed() && change.row.parent != kNoParent
                                 : ancestors.isBelow(change.row.parent, folder);
  }
  if (!isInside) {
    return wasSubtreeMember(change, folder, ancestors) ? Effect::Deletion : Effect::None;
  }
  // A whole folder came in from outside: what it holds has not changed and is not told.
  const bool cameWithContent = change.hasMoved() && change.row.isFolder() && folder != kRootID &&
                               !ancestors.isBelow(change.parentBefore, folder);
  return cameWithContent ? Effect::TooMuch : Effect::Update;
}

Effect childrenEffect(const ItemChange& change, std::uint64_t folder) {
  if (!change.isDead() && change.row.parent == folder) return Effect::Update;
  const std::uint64_t before =
      change.isDead() || change.isNew ? change.row.parent : change.parentBefore;
  return before == folder ? Effect::Deletion : Effect::None;
}

Effect effect(const ItemChange& change, const Watch& watch, AncestorCache& ancestors) {
  // The end of the watched folder itself is told to its watchers.
  if (change.isDead() && change.row.id == watch.folder) return Effect::Deletion;
  if ((watch.options & WatchSubtree) != 0) return subtreeEffect(change, watch.folder, ancestors);
  return childrenEffect(change, watch.folder);
}

NSErrorRef tooSlowError() {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorWatcherTooSlow,
      {{NSLocalizedDescriptionKey,
        std::string("too many changes were waiting for this watcher: list again")}});
}

}  // namespace

bool areValidWatchOptions(std::uint32_t options) {
  constexpr std::uint32_t kKnown = WatchUpdates | WatchDeletions | WatchSubtree | WatchChildren;
  return (options & ~kKnown) == 0 && (options & (WatchUpdates | WatchDeletions)) != 0 &&
         (options & (WatchSubtree | WatchChildren)) != 0;
}

/// Who watches what.
class Watchers::State {
 public:
  explicit State(Ancestors ancestors) : ancestors_(std::move(ancestors)) {}

  void add(const std::shared_ptr<Member>& member, const Watch& watch) {
    LockGuard guard(mutex_);
    if ((watch.options & WatchSubtree) != 0) {
      subtree_.push_back({watch, member});
    } else {
      children_[watch.folder].push_back({watch, member});
    }
  }
  void remove(const Member* member);
  std::vector<std::shared_ptr<Member>> members() const;
  void tell(const std::vector<ItemChange>& changes);

 private:
  struct Entry {
    Watch watch;
    std::weak_ptr<Member> member;
  };
  using Told = std::map<std::shared_ptr<Member>, std::vector<WatchedChange>>;

  void tellEntries(const std::vector<Entry>& entries, const ItemChange& change,
                   AncestorCache& ancestors, Told& told, std::shared_ptr<const ItemRow>& row)
      REQUIRES(mutex_);
  void tellChildren(std::uint64_t folder, const ItemChange& change, AncestorCache& ancestors,
                    Told& told, std::shared_ptr<const ItemRow>& row) REQUIRES(mutex_);

  const Ancestors ancestors_;
  mutable Mutex mutex_;  // taken before a member's
  std::unordered_map<std::uint64_t, std::vector<Entry>> children_ GUARDED_BY(mutex_);
  std::vector<Entry> subtree_ GUARDED_BY(mutex_);
};

/// One subscription: what waits for its receiver.
class Watchers::Member final : public Subscription {
 public:
  Member(std::shared_ptr<State> state, std::shared_ptr<WatchReceiver> receiver, Options options)
      : options_(options), state_(std::move(state)), receiver_(std::move(receiver)) {}
  ~Member() override { state_->remove(this); }

  NSErrorRef watch(std::uint64_t folder, std::uint32_t options) override {
    {
      LockGuard guard(mutex_);
      if (failure_) return failure_;
    }
    state_->add(self(), {.folder = folder, .options = options});
    return nullptr;
  }

  void close() override {
    state_->remove(this);
    LockGuard guard(mutex_);
    isClosed_ = true;
    waiting_.clear();
    order_.clear();
  }

  void fail(const NSErrorRef& error) {
    state_->remove(this);
    {
      LockGuard guard(mutex_);
      if (isClosed_) return;
      isClosed_ = true;
      failure_ = error;
      waiting_.clear();
      order_.clear();
    }
    receiver_->fail(error);
  }

  void offer(std::vector<WatchedChange> changes) {
    bool isTooSlow = false;
    {
      LockGuard guard(mutex_);
      if (isClosed_) return;
      for (auto& change : changes) keep(std::move(change));
      isTooSlow = waiting_.size() > options_.maximumWaiting;
    }
    if (isTooSlow) {
      log_default(defaultLog(), "[NOTICE] a watcher is cut off: it does not take its changes");
      fail(tooSlowError());
    } else {
      sendNext();
    }
  }

 private:
  struct Waiting {
    WatchedChange change;
    std::uint64_t order = 0;
  };

  std::shared_ptr<Member> self() { return std::static_pointer_cast<Member>(shared_from_this()); }

  void keep(WatchedChange change) REQUIRES(mutex_) {
    const std::uint64_t id = change.row->id;
    Waiting& waiting = waiting_[id];
    if (waiting.change.row) order_.erase(waiting.order);
    waiting = {.change = std::move(change), .order = ++lastOrder_};
    order_[waiting.order] = id;
  }

  std::vector<WatchedChange> nextBatch() {
    std::vector<WatchedChange> batch;
    LockGuard guard(mutex_);
    if (isSending_ || isClosed_) return batch;
    while (!order_.empty() && batch.size() < options_.maximumBatch) {
      const auto waiting = waiting_.find(order_.begin()->second);
      batch.push_back(std::move(waiting->second.change));
      waiting_.erase(waiting);
      order_.erase(order_.begin());
    }
    isSending_ = !batch.empty();
    return batch;
  }

  void sendNext() {
    auto batch = nextBatch();
    if (batch.empty()) return;
    receiver_->receive(std::move(batch), [weak = std::weak_ptr(self())](bool taken) {
      if (const auto member = weak.lock()) member->answered(taken);
    });
  }

  void answered(bool taken) {
    {
      LockGuard guard(mutex_);
      isSending_ = false;
    }
    if (taken) return sendNext();
    // The receiver has lost changes: only a fresh listing helps.
    fail(NSError::errorWithDomain(
        QSOstrellErrorDomain, QSOstrellErrorConnectionLost,
        {{NSLocalizedDescriptionKey, std::string("the receiver did not take its changes")}}));
  }

  const Options options_;
  const std::shared_ptr<State> state_;
  const std::shared_ptr<WatchReceiver> receiver_;

  Mutex mutex_;
  NSErrorRef failure_ GUARDED_BY(mutex_);
  bool isClosed_ GUARDED_BY(mutex_) = false;
  bool isSending_ GUARDED_BY(mutex_) = false;
  std::uint64_t lastOrder_ GUARDED_BY(mutex_) = 0;
  std::unordered_map<std::uint64_t, Waiting> waiting_ GUARDED_BY(mutex_);  // by item
  std::map<std::uint64_t, std::uint64_t> order_ GUARDED_BY(mutex_);        // items, oldest first
};

void Watchers::State::remove(const Member* member) {
  // Compared by owner, so that a member in its destructor is found too.
  const auto isTheirs = [member](const Entry& entry) {
    const auto locked = entry.member.lock();
    return !locked || locked.get() == member;
  };
  std::vector<std::shared_ptr<Member>> keptAlive;  // their destructors would come back here
  LockGuard guard(mutex_);
  const auto drop = [&](std::vector<Entry>& entries) {
    for (const auto& entry : entries) keptAlive.push_back(entry.member.lock());
    std::erase_if(entries, isTheirs);
  };
  drop(subtree_);
  for (auto& [folder, entries] : children_) drop(entries);
  std::erase_if(children_, [](const auto& each) { return each.second.empty(); });
}

std::vector<std::shared_ptr<Watchers::Member>> Watchers::State::members() const {
  std::vector<std::shared_ptr<Member>> result;
  {
    LockGuard guard(mutex_);
    for (const auto& entry : subtree_) result.push_back(entry.member.lock());
    for (const auto& [folder, entries] : children_) {
      for (const auto& entry : entries) result.push_back(entry.member.lock());
    }
  }
  std::ranges::sort(result);
  const auto repeated = std::ranges::unique(result);
  result.erase(repeated.begin(), repeated.end());
  std::erase(result, nullptr);
  return result;
}

void Watchers::State::tellEntries(const std::vector<Entry>& entries, const ItemChange& change,
                                  AncestorCache& ancestors, Told& told,
                                  std::shared_ptr<const ItemRow>& row) {
  for (const auto& entry : entries) {
    const Effect what = effect(change, entry.watch, ancestors);
    if (what == Effect::None) continue;
    const auto member = entry.member.lock();
    if (!member) continue;
    auto& changes = told[member];
    if (what == Effect::TooMuch) {
      changes.push_back({});
      continue;
    }
    const bool isDeletion = what == Effect::Deletion;
    if ((entry.watch.options & (isDeletion ? WatchDeletions : WatchUpdates)) == 0) continue;
    if (!row) row = std::make_shared<const ItemRow>(change.row);
    // Who watches both folders of a move is told of where the item is now.
    const bool isMoveWithin =
        isDeletion && !changes.empty() && changes.back().row == row && !changes.back().isDeletion;
    if (isMoveWithin) continue;
    changes.push_back({.row = row, .isDeletion = isDeletion});
  }
}

void Watchers::State::tellChildren(std::uint64_t folder, const ItemChange& change,
                                   AncestorCache& ancestors, Told& told,
                                   std::shared_ptr<const ItemRow>& row) {
  const auto found = children_.find(folder);
  if (found != children_.end()) tellEntries(found->second, change, ancestors, told, row);
}

void Watchers::State::tell(const std::vector<ItemChange>& changes) {
  Told told;
  {
    LockGuard guard(mutex_);
    if (children_.empty() && subtree_.empty()) return;
    AncestorCache ancestors(changes, ancestors_);
    for (const auto& change : changes) {
      std::shared_ptr<const ItemRow> row;
      tellChildren(change.row.parent, change, ancestors, told, row);
      if (change.hasMoved()) tellChildren(change.parentBefore, change, ancestors, told, row);
      if (change.isDead()) tellChildren(change.row.id, change, ancestors, told, row);
      tellEntries(subtree_, change, ancestors, told, row);
    }
  }
  for (auto& [member, offered] : told) {
    const bool isTooMuch =
        std::ranges::any_of(offered, [](const auto& change) { return change.row == nullptr; });
    if (isTooMuch) {
      member->fail(tooSlowError());
    } else {
      member->offer(std::move(offered));
    }
  }
}

std::shared_ptr<Watchers> Watchers::create(Ancestors ancestors, Options options) {
  return std::shared_ptr<Watchers>(
      new Watchers(std::make_shared<State>(std::move(ancestors)), options));
}

Watchers::Watchers(std::shared_ptr<State> state, Options options)
    : options_(options), state_(std::move(state)) {}
Watchers::~Watchers() = default;

std::shared_ptr<Subscription> Watchers::subscribe(std::shared_ptr<WatchReceiver> receiver) {
  return std::make_shared<Member>(state_, std::move(receiver), options_);
}

void Watchers::failAll(const NSErrorRef& error) {
  for (const auto& member : state_->members()) member->fail(error);
}

std::size_t Watchers::count() const { return state_->members().size(); }

void Watchers::committed(const std::vector<ItemChange>& changes) { state_->tell(changes); }

}  // namespace yomber
