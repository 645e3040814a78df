#include "zarn/listing_cursors.h"

#include <algorithm>
#include <tuple>
#include <utility>

namespace yomber {
namespace {

bool isBefore(const ListingPoint& one, const ListingPoint& other, ListingOrder order) {
  if (order == ListingOrder::Date && one.age != other.age) return one.age < other.age;
  return std::tie(one.nameKey, one.id) < std::tie(other.nameKey, other.id);
}

}  // namespace

std::size_t ListingCursors::Hash::operator()(const Key& key) const {
  std::size_t hash = key.connection;
  for (const std::uint64_t part :
       {key.scope.folder, static_cast<std::uint64_t>(key.scope.order), key.offset}) {
    hash = (hash ^ part) * 0x9e3779b97f4a7c15ULL;
    hash ^= hash >> 29U;
  }
  return hash;
}

std::optional<ListingPoint> ListingCursors::take(const Key& key) {
  const auto place = entriesByKey_.find(key);
  if (place == entriesByKey_.end()) return std::nullopt;
  entries_.splice(entries_.begin(), entries_, place->second);
  Entry& entry = entries_.front();
  const auto earliest = std::ranges::min_element(
      entry.places,
      [&](const ListingPoint& one, const ListingPoint& other) {
        return isBefore(one, other, key.scope.order);
      },
      &Place::point);
  ListingPoint point = earliest->point;
  // The latest goes: the others may be in need of the earliest still.
  if (entry.places.size() > 1) {
    removeLatest(entry);
  } else {
    entry.isTaken = true;
  }
  return point;
}

void ListingCursors::store(const Key& key, ListingPoint point, TimePoint now) {
  Entry& entry = entryFor(key);
  const auto isOver = [&](const Place& place) {
    return entry.isTaken || now - place.stored > kPatience;
  };
  size_ -= std::erase_if(entry.places, isOver);
  entry.isTaken = false;
  entry.places.push_back({std::move(point), now});
  ++size_;
  if (entry.places.size() > kMaximumPerKey) removeLatest(entry);
  while (size_ > capacity_ && entries_.size() > 1) remove(std::prev(entries_.end()));
}

ListingCursors::Entry& ListingCursors::entryFor(const Key& key) {
  const auto [place, isNew] = entriesByKey_.try_emplace(key);
  if (isNew) {
    place->second = entries_.insert(entries_.begin(), {key, {}, false});
  } else {
    entries_.splice(entries_.begin(), entries_, place->second);
  }
  return entries_.front();
}

void ListingCursors::removeLatest(Entry& entry) {
  const auto latest = std::ranges::max_element(
      entry.places,
      [&](const ListingPoint& one, const ListingPoint& other) {
        return isBefore(one, other, entry.key.scope.order);
      },
      &Place::point);
  entry.places.erase(latest);
  --size_;
}

ListingCursors::Entries::iterator ListingCursors::remove(Entries::iterator entry) {
  size_ -= entry->places.size();
  entriesByKey_.erase(entry->key);
  return entries_.erase(entry);
}

void ListingCursors::removeConnection(std::uint64_t connection) {
  for (auto entry = entries_.begin(); entry != entries_.end();) {
    entry = entry->key.connection == connection ? remove(entry) : std::next(entry);
  }
}

void ListingCursors::clear() {
  entriesByKey_.clear();
  entries_.clear();
  size_ = 0;
}

std::shared_ptr<const ListingFences> ListingFenceCache::find(const ListingScope& scope) {
  const auto entry = std::find_if(entries_.begin(), entries_.end(),
                                  [&](const Entry& e) { return e.scope == scope; });
  if (entry == entries_.end()) return nullptr;
  entries_.splice(entries_.begin(), entries_, entry);
  return entries_.front().fences;
}

std::uint64_t ListingFenceCache::beginBuilding(const ListingScope& scope) {
  building_.push_back({++lastNumber_, scope, false});
  return lastNumber_;
}

void ListingFenceCache::store(std::uint64_t building, std::shared_ptr<const ListingFences> fences) {
  const auto place = std::find_if(building_.begin(), building_.end(),
                                  [&](const Building& b) { return b.number == building; });
  if (place == building_.end()) return;
  const ListingScope scope = place->scope;
  const bool isStale = place->isStale;
  building_.erase(place);
  if (isStale || !fences) return;
  std::erase_if(entries_, [&](const Entry& e) { return e.scope == scope; });
  entries_.push_front({scope, std::move(fences)});
  std::size_t points = 0;
  for (const Entry& entry : entries_) points += entry.fences->points.size();
  while (entries_.size() > 1 && (entries_.size() > maximumListings_ || points > maximumPoints_)) {
    points -= entries_.back().fences->points.size();
    entries_.pop_back();
  }
}

void ListingFenceCache::invalidateFolder(std::uint64_t folder) {
  std::erase_if(entries_, [&](const Entry& e) { return e.scope.folder == folder; });
  for (Building& building : building_) {
    if (building.scope.folder == folder) building.isStale = true;
  }
}

void ListingFenceCache::clear() {
  entries_.clear();
  for (Building& building : building_) building.isStale = true;
}

}  // namespace yomber
