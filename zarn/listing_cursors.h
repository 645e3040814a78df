#pragma once

#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "zarn/listing.h"

namespace yomber {

/// What is listed: a folder's items, or all folders.
struct ListingScope {
  static constexpr std::uint64_t kAllFolders = ~std::uint64_t{0};
  std::uint64_t folder = kAllFolders;
  ListingOrder order = ListingOrder::Name;

  [[nodiscard]] bool isAllFolders() const { return folder == kAllFolders; }
  friend bool operator==(const ListingScope&, const ListingScope&) = default;
};

/// A position in a listing: the keys of the entry that it is right after. The default is the
/// beginning.
struct ListingPoint {
  std::int64_t age = INT64_MIN;
  std::string nameKey;
  std::uint64_t id = 0;
};

/// Where pages ended, the most recently used ones. Not thread-safe.
class ListingCursors {
 public:
  explicit ListingCursors(std::size_t capacity) : capacity_(capacity) {}

  struct Key {
    std::uint64_t connection = 0;
    ListingScope scope;
    std::uint64_t offset = 0;
    friend bool operator==(const Key&, const Key&) = default;
  };

  [[nodiscard]] std::optional<ListingPoint> find(const Key& key);
  void store(const Key& key, ListingPoint point);
  void removeConnection(std::uint64_t connection);
  void clear();
  [[nodiscard]] std::size_t size() const { return entries_.size(); }

 private:
  struct Hash {
    std::size_t operator()(const Key& key) const;
  };
  using Entries = std::list<std::pair<Key, ListingPoint>>;
  const std::size_t capacity_;
  Entries entries_;  // the most recently used first
  std::unordered_map<Key, Entries::iterator, Hash> places_;
};

/// Every 200th position of a listing, for those who come without a cursor. Built once, immutable.
struct ListingFences {
  static constexpr std::uint64_t kDistance = 200;
  std::vector<ListingPoint> points;  ///< points[i] is right before offset (i + 1) * kDistance
};

/// The fences of a few listings, each until its listing changes. Not thread-safe.
class ListingFenceCache {
 public:
  ListingFenceCache(std::size_t listings, std::size_t points)
      : maximumListings_(listings), maximumPoints_(points) {}

  [[nodiscard]] std::shared_ptr<const ListingFences> find(const ListingScope& scope);
  /// Announces that fences are being built: `store` keeps them only when nothing was invalidated
  /// meanwhile.
  void beginBuilding(const ListingScope& scope);
  void store(const ListingScope& scope, std::shared_ptr<const ListingFences> fences);
  void invalidateFolder(std::uint64_t folder);
  void clear();

 private:
  struct Entry {
    ListingScope scope;
    std::shared_ptr<const ListingFences> fences;
  };
  struct Building {
    ListingScope scope;
    bool isStale = false;
  };
  const std::size_t maximumListings_;
  const std::size_t maximumPoints_;
  std::list<Entry> entries_;  // the most recently used first
  std::list<Building> building_;
};

}  // namespace yomber
