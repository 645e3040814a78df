#pragma once

#include <string>
#include <utility>

#include "platform/fileprovider/item.h"

namespace yomber {

/// An item that came from another process.
///
/// Ownership: shared, immutable. Thread-safety: immutable.
class WireItem final : public NSFileProviderItem {
 public:
  explicit WireItem(ItemFields fields) : fields_(std::move(fields)) {}
  [[nodiscard]] const ItemFields& fields() const override { return fields_; }
  [[nodiscard]] std::string description() const override;

 private:
  const ItemFields fields_;
};

/// From now on errors that carry an item (the one in the way of a collision) keep it on their way
/// between processes. Idempotent; any thread.
void registerItemsInErrors();

}  // namespace yomber
