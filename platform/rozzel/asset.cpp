#include "platform/rozzel/asset.h"

#include <span>

#include "platform/foundation/hexadecimal.h"

namespace yomber {

std::string RZAsset::hexHash() const { return hexadecimal(std::as_bytes(std::span(hash))); }

std::optional<RZAsset> RZAsset::fromHexHash(std::string_view hexHash, std::uint64_t size) {
  constexpr std::string_view kDigits = "0123456789abcdef";
  RZAsset asset;
  asset.size = size;
  if (hexHash.size() != asset.hash.size() * 2) return std::nullopt;
  for (std::size_t index = 0; index < hexHash.size(); ++index) {
    const auto digit = kDigits.find(hexHash[index]);
    if (digit == std::string_view::npos) return std::nullopt;
    auto& byte = asset.hash[index / 2];
    byte = static_cast<std::uint8_t>((byte << 4U) | digit);
  }
  return asset;
}

std::string RZAsset::description() const {
  return "asset " + hexHash() + " of " + std::to_string(size) + " bytes";
}

}  // namespace yomber
