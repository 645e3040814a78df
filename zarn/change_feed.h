#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/error.h"
#include "zarn/database.h"
#include "zarn/item_row.h"

namespace yomber {

/// An item that is no longer there, or no longer in a set.
struct DepartedItem {
  std::uint64_t id = 0;
  ItemKind kind = ItemKind::Document;
};

struct WorkingSetChanges {
  std::vector<ItemRow> updated;
  std::vector<DepartedItem> departed;
  std::string token;  ///< equals the token given when nothing was left
};

/// The working set: favourite, tagged, shared and recently used items (the last 30 days), and what
/// changed in it since a token.
///
/// Thread-safety: every operation may be called on any thread.
class ChangeFeed {
 public:
  static constexpr std::uint32_t kMaximumLimit = 1000;
  /// How long a use keeps an item in the set, in nanoseconds.
  static constexpr std::int64_t kRecentlyUsed = std::int64_t{30} * 24 * 3600 * 1'000'000'000;

  explicit ChangeFeed(std::shared_ptr<Database> database);

  /// The next changes, at most `limit` of them. Without a token: the members, from the beginning. A
  /// token that is malformed, of another database, or too old is answered with
  /// NSFileProviderErrorSyncAnchorExpired.
  [[nodiscard]] NSErrorRef workingSetChanges(std::optional<std::string_view> token,
                                             std::uint32_t limit, WorkingSetChanges& out);

  /// Takes out the items whose last use is too long ago, as of `now` (ns). To be called now and
  /// then; answers whether any left.
  bool expireRecentlyUsed(std::int64_t now);

  [[nodiscard]] std::uint64_t currentNotifRank() const;

 private:
  std::shared_ptr<Database> database_;
};

/// Whether a row belongs to the working set at the time `now` (ns). A change whose row is a member,
/// or was one before, is worth a signal.
[[nodiscard]] bool isWorkingSetMember(const ItemRow& row, std::int64_t now);

}  // namespace yomber
