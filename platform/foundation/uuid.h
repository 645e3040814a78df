#pragma once

#include <array>
#include <cstdint>
#include <string>

namespace yomber {

/// A UUID in its raw 16-byte form.
using UUID = std::array<std::uint8_t, 16>;

/// Stores a fresh random UUID.
void uuid_generate(UUID& out);
void uuid_copy(UUID& out, const UUID& in);
/// 0 when equal, else the sign of the byte-wise comparison.
[[nodiscard]] int uuid_compare(const UUID& left, const UUID& right);
/// Lower-case hexadecimal in the 8-4-4-4-12 form.
[[nodiscard]] std::string uuid_unparse(const UUID& uuid);

}  // namespace yomber
