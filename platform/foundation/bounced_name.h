#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

namespace yomber {

/// The longest name that the drive has, in bytes.
inline constexpr std::size_t kMaximumNameLength = 255;

/// "report.pdf" becomes "report 2.pdf", "report 3.pdf" and so on, until `isTaken` says no. The stem
/// is cut, at a character's boundary, where the result would be longer than `maximumLength`.
/// Answers the name itself when it is free and short enough. `firstNumber`: the number to begin
/// with, for callers who know that those before are taken.
[[nodiscard]] std::string bouncedName(std::string_view name,
                                      const std::function<bool(const std::string&)>& isTaken,
                                      std::size_t maximumLength = kMaximumNameLength,
                                      std::uint64_t firstNumber = 2);

}  // namespace yomber
