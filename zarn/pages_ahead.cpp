#include "zarn/pages_ahead.h"

#include <algorithm>
#include <utility>

namespace yomber {

std::shared_ptr<PagesAhead::Entry> PagesAhead::State::remove(const Key& key,
                                                             const ListingPoint& after) {
  const auto place = std::ranges::find_if(
      entries, [&](const auto& e) { return e->key == key && e->after == after; });
  if (place == entries.end()) return nullptr;
  auto entry = std::move(*place);
  entries.erase(place);
  return entry;
}

void PagesAhead::State::run(const std::shared_ptr<Entry>& entry, const Read& read) {
  {
    LockGuard guard(mutex);
    if (entry->stage != Entry::Stage::Planned) return;
    entry->stage = Entry::Stage::Reading;
  }
  std::optional<Page> page = read();
  LockGuard guard(mutex);
  entry->page = std::move(page);
  entry->stage = Entry::Stage::Done;
  done.notifyAll();
}

std::function<void()> PagesAhead::plan(const Key& key, const ListingPoint& after,
                                       std::uint32_t limit, std::uint64_t rank, Read read) {
  auto entry = std::make_shared<Entry>();
  entry->key = key;
  entry->after = after;
  entry->limit = limit;
  entry->rank = rank;
  {
    LockGuard guard(state_->mutex);
    if (const auto older = state_->remove(key, after)) older->stage = Entry::Stage::Abandoned;
    if (state_->entries.size() >= state_->capacity) {
      state_->entries.front()->stage = Entry::Stage::Abandoned;
      state_->entries.pop_front();
    }
    state_->entries.push_back(entry);
  }
  return [state = state_, entry, read = std::move(read)] { state->run(entry, read); };
}

std::optional<PagesAhead::Page> PagesAhead::take(const Key& key, const ListingPoint& after,
                                                 std::uint32_t limit, std::uint64_t rank) {
  LockGuard guard(state_->mutex);
  const auto entry = state_->remove(key, after);
  if (entry == nullptr) return std::nullopt;
  // One that has not begun is read as quickly by whoever asks.
  if (entry->stage == Entry::Stage::Planned || entry->limit != limit || entry->rank != rank) {
    entry->stage = Entry::Stage::Abandoned;
    return std::nullopt;
  }
  while (entry->stage == Entry::Stage::Reading) state_->done.wait(state_->mutex);
  return std::move(entry->page);
}

void PagesAhead::removeConnection(std::uint64_t connection) {
  LockGuard guard(state_->mutex);
  for (const auto& entry : state_->entries) {
    if (entry->key.connection == connection) entry->stage = Entry::Stage::Abandoned;
  }
  std::erase_if(state_->entries, [&](const auto& e) { return e->key.connection == connection; });
}

}  // namespace yomber
