#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace yomber::testing {

/// Bytes that no other seed gives, without runs of zeros.
[[nodiscard]] std::string someContent(std::size_t size, std::uint32_t seed);
/// All bytes of a file; none when it cannot be read.
[[nodiscard]] std::string contentOf(const std::string& path);
/// What a file's blocks take. The test fails when there is no file.
[[nodiscard]] std::uint64_t bytesOnDisk(const std::string& path);

}  // namespace yomber::testing
