#include "zarn/listing_cursors.h"

#include <algorithm>

namespace yomber {

std::size_t ListingCursors::Hash::operator()(const Key& key) const {
  std::size_t hash = key.connection;
  for (const std::uint64_t part :
       {key.scope.folder, static_cast<std::uint64_t>(key.scope.order), key.offset}) {
    hash = (hash ^ part) * 0x9e3779b97f4a7c15ULL;
    hash ^= hash >> 29U;
  }
  return hash;
}

std::optional<ListingPoint> ListingCursors::find(const Key& key) {
  const auto place = places_.find(key);
  if (place == places_.end()) return std::nullopt;
  entries_.splice(entries_.begin(), entries_, place->second);
  return place->second->second;
}

void ListingCursors::store(const Key& key, ListingPoint point) {
  if (const auto place = places_.find(key); place != places_.end()) {
    place->second->second = std::move(point);
    entries_.splice(entries_.begin(), entries_, place->second);
    return;
  }
  entries_.emplace_front(key, std::move(point));
  places_.emplace(key, entries_.begin());
  if (entries_.size() <= capacity_) return;
  places_.erase(entries_.back().first);
  entries_.pop_back();
}

void ListingCursors::removeConnection(std::uint64_t connection) {
  for (auto entry = entries_.begin(); entry != entries_.end();) {
    if (entry->first.connection == connection) {
      places_.erase(entry->first);
      entry = entries_.erase(entry);
    } else {
      ++entry;
    }
  }
}

void ListingCursors::clear() {
  places_.clear();
  entries_.clear();
}

std::shared_ptr<const ListingFences> ListingFenceCache::find(const ListingScope& scope) {
  const auto entry = std::find_if(entries_.begin(), entries_.end(),
                                  [&](const Entry& e) { return e.scope == scope; });
  if (entry == entries_.end()) return nullptr;
  entries_.splice(entries_.begin(), entries_, entry);
  return entries_.front().fences;
}

void ListingFenceCache::beginBuilding(const ListingScope& scope) {
  building_.push_back({scope, false});
}

void ListingFenceCache::store(const ListingScope& scope,
                              std::shared_ptr<const ListingFences> fences) {
  const auto building = std::find_if(building_.begin(), building_.end(),
                                     [&](const Building& b) { return b.scope == scope; });
  if (building == building_.end()) return;
  const bool isStale = building->isStale;
  building_.erase(building);
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
