#include "mount/entry_notices.h"

#include <cstddef>
#include <utility>

namespace yomber {

/// Guarded by the mutex of the notices.
struct EntryNotices::Batch {
  std::vector<Notice> notices;
  std::size_t told = 0;
  const Node* folder = nullptr;  ///< of which is being told
  std::uint64_t teller = 0;      ///< the one who is at it; an earlier one has been left behind
  bool isDone = false;
};

/// Whoever tells cannot be called back once the kernel waits for the folder, which a rename may
/// have got a moment before we hear of it. So another one goes on, and that one ends with the wait.
void EntryNotices::send(std::vector<Notice> notices) {
  if (notices.empty()) return;
  const auto batch = std::make_shared<Batch>();
  LockGuard guard(mutex_);
  batch->notices = std::move(notices);
  while (!batch->isDone) {
    const std::uint64_t teller = ++batch->teller;
    batch->folder = nullptr;
    pool_.async([this, batch, teller] { tellAll(*batch, teller); });
    while (!batch->isDone && !isHeld(batch->folder)) changed_.wait(mutex_);
  }
}

void EntryNotices::tellAll(Batch& batch, std::uint64_t teller) {
  for (;;) {
    const Notice* notice = nullptr;
    {
      LockGuard guard(mutex_);
      if (batch.teller != teller) return;
      notice = next(batch);
      batch.isDone = notice == nullptr;
      if (batch.isDone) return changed_.notifyAll();
      batch.folder = notice->folder.get();
    }
    tell_(*notice);
  }
}

const EntryNotices::Notice* EntryNotices::next(Batch& batch) {
  while (batch.told < batch.notices.size()) {
    Notice& notice = batch.notices[batch.told++];
    const auto held = held_.find(notice.folder.get());
    if (held == held_.end()) return &notice;
    held->second.notices.push_back(std::move(notice));
  }
  return nullptr;
}

void EntryNotices::sendSoon(std::vector<Notice> notices) {
  if (notices.empty()) return;
  const auto all = std::make_shared<std::vector<Notice>>(std::move(notices));
  pool_.async([this, all] { send(std::move(*all)); });
}

bool EntryNotices::isHeld(const Node* folder) const { return held_.contains(folder); }

void EntryNotices::begin(const Node& folder, const Node& other) {
  LockGuard guard(mutex_);
  ++held_[&folder].count;
  ++held_[&other].count;
  changed_.notifyAll();
}

void EntryNotices::end(const Node& folder) {
  std::vector<Notice> waiting;
  {
    LockGuard guard(mutex_);
    const auto held = held_.find(&folder);
    if (--held->second.count != 0) return;
    waiting = std::move(held->second.notices);
    held_.erase(held);
  }
  sendSoon(std::move(waiting));
}

EntryNotices::Hold::Hold(EntryNotices& notices, const Node& folder, const Node& other)
    : notices_(notices), folder_(folder), other_(other) {
  notices_.begin(folder_, other_);
}

EntryNotices::Hold::~Hold() {
  notices_.end(folder_);
  notices_.end(other_);
}

}  // namespace yomber
