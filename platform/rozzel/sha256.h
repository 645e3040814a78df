#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

#include "platform/rozzel/asset.h"

namespace yomber {

/// A running SHA-256. For one thread at a time.
class Sha256 {
 public:
  Sha256();
  ~Sha256();
  Sha256(const Sha256&) = delete;
  Sha256& operator=(const Sha256&) = delete;

  void update(std::span<const std::byte> bytes);
  void updateZeros(std::uint64_t count);
  /// The hash of all that came, and how much it was. To be called once.
  [[nodiscard]] RZAsset finish();

 private:
  struct Context;
  const std::unique_ptr<Context> context_;
  std::uint64_t size_ = 0;
};

}  // namespace yomber
