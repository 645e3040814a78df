#pragma once

#include <memory>
#include <string>

namespace yomber {

/// The root of shared objects that a log line can print and an error can carry.
///
/// Ownership: always held by `std::shared_ptr`; the null pointer is nil.
/// Thread-safety: `description` must be callable on any thread.
class NSObject {
 public:
  virtual ~NSObject() = default;

  /// A one-line rendering for logs; never parsed.
  [[nodiscard]] virtual std::string description() const = 0;

 protected:
  NSObject() = default;
  NSObject(const NSObject&) = default;
  NSObject& operator=(const NSObject&) = default;
};

using NSObjectRef = std::shared_ptr<const NSObject>;

}  // namespace yomber
