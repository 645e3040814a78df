#pragma once

#include <memory>
#include <string>
#include <utility>

#include "platform/foundation/object.h"

namespace yomber {

/// What operations belong to that serve one request of a user: a name for logs.
///
/// Ownership: shared, immutable.
class RZOperationGroup final : public NSObject {
 public:
  explicit RZOperationGroup(std::string name) : name_(std::move(name)) {}
  [[nodiscard]] const std::string& name() const { return name_; }
  [[nodiscard]] std::string description() const override { return name_; }

 private:
  const std::string name_;
};

using RZOperationGroupRef = std::shared_ptr<const RZOperationGroup>;

}  // namespace yomber
