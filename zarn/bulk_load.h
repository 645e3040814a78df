#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/foundation/error.h"
#include "zarn/connection.h"
#include "zarn/item_row.h"

namespace yomber {

/// A whole new content of the database, written to a file aside without journal or indexes, which
/// are made at the end.
///
/// Throws SQLite::Exception. For one thread at a time.
class BulkLoad {
 public:
  /// The file must not be there. Ranks go on after `rank`.
  BulkLoad(const std::string& path, std::uint64_t rank, std::int64_t now);

  /// Adds a row whose id is its own already. `nameKey` is its name's sort key.
  void add(ItemRow& row, std::string_view nameKey);
  /// Makes the indexes and stores the file durably.
  void finish();

  [[nodiscard]] std::uint64_t rank() const { return rank_; }
  [[nodiscard]] std::uint64_t count() const { return count_; }

 private:
  const std::string path_;
  Connection connection_;
  Statement* insert_ = nullptr;
  std::uint64_t rank_;
  std::uint64_t count_ = 0;
  const std::int64_t now_;
};

}  // namespace yomber
