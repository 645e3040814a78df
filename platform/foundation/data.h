#pragma once

#include <cstddef>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <utility>

#include "platform/foundation/object.h"

namespace yomber {

class NSData;
using NSDataRef = std::shared_ptr<const NSData>;

/// An immutable string of bytes.
///
/// Ownership: shared. Thread-safety: immutable after construction.
class NSData final : public NSObject {
 public:
  explicit NSData(std::string bytes) : bytes_(std::move(bytes)) {}

  static NSDataRef dataWithBytes(const void* bytes, std::size_t length);
  static NSDataRef dataWithString(std::string_view bytes);
  /// The whole of a regular file; nil when it cannot be read, or is longer than `maximumLength`.
  static NSDataRef dataWithContentsOfFile(const std::string& path, std::size_t maximumLength);

  [[nodiscard]] std::size_t length() const { return bytes_.size(); }
  [[nodiscard]] std::string_view bytes() const { return bytes_; }
  /// Copies at most `length` leading bytes, and no more than there are; the rest of `buffer` is
  /// left as it is.
  void getBytes(void* buffer, std::size_t length) const;
  /// Byte-wise equality; never equal to nil.
  [[nodiscard]] bool isEqualToData(const NSDataRef& other) const;
  /// "<0a1b…>": the bytes in hexadecimal.
  [[nodiscard]] std::string description() const override;

 private:
  std::string bytes_;
};

}  // namespace yomber
