#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/foundation/data.h"
#include "platform/foundation/object.h"

namespace yomber {

/// A tag of an item.
///
/// Ownership: shared, immutable. Thread-safety: immutable.
class FPTag final : public NSObject {
 public:
  explicit FPTag(std::string label) : label_(std::move(label)) {}

  [[nodiscard]] const std::string& label() const { return label_; }
  /// Its name for the key "label"; nothing for any other key.
  [[nodiscard]] std::optional<std::string> valueForKey(std::string_view key) const;
  [[nodiscard]] std::string description() const override { return label_; }

 private:
  const std::string label_;
};

using FPTagRef = std::shared_ptr<const FPTag>;

/// The tags in the framework's tag data, in order: each label's bytes, ended by a NUL. Data that is
/// not of this form, and nil, hold no tags.
[[nodiscard]] std::vector<FPTagRef> FPGetTagsFromTagsData(const NSDataRef& data);

/// The tag data of these labels. REQUIRES: none is empty or holds a NUL.
[[nodiscard]] NSDataRef FPTagsDataFromLabels(const std::vector<std::string>& labels);

}  // namespace yomber
