#pragma once

#include <string>
#include <string_view>

namespace yomber {

/// Besides letters and digits, what stands for itself in the path of a URL.
inline constexpr std::string_view kPlainInURLPaths = "-._~/!$&'()*+,=:@";

/// A text in which each byte is "%" and two upper-case hexadecimal digits, but letters and digits
/// of ASCII and what is in `plain`.
[[nodiscard]] std::string percentEncoded(std::string_view text, std::string_view plain);

}  // namespace yomber
