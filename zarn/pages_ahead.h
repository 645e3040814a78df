#pragma once

#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <optional>

#include "platform/foundation/lock.h"
#include "zarn/listing.h"
#include "zarn/listing_cursors.h"

namespace yomber {

/// Pages of listings that are under way, read before they are asked for: while a client takes one
/// page in, the database reads its next.
///
/// A page counts only while nothing has been committed since before it was read, so that nobody can
/// tell it from one that is read when it is asked for.
///
/// Thread-safety: every operation may be called on any thread. Memory: bounded by the capacity; the
/// oldest pages give way.
class PagesAhead {
 public:
  struct Page {
    ListingPage page;
    ListingPoint end;  ///< of the last row, when there are more
  };
  using Key = ListingCursors::Key;
  /// Nothing when the page could not be read. Must not throw.
  using Read = std::function<std::optional<Page>()>;

  explicit PagesAhead(std::size_t capacity) : state_(std::make_shared<State>(capacity)) {}

  /// Answers what reads the page of `limit` rows right after a point, once, on whatever thread
  /// calls it. `rank` is the database's last rank.
  [[nodiscard]] std::function<void()> plan(const Key& key, const ListingPoint& after,
                                           std::uint32_t limit, std::uint64_t rank, Read read);
  /// The page, when it was read and `rank` is still the last; waits for one that is just being
  /// read. Nothing otherwise. A page is taken once.
  [[nodiscard]] std::optional<Page> take(const Key& key, const ListingPoint& after,
                                         std::uint32_t limit, std::uint64_t rank);
  void removeConnection(std::uint64_t connection);

 private:
  struct Entry {
    enum class Stage : std::uint8_t { Planned, Reading, Done, Abandoned };
    Key key;
    ListingPoint after;  ///< listings of one key may stand at different points
    std::uint32_t limit = 0;
    std::uint64_t rank = 0;
    Stage stage = Stage::Planned;
    std::optional<Page> page;
  };
  struct State {
    explicit State(std::size_t maximum) : capacity(maximum) {}
    void run(const std::shared_ptr<Entry>& entry, const Read& read);
    std::shared_ptr<Entry> remove(const Key& key, const ListingPoint& after) REQUIRES(mutex);

    const std::size_t capacity;
    Mutex mutex;
    Condition done;
    std::list<std::shared_ptr<Entry>> entries GUARDED_BY(mutex);  // the oldest first
  };
  const std::shared_ptr<State> state_;
};

}  // namespace yomber
