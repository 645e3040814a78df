#pragma once

#include <chrono>
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
  friend bool operator==(const ListingPoint&, const ListingPoint&) = default;
};

/// Where pages ended, the most recently used ones.
///
/// Nothing tells the listings of a key apart, and where they stand may differ: their first pages
/// were read at different times. So each of a key's points stays until somebody goes on, and who
/// goes on is given the earliest of them all: what is listed twice does no harm, what is left out
/// is missed. Points of listings that nobody goes on with make way after a minute.
///
/// Not thread-safe. Constant time.
class ListingCursors {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;
  static constexpr std::chrono::minutes kPatience{1};
  static constexpr std::size_t kMaximumPerKey = 32;

  explicit ListingCursors(std::size_t capacity) : capacity_(capacity) {}

  struct Key {
    std::uint64_t connection = 0;
    ListingScope scope;
    std::uint64_t offset = 0;
    friend bool operator==(const Key&, const Key&) = default;
  };

  /// Where the listing goes on; one point fewer is kept for the others.
  [[nodiscard]] std::optional<ListingPoint> take(const Key& key);
  void store(const Key& key, ListingPoint point, TimePoint now);
  void removeConnection(std::uint64_t connection);
  void clear();
  /// How many points there are.
  [[nodiscard]] std::size_t size() const { return size_; }

 private:
  struct Hash {
    std::size_t operator()(const Key& key) const;
  };
  struct Place {
    ListingPoint point;
    TimePoint stored;
  };
  struct Entry {
    Key key;
    std::vector<Place> places;  ///< never empty
    bool isTaken = false;       ///< the one place was given out, and stays for who asks again
  };
  using Entries = std::list<Entry>;
  Entry& entryFor(const Key& key);
  void removeLatest(Entry& entry);
  Entries::iterator remove(Entries::iterator entry);

  const std::size_t capacity_;
  std::size_t size_ = 0;
  Entries entries_;  // the most recently used first
  std::unordered_map<Key, Entries::iterator, Hash> entriesByKey_;
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
  /// Announces that fences are being built, and answers the number that `store` takes: it keeps
  /// them only when nothing was invalidated meanwhile. Several may build the same ones.
  [[nodiscard]] std::uint64_t beginBuilding(const ListingScope& scope);
  void store(std::uint64_t building, std::shared_ptr<const ListingFences> fences);
  void invalidateFolder(std::uint64_t folder);
  void clear();

 private:
  struct Entry {
    ListingScope scope;
    std::shared_ptr<const ListingFences> fences;
  };
  struct Building {
    std::uint64_t number = 0;
    ListingScope scope;
    bool isStale = false;
  };
  const std::size_t maximumListings_;
  const std::size_t maximumPoints_;
  std::list<Entry> entries_;  // the most recently used first
  std::list<Building> building_;
  std::uint64_t lastNumber_ = 0;
};

}  // namespace yomber
