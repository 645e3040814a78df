#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string_view>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/database.h"
#include "zarn/item_row.h"

namespace yomber {

/// What a watch is told; bits, as on the wire.
enum WatchOptions : std::uint32_t {
  WatchUpdates = 1,
  WatchDeletions = 2,
  WatchSubtree = 4,    ///< everything below the folder
  WatchChildren = 16,  ///< its direct children
};

/// The latest that is known of one item.
struct WatchedChange {
  std::shared_ptr<const ItemRow> row;
  bool isDeletion = false;  ///< gone, or no longer inside what is watched
};

/// Who is told. Implementations hand over to where their peer lives; none of them may block.
class WatchReceiver {
 public:
  virtual ~WatchReceiver() = default;
  /// The next batch, each item in it once. Called again only after `answered` was, once, with
  /// whether the receiver took it; that may happen inside the call. Not answering is allowed: what
  /// comes meanwhile is kept, up to a bound.
  virtual void receive(std::vector<WatchedChange> changes, std::function<void(bool)> answered) = 0;
  /// The watch has ended; nothing comes after it.
  virtual void fail(NSErrorRef error) = 0;
};

class Watchers;

/// One receiver's watches. Dropping it ends them.
///
/// Thread-safety: every operation may be called on any thread.
class Subscription : public std::enable_shared_from_this<Subscription> {
 public:
  virtual ~Subscription() = default;
  /// Adds a watch on a folder; active when the call returns. An error when the subscription has
  /// failed: that one.
  [[nodiscard]] virtual NSErrorRef watch(std::uint64_t folder, std::uint32_t options) = 0;
  /// Ends the watches; the receiver is not called any more. Idempotent.
  virtual void close() = 0;
};

/// Tells watchers what was committed.
///
/// Each subscription keeps the latest state of every item that waits to be told, has one batch on
/// its way at a time, and is cut off (QSOstrellErrorDomain 5) when too much waits.
///
/// Thread-safety: every operation may be called on any thread. Ownership: shared; given to the
/// database as a sink, which holds it weakly.
class Watchers final : public ChangeSink, public std::enable_shared_from_this<Watchers> {
 public:
  struct Options {
    std::size_t maximumWaiting = 100'000;  ///< changes of one subscription
    std::size_t maximumBatch = 500;
  };
  /// The folders above an item, nearest first; asked on the writer thread for subtree watches that
  /// are not on the root.
  using Ancestors = std::function<std::vector<std::uint64_t>(std::uint64_t id)>;

  static std::shared_ptr<Watchers> create(Ancestors ancestors, Options options);
  static std::shared_ptr<Watchers> create(Ancestors ancestors) {
    return create(std::move(ancestors), Options{});
  }
  ~Watchers() override;

  [[nodiscard]] std::shared_ptr<Subscription> subscribe(std::shared_ptr<WatchReceiver> receiver);
  /// Ends every subscription with `error`.
  void failAll(const NSErrorRef& error);
  /// How many subscriptions have a watch.
  [[nodiscard]] std::size_t count() const;

  void committed(const std::vector<ItemChange>& changes) override;

 private:
  class Member;
  class State;
  Watchers(std::shared_ptr<State> state, Options options);
  const Options options_;
  const std::shared_ptr<State> state_;
};

/// Whether the bits make sense: something to tell, about something.
[[nodiscard]] bool areValidWatchOptions(std::uint32_t options);

}  // namespace yomber
