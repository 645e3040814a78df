#pragma once

#include <cstdint>
#include <memory>

#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "zarn/item_store.h"

namespace yomber {

/// Writes the ids of a first scan's items into their files, in the order of the rows, and remembers
/// how far it came.
///
/// Thread-safety: every operation may be called on any thread.
class Stamper {
 public:
  explicit Stamper(std::shared_ptr<ItemStore> store) : store_(std::move(store)) {}

  /// Up to `limit` items. `count` is how many were looked at; 0 when all is done.
  [[nodiscard]] NSErrorRef stampSome(std::uint32_t limit, std::uint32_t& count);

 private:
  const std::shared_ptr<ItemStore> store_;
  Mutex mutex_;
};

}  // namespace yomber
