#pragma once

#include <cstdint>
#include <memory>

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

  /// Up to `limit` items; answers how many were looked at.
  std::uint32_t stampSome(std::uint32_t limit);

 private:
  const std::shared_ptr<ItemStore> store_;
  Mutex mutex_;
};

}  // namespace yomber
