#pragma once

#include <cstddef>
#include <span>
#include <string>

namespace yomber {

/// Two lower-case digits for each byte.
[[nodiscard]] std::string hexadecimal(std::span<const std::byte> bytes);

}  // namespace yomber
