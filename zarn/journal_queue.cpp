#include "zarn/journal_queue.h"

namespace yomber {

void JournalQueue::add(const DiskEntry& entry) {
  const auto [at, isNew] = folders_.try_emplace(entry.folder);
  if (isNew) order_.push_back(entry.folder);
  Folder& folder = at->second;
  if (folder.isWhole) return;
  if (entry.name.empty()) {
    size_ -= folder.names.size();
    folder.names.clear();
    folder.isWhole = true;
    ++size_;
  } else if (folder.names.insert(entry.name).second) {
    ++size_;
  }
}

void JournalQueue::add(const ShownName& name) {
  // A container is known by its location, whatever folder is there.
  Key key = name.location.empty() ? Key(name.folder, name.name) : Key(0, name.location);
  const bool isNew = shownNames_.insert_or_assign(std::move(key), name).second;
  size_ += isNew ? 1 : 0;
}

void JournalQueue::clear() {
  folders_.clear();
  order_.clear();
  shownNames_.clear();
  size_ = 0;
}

JournalBatch JournalQueue::take(std::size_t limit) {
  JournalBatch batch;
  while (!shownNames_.empty() && batch.shownNames.size() < limit) {
    batch.shownNames.push_back(std::move(shownNames_.extract(shownNames_.begin()).mapped()));
  }
  takeEntries(limit - batch.shownNames.size(), batch.entries);
  size_ -= batch.shownNames.size() + batch.entries.size();
  return batch;
}

void JournalQueue::takeEntries(std::size_t limit, std::vector<DiskEntry>& out) {
  while (!order_.empty() && out.size() < limit) {
    const std::uint64_t id = order_.front();
    Folder& folder = folders_.at(id);
    if (folder.isWhole) out.push_back({.folder = id, .name = {}});
    while (!folder.names.empty() && out.size() < limit) {
      out.push_back(
          {.folder = id, .name = std::move(folder.names.extract(folder.names.begin()).value())});
    }
    if (!folder.names.empty()) return;
    folders_.erase(id);
    order_.pop_front();
  }
}

}  // namespace yomber
