#pragma once

#include <atomic>
#include <cstddef>
#include <functional>
#include <memory>
#include <vector>

#include "zarn/database.h"
#include "zarn/disk_entry.h"
#include "zarn/item_store.h"
#include "zarn/journal_commit.h"
#include "zarn/journal_queue.h"

namespace yomber {

/// Who is told (protocols/tree.capnp). Implementations hand over to where their peer lives; none of
/// them may block.
///
/// The next call is made only after `answered` was called, once, with whether the receiver took
/// this one; that may happen inside the call. Not answering is allowed: what comes meanwhile is
/// kept, up to a bound.
class JournalReceiver {
 public:
  using Answered = std::function<void(bool)>;

  virtual ~JournalReceiver() = default;
  virtual void start(std::vector<ShownName> shownNames, Answered answered) = 0;
  virtual void change(JournalBatch batch, Answered answered) = 0;
  virtual void loseTrack(Answered answered) = 0;
};

/// One receiver's place in the journal. Dropping it ends that.
class JournalSubscription {
 public:
  virtual ~JournalSubscription() = default;
};

/// Tells whoever shows the tree on disk of all that changes there, and of names that are shown
/// otherwise.
///
/// What happens in watched folders is told as soon as the system says so, whatever it is; what
/// only a scan has found in the others, and every change of names, when it is committed. A receiver
/// for which too much waits is told that anything may have changed, and starts anew.
///
/// Thread-safety: every operation may be called on any thread. Ownership: shared; given to the
/// database and to the tree observer, which hold it weakly.
class TreeJournal final : public ChangeSink, public DiskEventSink {
 public:
  struct Options {
    std::size_t maximumWaiting = 50'000;  ///< entries and names of one receiver
    std::size_t maximumBatch = 1000;
    std::size_t namesAtStart = 10'000;  ///< the others follow in batches
  };
  /// `isWatched` answers for folders by id; it is asked on the writer thread.
  TreeJournal(std::shared_ptr<ItemStore> store, JournalCommit::IsWatched isWatched,
              Options options);
  TreeJournal(std::shared_ptr<ItemStore> store, JournalCommit::IsWatched isWatched)
      : TreeJournal(std::move(store), std::move(isWatched), Options{}) {}
  ~TreeJournal() override;

  /// Active when it returns: what is read on disk from then on is covered.
  [[nodiscard]] std::shared_ptr<JournalSubscription> subscribe(
      std::shared_ptr<JournalReceiver> receiver);
  [[nodiscard]] std::size_t count() const;

  [[nodiscard]] bool wantsEvents() const override;
  void entriesDidChange(const std::vector<DiskEntry>& entries) override;
  void didLoseTrack() override;
  void committed(const std::vector<ItemChange>& changes) override;
  void touched(const std::vector<ItemRow>& rows) override;

 private:
  class Member;
  class State;
  void tell(const JournalCommit& commit);

  const Options options_;
  const std::shared_ptr<ItemStore> store_;
  const JournalCommit::IsWatched isWatched_;
  const std::shared_ptr<State> state_;
};

}  // namespace yomber
