#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace yomber {

/// The SHA-256 of some content, raw.
using RZAssetHash = std::array<std::uint8_t, 32>;

/// Content in the store, named by what it is. Two assets with equal hashes are the same bytes.
///
/// Value type. Holding one keeps nothing in the store: a committed record that refers to it does.
struct RZAsset {
  RZAssetHash hash{};
  /// Bytes.
  std::uint64_t size = 0;

  /// The hash as 64 lower-case hexadecimal digits.
  [[nodiscard]] std::string hexHash() const;
  /// The asset that `hexHash` printed; none when the text is no hash.
  static std::optional<RZAsset> fromHexHash(std::string_view hexHash, std::uint64_t size);
  [[nodiscard]] std::string description() const;

  friend auto operator<=>(const RZAsset&, const RZAsset&) = default;
};

/// How a transfer of content is followed.
struct RZTransfer {
  /// Called on the thread that asked, about once a MiB, with the bytes done so far (holes
  /// included). Answering false ends the transfer with Cocoa error 3072 (cancelled by the user).
  /// May be empty.
  std::function<bool(std::uint64_t bytesDone)> progress;
};

}  // namespace yomber
