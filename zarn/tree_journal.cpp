#include "zarn/tree_journal.h"

#include <algorithm>
#include <optional>
#include <unordered_map>
#include <utility>

#include "platform/foundation/lock.h"
#include "platform/foundation/log.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {

/// Who is told.
class TreeJournal::State {
 public:
  void add(const std::shared_ptr<Member>& member);
  void remove(const Member* member);
  std::vector<std::shared_ptr<Member>> members() const;
  std::size_t count() const { return count_.load(); }

 private:
  mutable Mutex mutex_;
  std::unordered_map<const Member*, std::weak_ptr<Member>> members_ GUARDED_BY(mutex_);
  std::atomic<std::size_t> count_{0};
};

class TreeJournal::Member final : public JournalSubscription,
                                  public std::enable_shared_from_this<Member> {
 public:
  Member(std::shared_ptr<State> state, std::shared_ptr<ItemStore> store,
         std::shared_ptr<JournalReceiver> receiver, Options options)
      : options_(options),
        state_(std::move(state)),
        store_(std::move(store)),
        receiver_(std::move(receiver)) {}
  ~Member() override { state_->remove(this); }

  void offer(const std::vector<DiskEntry>& entries, const std::vector<ShownName>& shownNames) {
    {
      LockGuard guard(mutex_);
      if (!needsLoss_) add(entries, shownNames);  // which says that and more
    }
    sendNext();
  }

  void loseTrack() {
    {
      LockGuard guard(mutex_);
      noteLoss();
    }
    sendNext();
  }

  void sendNext() {
    JournalBatch batch;
    std::shared_ptr<JournalReceiver> receiver;
    switch (nextStep(batch, receiver)) {
      case Step::None:
        return;
      case Step::ReadNames:
        return ThreadPool::shared().async([weak = weak_from_this(), receiver] {
          if (const auto self = weak.lock()) self->readNames(*receiver);
        });
      case Step::LoseTrack:
        return receiver->loseTrack(whenAnswered());
      case Step::Change:
        return receiver->change(std::move(batch), whenAnswered());
    }
  }

 private:
  enum class Step { None, ReadNames, LoseTrack, Change };
  enum class Names { Due, Reading, Read };

  void add(const std::vector<DiskEntry>& entries, const std::vector<ShownName>& shownNames)
      REQUIRES(mutex_) {
    for (const auto& name : shownNames) queue_.add(name);
    for (const auto& entry : entries) queue_.add(entry);
    if (queue_.size() > options_.maximumWaiting) noteLoss();
  }

  void noteLoss() REQUIRES(mutex_) {
    queue_.clear();
    needsLoss_ = true;
  }

  /// `receiver` is who is told; he may be let go of before a call to him has returned.
  Step nextStep(JournalBatch& batch, std::shared_ptr<JournalReceiver>& receiver) {
    LockGuard guard(mutex_);
    if (isClosed_ || isBusy_) return Step::None;
    Step step = Step::None;
    if (needsLoss_ && hasStarted_) {
      needsLoss_ = false;
      names_ = Names::Due;
      step = Step::LoseTrack;
    } else if (names_ != Names::Read) {
      step = Step::ReadNames;
    } else if (queue_.size() != 0) {
      batch = queue_.take(options_.maximumBatch);
      step = Step::Change;
    }
    isBusy_ = step != Step::None;
    receiver = receiver_;
    return step;
  }

  JournalReceiver::Answered whenAnswered() {
    return [weak = weak_from_this()](bool taken) {
      if (const auto self = weak.lock()) self->answered(taken);
    };
  }

  /// Who did not take a call is let go of: that he is told nothing more, he learns by that.
  void answered(bool taken) {
    std::shared_ptr<JournalReceiver> ended;
    {
      LockGuard guard(mutex_);
      isBusy_ = false;
      if (!taken) {
        isClosed_ = true;
        queue_.clear();
        std::swap(ended, receiver_);
      }
    }
    if (taken) return sendNext();
    state_->remove(this);
    log_default(defaultLog(), "[NOTICE] an observer of the tree did not take what it was told");
  }

  /// The first part of the names, or the next one. On the pool.
  void readNames(JournalReceiver& receiver) {
    std::optional<ShownNamesPosition> from;
    bool isFirst = false;
    {
      LockGuard guard(mutex_);
      isFirst = names_ == Names::Due;
      if (!isFirst) from = position_;
    }
    const std::size_t limit = isFirst ? options_.namesAtStart : options_.maximumBatch;
    std::vector<ShownName> names;
    std::optional<ShownNamesPosition> next;
    const NSErrorRef error = store_->database()->read([&](Connection& connection) {
      if (isFirst) readShownContainers(connection, store_->layout(), names);
      next = readShownNames(connection, from, limit, names);
    });
    if (error) return namesFailed(error);
    {
      LockGuard guard(mutex_);
      names_ = next ? Names::Reading : Names::Read;
      position_ = next.value_or(ShownNamesPosition{});
      hasStarted_ = true;
    }
    if (isFirst) return receiver.start(std::move(names), whenAnswered());
    receiver.change({.entries = {}, .shownNames = std::move(names)}, whenAnswered());
  }

  /// Tried again when there is more to tell.
  void namesFailed(const NSErrorRef& error) {
    log_error(defaultLog(), "[ERROR] a mount cannot be told which names to show: %@", error);
    LockGuard guard(mutex_);
    isBusy_ = false;
  }

  const Options options_;
  const std::shared_ptr<State> state_;
  const std::shared_ptr<ItemStore> store_;

  Mutex mutex_;
  std::shared_ptr<JournalReceiver> receiver_ GUARDED_BY(mutex_);  // nil once closed
  JournalQueue queue_ GUARDED_BY(mutex_);
  bool isClosed_ GUARDED_BY(mutex_) = false;
  bool isBusy_ GUARDED_BY(mutex_) = false;      // a call is on its way, or names are being read
  bool hasStarted_ GUARDED_BY(mutex_) = false;  // the first call has been made
  bool needsLoss_ GUARDED_BY(mutex_) = false;
  Names names_ GUARDED_BY(mutex_) = Names::Due;
  ShownNamesPosition position_ GUARDED_BY(mutex_);  // while `Reading`
};

void TreeJournal::State::add(const std::shared_ptr<Member>& member) {
  LockGuard guard(mutex_);
  members_[member.get()] = member;
  count_ = members_.size();
}

void TreeJournal::State::remove(const Member* member) {
  LockGuard guard(mutex_);
  members_.erase(member);
  count_ = members_.size();
}

std::vector<std::shared_ptr<TreeJournal::Member>> TreeJournal::State::members() const {
  std::vector<std::shared_ptr<Member>> result;
  LockGuard guard(mutex_);
  for (const auto& [address, weak] : members_) {
    if (auto member = weak.lock()) result.push_back(std::move(member));
  }
  return result;
}

TreeJournal::TreeJournal(std::shared_ptr<ItemStore> store, JournalCommit::IsWatched isWatched,
                         Options options)
    : options_(options),
      store_(std::move(store)),
      isWatched_(std::move(isWatched)),
      state_(std::make_shared<State>()) {}

TreeJournal::~TreeJournal() = default;

std::shared_ptr<JournalSubscription> TreeJournal::subscribe(
    std::shared_ptr<JournalReceiver> receiver) {
  auto member = std::make_shared<Member>(state_, store_, std::move(receiver), options_);
  state_->add(member);
  member->sendNext();
  return member;
}

std::size_t TreeJournal::count() const { return state_->count(); }

bool TreeJournal::wantsEvents() const { return state_->count() != 0; }

void TreeJournal::entriesDidChange(const std::vector<DiskEntry>& entries) {
  for (const auto& member : state_->members()) member->offer(entries, {});
}

void TreeJournal::didLoseTrack() {
  for (const auto& member : state_->members()) member->loseTrack();
}

void TreeJournal::committed(const std::vector<ItemChange>& changes) {
  if (!wantsEvents()) return;
  JournalCommit commit(*store_, isWatched_);
  commit.addChanges(changes);
  tell(commit);
}

void TreeJournal::touched(const std::vector<ItemRow>& rows) {
  if (!wantsEvents()) return;
  JournalCommit commit(*store_, isWatched_);
  commit.addTouched(rows);
  tell(commit);
}

void TreeJournal::tell(const JournalCommit& commit) {
  if (commit.hasLostTrack()) return didLoseTrack();
  if (commit.news().isEmpty()) return;
  for (const auto& member : state_->members()) {
    member->offer(commit.news().entries, commit.news().shownNames);
  }
}

}  // namespace yomber
