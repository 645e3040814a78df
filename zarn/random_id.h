#pragma once

#include <cstdint>

namespace yomber {

/// A random positive 63-bit number, at least kFirstIssuedID, from the kernel's generator.
/// Thread-safety: callable on any thread.
[[nodiscard]] std::uint64_t randomID();

}  // namespace yomber
